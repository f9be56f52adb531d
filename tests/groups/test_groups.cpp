// Group membership lookups (sec_idm_get_groups) against nss_wrapper
// databases: users and databases -> groups, or the failure reported once
// with empty outputs (getgrent_r errors are injected between the library
// and nss_wrapper); the allocation-failure sweep
// of a lookup; lookups from several threads; a thread cancelled mid-scan.
#include <dlfcn.h>
#include <grp.h>
#include <pwd.h>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <future>
#include <string>
#include <thread>
#include <vector>

#include "../unit/test_sweep.h"
#include "oxidm_state.h"

namespace {

using oxtest::num;

// From call number g_fail_at on, g_fail_times getgrent_r calls fail with
// g_fail_error (as the result, or as errno with -1); call g_block_at waits
// in a cancellation point until the thread is cancelled (or 30 s pass).
std::atomic<int> g_getgrent{0}, g_endgrent{0}, g_fail_at{0}, g_fail_times{0}, g_fail_error{0}, g_block_at{0};
std::atomic<bool> g_fail_errno{false}, g_blocked{false}, g_no_suggestion{false};

void reset_interposition() {
    for (auto *v : {&g_fail_at, &g_block_at, &g_getgrent, &g_endgrent}) v->store(0);
    g_blocked.store(false);
    g_no_suggestion.store(false);
}

}  // namespace

