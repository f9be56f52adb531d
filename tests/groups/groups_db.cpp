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

// The library is linked in statically, so its calls of getgrent_r and
// endgrent bind to these definitions, which pass on to the next one in the
// lookup order: nss_wrapper's (behind the ASan interceptor in that build).
namespace {

std::atomic<int> g_getgrent{0}, g_endgrent{0}, g_fail_at{0}, g_fail_times{0}, g_fail_errno{0}, g_fail_error{0};
std::atomic<int> g_block_at{0};
std::atomic<bool> g_blocked{false};

template <class Fn>
Fn next_definition(const char *name) {
    void *symbol = dlsym(RTLD_NEXT, name);
    if (symbol == nullptr) std::abort();
    return reinterpret_cast<Fn>(symbol);
}

}  // namespace

// No ASan redzones in this frame: a cancellation unwinds through it without
// ASan's help, and poisoned stack left behind would trip ASan's clean-up in
// the library's destructors.
extern "C" __attribute__((no_sanitize("address"))) int getgrent_r(struct group *__restrict entry,
                                                                   char *__restrict buffer, size_t size,
                                                                   struct group **__restrict result) {
    static const auto next = next_definition<int (*)(group *, char *, size_t, group **)>("getgrent_r");
    const int call = g_getgrent.fetch_add(1) + 1, at = g_fail_at.load();
    if (at > 0 && call >= at && call < at + g_fail_times.load()) {
        *result = nullptr;
        if (g_fail_errno.load() == 0) return g_fail_error.load();
        errno = g_fail_error.load();
        return -1;
    }
    if (call == g_block_at.load()) {
        g_blocked.store(true);
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
    static const auto next = next_definition<void (*)()>("endgrent");
    g_endgrent.fetch_add(1);
    next();
}

namespace groupstest {

void inject_getgrent_error(int at, int times, Style style, int error) {
    g_fail_errno.store(style == Style::kErrno);
    g_fail_error.store(error);
    g_fail_times.store(times);
    g_fail_at.store(at + g_getgrent.load());
}
void block_getgrent_at(int at) {
    g_blocked.store(false);
    g_block_at.store(at + g_getgrent.load());
}
bool block_entered() { return g_blocked.load(); }
int getgrent_calls() { return g_getgrent.load(); }
int endgrent_calls() { return g_endgrent.load(); }
void reset_interposition() {
    for (auto *v : {&g_fail_at, &g_block_at, &g_getgrent, &g_endgrent}) v->store(0);
    g_blocked.store(false);
}

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
        EXPECT_TRUE(list[i].value != nullptr && list[i].length == std::strlen(list[i].value) + 1);
        r.groups.emplace_back(list[i].value != nullptr ? list[i].value : "(null)");
        std::free(list[i].value);
    }
    std::free(list);
    return r;
}

void Fixture::SetUp() {
    oxtest::Test::SetUp();
    OXTEST_REQUIRE_NAMESPACE();
    void *wrapper = dlopen("libnss_wrapper.so", RTLD_LAZY | RTLD_NOLOAD);  // only asks whether it is loaded
    ASSERT_TRUE(wrapper != nullptr && std::getenv("NSS_WRAPPER_GROUP") != nullptr)
        << "libnss_wrapper.so is not preloaded: run this program through ctest";
    dlclose(wrapper);
    const std::string dir = std::getenv("NSS_WRAPPER_GROUP");
    mkdir(dir.substr(0, dir.rfind('/')).c_str(), 0755);
    reset_interposition();
}

}  // namespace groupstest
