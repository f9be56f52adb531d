#include "groups_db.h"

#include <dlfcn.h>
#include <grp.h>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "oxidm.h"

// ---------------------------------------------------------------------------
// Interposition.  The library is linked into this program statically, so its
// calls of getgrent_r and endgrent bind to the definitions below, which pass
// on to the next definition in the lookup order: nss_wrapper's (behind the
// ASan runtime's interceptor in the ASan build).
// ---------------------------------------------------------------------------

namespace {

std::atomic<int> g_getgrent_calls{0};
std::atomic<int> g_endgrent_calls{0};
std::atomic<int> g_fail_at{0};
std::atomic<int> g_fail_times{0};
std::atomic<int> g_fail_style{0};
std::atomic<int> g_fail_error{0};
std::atomic<int> g_block_at{0};
std::atomic<bool> g_block_entered{false};

template <class Fn>
Fn next_definition(const char *name) {
    void *symbol = dlsym(RTLD_NEXT, name);
    if (symbol == nullptr) std::abort();
    Fn fn;
    std::memcpy(&fn, &symbol, sizeof fn);
    return fn;
}

}  // namespace

// No ASan redzones in this frame: a cancellation unwinds through it without
// ASan's help, and poisoned stack left behind would trip ASan's own clean-up
// in the library's destructors.
extern "C" __attribute__((no_sanitize("address"))) int getgrent_r(struct group *__restrict entry,
                                                                   char *__restrict buffer, size_t size,
                                                                   struct group **__restrict result) {
    using Fn = int (*)(struct group *, char *, size_t, struct group **);
    static const Fn next = next_definition<Fn>("getgrent_r");
    int call = g_getgrent_calls.fetch_add(1) + 1;
    int at = g_fail_at.load();
    if (at > 0 && call >= at && call < at + g_fail_times.load()) {
        *result = nullptr;
        if (g_fail_style.load() == static_cast<int>(groupstest::Style::kResult)) return g_fail_error.load();
        errno = g_fail_error.load();
        return -1;
    }
    if (call == g_block_at.load()) {
        g_block_entered.store(true);
        // Cancellation acts in pthread_testcancel only, never inside the
        // sleep: a sanitizer's interceptor frame that a cancellation unwinds
        // through loses track of the thread's later lock operations.
        for (int i = 0; i < 30000; ++i) {
            pthread_testcancel();
            int state = 0;
            pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &state);
            usleep(1000);
            pthread_setcancelstate(state, nullptr);
        }
    }
    return next(entry, buffer, size, result);
}

extern "C" void endgrent(void) {
    static const auto next = next_definition<void (*)(void)>("endgrent");
    g_endgrent_calls.fetch_add(1);
    next();
}

namespace groupstest {

void inject_getgrent_error(int at, int times, Style style, int error) {
    g_fail_style.store(static_cast<int>(style));
    g_fail_error.store(error);
    g_fail_times.store(times);
    g_fail_at.store(at + g_getgrent_calls.load());
}

void block_getgrent_at(int at) {
    g_block_entered.store(false);
    g_block_at.store(at + g_getgrent_calls.load());
}

bool block_entered() { return g_block_entered.load(); }
int getgrent_calls() { return g_getgrent_calls.load(); }
int endgrent_calls() { return g_endgrent_calls.load(); }

void reset_interposition() {
    g_fail_at.store(0);
    g_block_at.store(0);
    g_block_entered.store(false);
    g_getgrent_calls.store(0);
    g_endgrent_calls.store(0);
}

// ---------------------------------------------------------------------------
// Database files
// ---------------------------------------------------------------------------

namespace {

std::string g_dir;  // removed at exit when it is not in the private /tmp

void remove_db_dir() {
    std::string passwd = g_dir + "/passwd", group = g_dir + "/group";
    unlink(passwd.c_str());
    unlink(group.c_str());
    rmdir(g_dir.c_str());
}

// nss_wrapper reads NSS_WRAPPER_PASSWD and NSS_WRAPPER_GROUP once, at its
// first lookup, and reloads a file whenever it changed.  Inside the private
// namespace /tmp belongs to this process, so the fixed paths set by ctest
// are private; elsewhere (no namespace) the process makes its own directory
// and points the variables at it before the first lookup.
void prepare_db_dir() {
    if (!g_dir.empty()) return;
    const char *passwd = std::getenv("NSS_WRAPPER_PASSWD");
    const char *group = std::getenv("NSS_WRAPPER_GROUP");
    if (oxtest::in_private_namespace() && passwd != nullptr && group != nullptr) {
        std::string dir = std::string(passwd).substr(0, std::string(passwd).rfind('/'));
        mkdir(dir.c_str(), 0755);
        g_dir = dir;
        return;
    }
    char tmpl[] = "/tmp/oxidm-groups-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) std::abort();
    g_dir = tmpl;
    setenv("NSS_WRAPPER_PASSWD", (g_dir + "/passwd").c_str(), 1);
    setenv("NSS_WRAPPER_GROUP", (g_dir + "/group").c_str(), 1);
    std::atexit(remove_db_dir);
}

}  // namespace

void write_db(const std::string &passwd, const std::string &group) {
    oxtest::write_file(std::getenv("NSS_WRAPPER_PASSWD"), passwd);
    oxtest::write_file(std::getenv("NSS_WRAPPER_GROUP"), group);
}

Result get_groups(const char *user) {
    idm_buffer name{static_cast<uint32_t>(std::strlen(user) + 1), const_cast<char *>(user)};
    uint32_t count = 0xdeadu;
    idm_buffer *list = reinterpret_cast<idm_buffer *>(uintptr_t{0x5a5a});
    Result r{sec_idm_get_groups(&name, &count, &list), {}};
    if (r.status != 0 || count == 0) {
        EXPECT_EQ(count, 0u);
        EXPECT_EQ(list, nullptr);
        return r;
    }
    for (uint32_t i = 0; i < count; ++i) {
        EXPECT_NE(list[i].value, nullptr);
        if (list[i].value == nullptr) continue;
        EXPECT_EQ(list[i].length, std::strlen(list[i].value) + 1) << list[i].value;
        r.groups.emplace_back(list[i].value);
        std::free(list[i].value);
    }
    std::free(list);
    return r;
}

void Fixture::SetUp() {
    oxtest::Test::SetUp();
    // RTLD_NOLOAD: only asks whether the preloaded library is there.
    void *wrapper = dlopen("libnss_wrapper.so", RTLD_LAZY | RTLD_NOLOAD);
    ASSERT_NE(wrapper, nullptr) << "libnss_wrapper.so is not preloaded: run this program through ctest";
    dlclose(wrapper);
    prepare_db_dir();
    reset_interposition();
}

}  // namespace groupstest