// The library is linked in statically, so its getgrent_r and endgrent bind
// here and go on to nss_wrapper's.  No ASan redzones in this frame: a
// cancellation unwinds through it without ASan's help.
extern "C" __attribute__((no_sanitize("address"))) int getgrent_r(struct group *__restrict entry,
                                                                   char *__restrict buffer, size_t size,
                                                                   struct group **__restrict result) {
    static const auto next = reinterpret_cast<int (*)(group *, char *, size_t, group **)>(dlsym(RTLD_NEXT, "getgrent_r"));
    const int call = g_getgrent.fetch_add(1) + 1, at = g_fail_at.load();
    if (at > 0 && call >= at && call < at + g_fail_times.load()) {
        *result = nullptr;
        if (!g_fail_errno.load()) return g_fail_error.load();
        errno = g_fail_error.load();
        return -1;
    }
    if (call == g_block_at.load()) {
        g_blocked.store(true);
        // Cancellation acts in pthread_testcancel only, never inside the sleep
        // (a sanitizer frame unwound by a cancellation loses track of locks).
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

// nss_wrapper answers a missing entry with ENOENT; glibc with 0 and no
// entry.  These hand the library glibc's answer, so that it is the one tested.
template <typename Entry, typename Key>
int glibc_lookup(const char *symbol, Key key, Entry *entry, char *buffer, size_t size, Entry **result) {
    const auto next = reinterpret_cast<int (*)(Key, Entry *, char *, size_t, Entry **)>(dlsym(RTLD_NEXT, symbol));
    const int e = next(key, entry, buffer, size, result);
    return e == ENOENT && *result == nullptr ? 0 : e;
}
extern "C" int getgrgid_r(gid_t gid, group *entry, char *buffer, size_t size, group **result) {
    return glibc_lookup("getgrgid_r", gid, entry, buffer, size, result);
}
extern "C" int getpwnam_r(const char *name, passwd *entry, char *buffer, size_t size, passwd **result) {
    return glibc_lookup("getpwnam_r", name, entry, buffer, size, result);
}

// While g_no_suggestion is set, the system suggests no lookup buffer sizes.
// The sanitizer runtimes call this before they are ready: no instrumentation.
extern "C" long __sysconf(int name);
extern "C" __attribute__((no_sanitize("thread", "address"))) long sysconf(int name) {
    if ((name == _SC_GETPW_R_SIZE_MAX || name == _SC_GETGR_R_SIZE_MAX) && g_no_suggestion.load()) return -1;
    return __sysconf(name);
}

extern "C" void endgrent(void) {
    static const auto next = reinterpret_cast<void (*)()>(dlsym(RTLD_NEXT, "endgrent"));
    g_endgrent.fetch_add(1);
    next();
}

namespace {

void write_db(const std::string &passwd, const std::string &group) {
    oxtest::write_file(std::getenv("NSS_WRAPPER_PASSWD"), passwd);
    oxtest::write_file(std::getenv("NSS_WRAPPER_GROUP"), group);
}

// Status and groups of `user` as one text; checks the output contract (count
// 0 and a null array unless groups come back, lengths with the NUL) and
// frees the result as a caller must.
std::string groups_of(const std::string &user) {
    idm_buffer name{static_cast<uint32_t>(user.size() + 1), const_cast<char *>(user.c_str())};
    uint32_t count = 0xdeadu;
    idm_buffer *list = reinterpret_cast<idm_buffer *>(uintptr_t{0x5a5a});
    std::string answer = std::to_string(sec_idm_get_groups(&name, &count, &list));
    if (answer != "0" || count == 0) {
        EXPECT_EQ(count, 0u);
        EXPECT_EQ(list, nullptr);
        return answer;
    }
    for (uint32_t i = 0; i < count; ++i) {
        EXPECT_TRUE(list[i].value != nullptr && list[i].length == std::strlen(list[i].value) + 1);
        answer += std::string(" ") + (list[i].value != nullptr ? list[i].value : "(null)");
        std::free(list[i].value);
    }
    std::free(list);
    return answer;
}

// Joins `thread` within 30 s; false when it still runs (a scan lock left held).
bool join_within(pthread_t thread, void **result) {
    timespec limit{};
    clock_gettime(CLOCK_REALTIME, &limit);
    limit.tv_sec += 30;
    return pthread_timedjoin_np(thread, result, &limit) == 0;
}

// Primary group id 4294967295 is -1: no primary group.
const std::string kPasswd =
    "alice:x:1000:100::/:/bin/sh\nbob:x:1001:200::/:/bin/sh\ncarol:x:1002:4294967295::/:/bin/sh\n"
    "dave:x:1003:300::/:/bin/sh\nerin:x:1004:4294967295::/:/bin/sh\nfrank:x:1005:999::/:/bin/sh\n"
    "gina:x:1006:504::/:/bin/sh\n";
// Enumeration order deliberately differs from name and id order.
const std::string kGroup =
    "zeta:x:500:alice,bob\nusers:x:100:alice,carol\ntwice:x:501:carol,alice,carol\ncase:x:502:Alice,ALICE,bob\n"
    "prefix:x:503:alicex,alic,xalice\nempty:x:504:\nstaff:x:200:\nalpha:x:505:alice,dave\nsolo:x:300:\n";
const std::string kAlice = "0 users zeta twice alpha", kFailed = sweep::st(idm::kGroupsUnavailable);

class Groups : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        ASSERT_NE(std::getenv("NSS_WRAPPER_GROUP"), nullptr) << "nss_wrapper is not preloaded: run through ctest";
        const std::string dir = std::getenv("NSS_WRAPPER_GROUP");
        mkdir(dir.substr(0, dir.rfind('/')).c_str(), 0755);
        reset_interposition();
        write_db(kPasswd, kGroup);
    }
};

TEST_F(Groups, UsersToGroupsOrTheFailure) {
    const long gr = sysconf(_SC_GETGR_R_SIZE_MAX), pw = sysconf(_SC_GETPW_R_SIZE_MAX);
    ASSERT_GT(gr, 0);
    ASSERT_GT(pw, 0);
    // Entries just over the buffers: there is no retry with a larger buffer.
    const std::string gecos(static_cast<size_t>(2 * pw), 'g');
    std::string members = "x";
    while (members.size() < static_cast<size_t>(gr)) members += ",member";
    const std::string small = "kim:x:1010:700::/:/bin/sh\nlee:x:1011:701::/:/bin/sh\n";
    const struct {
        const char *label, *user;
        std::string answer;
        int msgno = 0;  // the one report, with status kGroupsUnavailable
        std::string insert = "";
        int at = 0, times = 1;  // getgrent_r calls that fail (0: none)
        bool in_errno = false;
        int error = 0;
        std::string passwd = kPasswd, group = kGroup;
    } rows[] = {
        {"primary group also lists the user: listed once, first", "alice", kAlice},
        {"member names compare exactly (letter case, prefixes)", "bob", "0 staff zeta case"},
        {"primary id -1; a group naming the user twice is listed twice", "carol", "0 users twice twice"},
        {"primary group after the member group in the file", "dave", "0 solo alpha"},
        {"primary id -1 and no group: empty result", "erin", "0"},
        {"no group lists the user: primary only", "gina", "0 empty"},
        {"unknown user", "nobody", kFailed, idm::kMsg698, "nobody"},
        {"user names compare exactly", "Alice", kFailed, idm::kMsg698, "Alice"},
        {"primary group missing", "frank", kFailed, idm::kMsg699, "999"},
        {"user entry larger than its buffer", "hank", kFailed, idm::kMsg698, "hank", 0, 1, false, 0,
         "hank:x:1009:100:" + gecos + ":/:/bin/sh\n"},
        {"primary group entry larger than its buffer", "kim", kFailed, idm::kMsg699, "700", 0, 1, false, 0, small,
         "big:x:700:" + members + "\n"},
        {"scanned group larger than the buffer: ERANGE", "lee", kFailed, idm::kMsg700, std::to_string(ERANGE), 0, 1,
         false, 0, small, "own:x:701:\nlisted:x:702:lee\nbig:x:703:" + members + "\nlater:x:704:lee\n"},
        {"EINTR as result: repeated in place", "alice", kAlice, 0, "", 2, 3, false, EINTR},
        {"EINTR in errno with -1: repeated in place", "alice", kAlice, 0, "", 4, 2, true, EINTR},
        {"EINTR on the first call", "alice", kAlice, 0, "", 1, 1, false, EINTR},
        {"ENOENT as result ends the scan", "alice", "0 users zeta", 0, "", 3, 1, false, ENOENT},
        {"ENOENT in errno ends the scan", "alice", "0 users zeta", 0, "", 3, 1, true, ENOENT},
        {"-1 with errno 0 ends the scan", "alice", "0 users zeta", 0, "", 3, 1, true, 0},
        {"EIO as result fails", "alice", kFailed, idm::kMsg700, std::to_string(EIO), 3, 1, false, EIO},
        {"EIO in errno fails", "alice", kFailed, idm::kMsg700, std::to_string(EIO), 5, 1, true, EIO},
        {"EACCES on the first call fails", "alice", kFailed, idm::kMsg700, std::to_string(EACCES), 1, 1, false, EACCES},
    };
    for (const auto &row : rows) {
        SCOPED_TRACE(row.label);
        write_db(row.passwd, row.group);
        oxtest::clear_errors();
        reset_interposition();
        g_fail_errno.store(row.in_errno);
        g_fail_error.store(row.error);
        g_fail_times.store(row.times);
        g_fail_at.store(row.at);
        EXPECT_EQ(groups_of(row.user), row.answer);
        if (row.msgno == 0) {
            EXPECT_TRUE(oxtest::nothing_reported());
        } else {
            EXPECT_TRUE(oxtest::reported(idm::kGroupsUnavailable, row.msgno, {row.insert}));
            EXPECT_EQ(oxtest::reports_since_clear(), 1u);
        }
        // A scan (once the user and the primary group are known) closes the
        // enumeration once; the next scan is whole again.
        EXPECT_EQ(g_endgrent.load(), row.msgno == idm::kMsg698 || row.msgno == idm::kMsg699 ? 0 : 1);
        reset_interposition();
        if (row.at > 0) {
            EXPECT_EQ(groups_of("alice"), kAlice);
        }
    }
}

// Every allocation of a lookup for a user in 16 groups fails in turn
// (2650-654 of the lookup, status 6, empty outputs); the scan lock is free
// afterwards and the next lookup is whole.  The system suggests no buffer
// sizes, so the work buffers are the library's own large ones, on the heap.
TEST_F(Groups, SweepEveryAllocationOfALookup) {
    // Primary group g3000, then 16 groups among groups of others; the 7th
    // names the user twice.
    std::string group = "g3000:x:3000:many\n", right = "0 g3000";
    for (int i = 1; i <= 16; ++i) {
        const std::string name = "group-" + std::string(i, 'x');
        group += num("other", i) + num(":x:", 3100 + i) + ":someone\n" + name + num(":x:", 3000 + i) + ":a,many" +
                 (i == 7 ? ",many" : "") + ",b\n";
        right += " " + name + (i == 7 ? " " + name : "");
    }
    write_db("many:x:2000:3000::/:/bin/sh\nnone:x:2001:4294967295::/:/bin/sh\n", group);
    g_no_suggestion.store(true);
    ASSERT_EQ(groups_of("many"), right);  // once-controls outside the count
    std::vector<sweep::Row> rows = {
        {"any allocation", idm::kMsg654, "idm__native_get_groups", idm::kNoMemory, sweep::st(idm::kNoMemory), {right}}};
    sweep::Operation op{[](long) {}, [] { return groups_of("many"); }, right,
        [] {  // the scan lock is free: another thread's lookup completes
            auto other = std::async(std::launch::async, [] { return groups_of("none"); });
            if (other.wait_for(std::chrono::seconds(20)) != std::future_status::ready) {
                ADD_FAILURE() << "a lookup on another thread does not complete: the scan lock was left held";
                std::_Exit(1);  // the blocked thread cannot be joined
            }
            EXPECT_EQ(other.get(), "0");
        },
        [] {},
    };
    // User buffer, group buffer, the first element and its name, the scan
    // buffer, then each of 17 appends grows the array and copies a name.
    EXPECT_EQ(sweep::run(op, rows), 5 + 2 * 17);
}

// 400 groups; user t<u> is named by group g<k> when (k + 3u) % 7 == 0, twice
// when also k % 50 == 0; the primary group p<u> of every user sits mid-file
// and lists its own user too.  The enumeration position is process-wide:
// without serialised scans the threads would see parts of each other's.
TEST_F(Groups, ConcurrentLookupsEachSeeACompleteScan) {
    constexpr int kUsers = 8;
    std::string passwd, group;
    std::vector<std::string> expected(kUsers);
    for (int u = 0; u < kUsers; ++u) {
        passwd += num("t", u) + num(":x:", 3000 + u) + num(":", 10000 + u) + "::/:/bin/sh\n";
        expected[u] = num("0 p", u);
    }
    for (int k = 0; k < 400; ++k) {
        group += num("g", k) + num(":x:", 20000 + k) + ":noise";
        for (int u = 0; u < kUsers; ++u)
            for (int times = (k + 3 * u) % 7 != 0 ? 0 : k % 50 == 0 ? 2 : 1; times > 0; --times) {
                group += num(",t", u);
                expected[u] += num(" g", k);
            }
        group += "\n";
        for (int u = 0; k == 200 && u < kUsers; ++u) group += num("p", u) + num(":x:", 10000 + u) + num(":t", u) + "\n";
    }
    write_db(passwd, group);
    ASSERT_EQ(groups_of("t0"), expected[0]);  // nss_wrapper loads its files at the first lookup, unguarded
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int u = 0; u < kUsers; ++u)
        threads.emplace_back([&, u] {
            for (int i = 0; i < 40; ++i) wrong += groups_of(num("t", u)) != expected[u];
        });
    for (std::thread &t : threads) t.join();
    EXPECT_EQ(wrong.load(), 0) << "incomplete or wrong lists";
}

void *look_up_alice(void *) { return reinterpret_cast<void *>(groups_of("alice") != kAlice); }

TEST_F(Groups, CancelledScanReleasesTheLockAndClosesTheEnumeration) {
    g_block_at.store(3);
    pthread_t thread;
    ASSERT_EQ(pthread_create(&thread, nullptr, look_up_alice, nullptr), 0);
    while (!g_blocked.load()) usleep(1000);
    ASSERT_EQ(g_endgrent.load(), 0);
    pthread_cancel(thread);
    void *how = nullptr;
    ASSERT_TRUE(join_within(thread, &how));
    EXPECT_EQ(how, PTHREAD_CANCELED);
    EXPECT_EQ(g_endgrent.load(), 1) << "the enumeration was not closed";
    // The scan lock is free again and the next scan starts from the top.
    ASSERT_EQ(pthread_create(&thread, nullptr, look_up_alice, nullptr), 0);
    void *wrong = nullptr;
    if (!join_within(thread, &wrong)) {
        ADD_FAILURE() << "a lookup after the cancellation hangs: the scan lock was left held";
        std::_Exit(1);
    }
    EXPECT_EQ(wrong, nullptr);
}

}  // namespace
