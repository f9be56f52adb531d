// A C++ program built against the installed packages with find_package(oxidm):
// loads the installed sample plug-in "princ" from oxidm_MPM_DIR and asks the
// library.  Run where /var/ox/cfg holds the example configuration; exits 0
// when every answer is the expected one.
#include <dlfcn.h>

#include <cstdio>
#include <cstdlib>
#include <string_view>

#include <oxidm.h>

int main() {
    void *plugin = dlopen(OXIDM_MPM_DIR "/liboxmpm_principal.so", RTLD_NOW);
    auto reg = plugin ? reinterpret_cast<int32_t (*)()>(dlsym(plugin, "oxmpm_principal_register")) : nullptr;
    bool bad = !reg || reg() != IDM_OK;
    struct Row {
        const char *identity;
        std::string_view local;  // empty: no local identity
    };
    for (const Row &row : {Row{"joe/admin@EXAMPLE.ORG", "root"}, Row{"mallory@EXAMPLE.ORG", ""}}) {
        idm_buffer local{0, nullptr};
        int32_t status = sec_idm_map_identity("princ", row.identity, &local);
        std::string_view got = local.value ? local.value : "";
        if (status != IDM_OK || got != row.local) {
            std::printf("map princ %s: status %d, \"%.*s\"\n", row.identity, status, int(got.size()), got.data());
            bad = true;
        }
        std::free(local.value);
    }
    if (sec_is_in_active_cluster("node1.example.org") != 1 || sec_is_in_active_cluster("node3") != 0) bad = true;
    std::puts(bad ? "C++ consumer: wrong answers" : "C++ consumer: ok");
    return bad;
}
