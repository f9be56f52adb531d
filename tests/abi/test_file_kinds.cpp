// A local map file path that is not a regular file, through the shipped
// library, with a global file that would grant anyone: the mapping neither
// blocks nor grants, and the failure stands at the next call (never "no
// match").  Each row runs in a child process under an alarm, so a call that
// blocks or spins fails its row instead of stalling the suite.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include "harness.h"
#include "oxidm.h"
#include "oxmpm_principal.h"
#include "oxseclib_msg.h"

namespace {

const struct Row {
    const char *label;
    int (*make)(const char *path);
} kRows[] = {
    {"FIFO", [](const char *p) { return mkfifo(p, 0644); }},
    {"directory", [](const char *p) { return mkdir(p, 0755); }},
    {"link to /dev/zero", [](const char *p) { return symlink("/dev/zero", p); }},
    {"link to nothing", [](const char *p) { return symlink("/nowhere", p); }},
    // Kernel files: regular, of size 0.
    {"a read error", [](const char *p) { return symlink("/proc/self/mem", p); }},         // reads fail with EIO
    {"a file that never ends", [](const char *p) { return symlink("/proc/self/pagemap", p); }},
};

void probe(void *) {
    alarm(5);
    for (int call = 0; call < 2; ++call) {
        cux_clear_error();
        idm_buffer local{};
        const int32_t status = sec_idm_map_identity("princ", "alice@EX", &local);
        const bool granted = local.value != nullptr;
        std::free(local.value);
        if (granted || status != IDM_E_INTERNAL || cux_error_msgno() != idm::kMsg655) _exit(1 + call);
    }
    _exit(0);
}

class FileKinds : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        ASSERT_EQ(oxmpm_principal_register(), 0);
    }
};

TEST_F(FileKinds, NoMappingBlocksOrGrantsOnALocalFileThatIsNoRegularFile) {
    for (const Row &row : kRows) {
        SCOPED_TRACE(row.label);
        oxtest::fresh_config_dirs();
        oxtest::write_file(oxtest::kVarGlobalMap, "princ:*@EX=granted\n");
        ASSERT_EQ(row.make(oxtest::kLocalMap), 0);
        EXPECT_EQ(oxtest::run_in_child(probe, nullptr), 0) << "128+14: it did not return";
    }
}

}  // namespace
