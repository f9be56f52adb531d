// Identity mapping files on disk: the map file set, opening a file under its
// shared lock, the change test's state table and whole reading passes over
// the three candidate files.
#include <dirent.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstring>
#include <string>
#include <vector>

#include "harness.h"
#include "test_mpm.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"

// The stream opening of the library is reached through this definition in
// the test program: a test can make it fail with a chosen error number.
namespace {
std::atomic<int> g_fdopen_errno{0};
}
extern "C" FILE *fdopen(int fd, const char *mode) noexcept {
    if (int e = g_fdopen_errno.load()) {
        errno = e;
        return nullptr;
    }
    using Real = FILE *(*)(int, const char *);
    static Real real = reinterpret_cast<Real>(dlsym(RTLD_NEXT, "fdopen"));
    return real(fd, mode);
}

namespace {

using oxtest::kLocalMap;
using oxtest::kOptGlobalMap;
using oxtest::kVarGlobalMap;
using oxtest::reported;

std::string str(size_t n) { return std::to_string(n); }
std::string hex_of(const void *p) {
    char b[32];
    std::snprintf(b, sizeof b, "%x", static_cast<unsigned>(reinterpret_cast<uintptr_t>(p)));
    return b;
}

using oxtest::open_descriptors;

// A reading pass's inputs and outputs as the mapping walk keeps them.
struct Pass {
    idm_mapfile_set *set = nullptr;
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    ~Pass() {
        idm__native_release_entry_list(count, entries);
        idm__native_release_cachef(set);
    }
    int32_t read(const char *mechanism = "mechA") {
        return idm__native_read_mapfiles(mechanism, &set, &count, &entries);
    }
    std::vector<std::string> shown() const {
        std::vector<std::string> out;
        for (int32_t i = 0; i < count; ++i)
            out.push_back(std::string(entries[i].network_id) + "=" + (entries[i].local_id ? entries[i].local_id : "!"));
        return out;
    }
    uint32_t flags(int i) const { return set->flags[i]; }
};

using Shown = std::vector<std::string>;

class MapFiles : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        cux_set_clock(5000);
    }
    void TearDown() override {
        idm_test_fail_alloc(0);
        idm_test_on_secret_free(nullptr);
        g_fdopen_errno.store(0);
        oxtest::Test::TearDown();
    }
    static void local(int64_t mtime, const std::string &extra = "") {
        oxtest::write_file(kLocalMap, "# local\nmechA:l=L\nother:x=y\n" + extra, mtime);
    }
    static void var(int64_t mtime) { oxtest::write_file(kVarGlobalMap, "mechA:v=V\nmechA:!vd\n", mtime); }
    static void opt(int64_t mtime) { oxtest::write_file(kOptGlobalMap, "mechA:o=O\n", mtime); }
};

// ---------------------------------------------------------------------------
// Map file set
// ---------------------------------------------------------------------------

TEST_F(MapFiles, NewSetNamesTheThreeFilesInOrder) {
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    ASSERT_NE(set, nullptr);
    EXPECT_EQ(set->tag, 0x1dcde501u);
    ASSERT_EQ(set->count, 3);
    EXPECT_STREQ(set->names[0], "/var/ox/cfg/oxsec_map.local");
    EXPECT_STREQ(set->names[1], "/var/ox/cfg/oxsec_map.global");
    EXPECT_STREQ(set->names[2], "/opt/helvo/cfg/oxsec_map.global");
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(set->flags[i], 0u);
        EXPECT_EQ(set->mtimes[i], 0u);
        EXPECT_EQ(set->read_times[i], 0u);
    }
    EXPECT_TRUE(oxtest::nothing_reported());
    idm__native_release_cachef(set);
}

TEST_F(MapFiles, NullSetLocation) {
    oxtest::set_trace_levels(1, 1, 0, 0, 0);
    long before = idm_test_alloc_calls();
    EXPECT_EQ(idm__native_get_mapfile_names(nullptr), 23);
    EXPECT_TRUE(reported(23, idm::kMsg651, {"idm__native_get_mapfile_names", "1", "0"}));
    EXPECT_EQ(idm_test_alloc_calls(), before);
    const auto r = oxtest::trace_records();
    ASSERT_EQ(oxtest::trace_ids(), (std::vector<int>{13, 21, 16}));
    EXPECT_EQ(r[1].i32(0), 1);
    EXPECT_EQ(r[1].i32(1), 0);
}

TEST_F(MapFiles, SetAllocationFailures) {
    struct {
        const char *label;
        long fail;
        int site;
        size_t bytes;
    } cases[] = {
        {"record", 1, 367, sizeof(idm_mapfile_set)},
        {"names array", 2, 388, 3 * sizeof(char *)},
        {"path 0", 3, 420, std::strlen(kLocalMap) + 1},
        {"path 1", 4, 434, std::strlen(kVarGlobalMap) + 1},
        {"path 2", 5, 448, std::strlen(kOptGlobalMap) + 1},
        {"flags", 6, 475, 3 * sizeof(uint32_t)},
        {"mtimes", 7, 488, 3 * sizeof(uint32_t)},
        {"read_times", 8, 501, 3 * sizeof(uint32_t)},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::reset_trace();
        oxtest::set_trace_levels(0, 0, 0, 0, 1);
        idm_mapfile_set *set = reinterpret_cast<idm_mapfile_set *>(0x1234);
        idm_test_fail_alloc(c.fail);
        EXPECT_EQ(idm__native_get_mapfile_names(&set), 6);
        EXPECT_EQ(idm_test_alloc_fired(), 1);
        idm_test_fail_alloc(0);
        EXPECT_EQ(set, reinterpret_cast<idm_mapfile_set *>(0x1234));
        EXPECT_TRUE(reported(6, idm::kMsg654, {"idm__native_get_mapfile_names", str(c.bytes)}));
        const auto r = oxtest::trace_records();
        ASSERT_EQ(r.size(), 1u);
        EXPECT_EQ(r[0].id, 22);
        EXPECT_EQ(r[0].i32(0), c.site);
        EXPECT_EQ(r[0].i32(1), static_cast<int32_t>(c.bytes));
    }
}

TEST_F(MapFiles, SetTraceAtApiLevels) {
    idm_mapfile_set *set = nullptr;
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{13, 16}));
    idm__native_release_cachef(set);
    set = nullptr;
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    const auto r = oxtest::trace_records();
    ASSERT_EQ(oxtest::trace_ids(), (std::vector<int>{15, 16, 17, 17, 17}));
    EXPECT_EQ(r[0].u64(1), 0u);  // the location's content at entry
    EXPECT_EQ(r[4].i32(0), 2);
    EXPECT_EQ(r[4].text(1), kOptGlobalMap);
    idm__native_release_cachef(set);
}

std::vector<std::string> *g_freed = nullptr;
void note_freed(const void *p, size_t n) {
    const char *c = static_cast<const char *>(p);
    bool zero = true;
    for (size_t i = 0; i < n; ++i) zero = zero && c[i] == 0;
    g_freed->push_back(std::to_string(n) + (zero ? "z" : "!"));
}

TEST_F(MapFiles, ReleaseZeroesPathsAndArrays) {
    std::vector<std::string> freed;
    g_freed = &freed;
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    idm_test_on_secret_free(note_freed);
    idm__native_release_cachef(set);
    EXPECT_EQ(freed, (std::vector<std::string>{"28z", "29z", "32z", "24z", "12z", "12z", "12z"}));
}

TEST_F(MapFiles, ReleaseRecognisesTheMarkOnly) {
    // Without the mark nothing is touched (a stack record: freeing it would
    // be caught by the address sanitizer).
    idm_mapfile_set foreign{0x1dcde401u, 3, nullptr, nullptr, nullptr, nullptr};
    idm__native_release_cachef(&foreign);
    idm__native_release_cachef(nullptr);
    idm__thread_cleanup_cachef(nullptr);
    // With the mark, any version is released.
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    set->tag = 0x1dcde5ffu;
    idm__native_release_cachef(set);
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    idm__thread_cleanup_cachef(set);
    // A set whose creation stopped halfway: only what exists is freed.
    auto *half = static_cast<idm_mapfile_set *>(std::malloc(sizeof(idm_mapfile_set)));
    *half = idm_mapfile_set{0x1dcde501u, 3, static_cast<char **>(std::calloc(3, sizeof(char *))), nullptr, nullptr,
                            nullptr};
    half->names[0] = strdup("/only/one");
    idm__native_release_cachef(half);
}

// ---------------------------------------------------------------------------
// Opening one file
// ---------------------------------------------------------------------------

TEST_F(MapFiles, OpenTakesASharedLockAndAStream) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    int32_t fd = -1;
    FILE *stream = nullptr;
    ASSERT_EQ(idm__ready_mapfile(kLocalMap, &fd, &stream), 0);
    EXPECT_GE(fd, 0);
    ASSERT_NE(stream, nullptr);
    EXPECT_EQ(fileno(stream), fd);
    EXPECT_EQ(mssx_locks_held(), 1);
    EXPECT_NE(fcntl(fd, F_GETFD) & FD_CLOEXEC, 0);
    // Another reader shares the file.
    int32_t fd2 = -1;
    FILE *stream2 = nullptr;
    ASSERT_EQ(idm__ready_mapfile(kLocalMap, &fd2, &stream2), 0);
    EXPECT_EQ(mssx_locks_held(), 2);
    for (auto [d, s] : {std::pair{fd, stream}, std::pair{fd2, stream2}}) {
        sec__unlock_file(d, "test");
        std::fclose(s);
    }
}

TEST_F(MapFiles, OpenFailures) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    const std::string path = kLocalMap;
    struct {
        const char *label;
        int open_result;
        int lock_result;
        const char *file;
        int32_t status;
        int msgno;  // 0: nothing reported
        std::vector<std::string> inserts;
    } cases[] = {
        {"no such file", 0, 0, kVarGlobalMap, 37, 0, {}},
        {"forced: no such file", 21, 0, kLocalMap, 37, 0, {}},
        {"access denied", 12, 0, kLocalMap, 36, idm::kMsg653, {"idm__ready_mapfile", path}},
        {"no memory", 6, 0, kLocalMap, 36, idm::kMsg654, {"idm__ready_mapfile", "0"}},
        {"other open failure", 23, 0, kLocalMap, 23, idm::kMsg655, {"idm__open_mapfile", "23", "idm__ready_mapfile"}},
        {"unknown open result", 99, 0, kLocalMap, 23, idm::kMsg655, {"idm__open_mapfile", "99", "idm__ready_mapfile"}},
        {"lock not had in time", 0, 30, kLocalMap, 30, idm::kMsg656, {"idm__readlock_mapfile", path}},
        {"other lock failure", 0, 23, kLocalMap, 23, idm::kMsg655,
         {"idm__readlock_mapfile", "23", "idm__ready_mapfile"}},
    };
    const int descriptors = open_descriptors();
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::clear_errors();
        mssx_force_open(c.open_result ? c.file : nullptr, c.open_result);
        mssx_force_readlock(c.lock_result);
        int32_t fd = -7;
        FILE *stream = reinterpret_cast<FILE *>(0x77);
        EXPECT_EQ(idm__ready_mapfile(c.file, &fd, &stream), c.status);
        mssx_reset();
        mssx_set_lock_wait_ms(200);
        if (c.msgno == 0) EXPECT_TRUE(oxtest::nothing_reported());
        else EXPECT_TRUE(reported(c.status, c.msgno, c.inserts));
        EXPECT_EQ(fd, -7);
        EXPECT_EQ(stream, reinterpret_cast<FILE *>(0x77));
        EXPECT_EQ(mssx_locks_held(), 0);
        EXPECT_EQ(open_descriptors(), descriptors) << "descriptor left open";
    }
}

// Another process holds the file exclusively for longer than the wait.
TEST_F(MapFiles, FileLockedByAnotherProcess) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    int ready[2], done[2];
    ASSERT_EQ(pipe(ready), 0);
    ASSERT_EQ(pipe(done), 0);
    pid_t child = fork();
    if (child == 0) {
        close(ready[0]);
        close(done[1]);
        int fd = open(kLocalMap, O_RDWR);
        struct flock fl {};
        fl.l_type = F_WRLCK;
        fl.l_whence = SEEK_SET;
        char c = (fd >= 0 && fcntl(fd, F_OFD_SETLK, &fl) == 0) ? 'y' : 'n';
        if (write(ready[1], &c, 1) != 1) _exit(1);
        if (read(done[0], &c, 1) < 0) _exit(1);
        _exit(0);
    }
    close(ready[1]);
    close(done[0]);
    char c = 0;
    ASSERT_EQ(read(ready[0], &c, 1), 1);
    ASSERT_EQ(c, 'y');
    mssx_set_lock_wait_ms(100);
    const int descriptors = open_descriptors();
    int32_t fd = -1;
    FILE *stream = nullptr;
    EXPECT_EQ(idm__ready_mapfile(kLocalMap, &fd, &stream), 30);
    EXPECT_TRUE(reported(30, idm::kMsg656, {"idm__readlock_mapfile", kLocalMap}));
    EXPECT_EQ(open_descriptors(), descriptors);
    EXPECT_EQ(mssx_locks_held(), 0);
    close(done[1]);
    close(ready[0]);
    waitpid(child, nullptr, 0);
    // Released: the next open succeeds.
    ASSERT_EQ(idm__ready_mapfile(kLocalMap, &fd, &stream), 0);
    sec__unlock_file(fd, "test");
    std::fclose(stream);
}

TEST_F(MapFiles, StreamCannotBeOpened) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    const int descriptors = open_descriptors();
    g_fdopen_errno.store(EMFILE);
    int32_t fd = -1;
    FILE *stream = nullptr;
    EXPECT_EQ(idm__ready_mapfile(kLocalMap, &fd, &stream), 23);
    g_fdopen_errno.store(0);
    auto e = oxtest::last_error();
    ASSERT_EQ(e.inserts.size(), 3u);
    EXPECT_TRUE(reported(23, idm::kMsg657, {kLocalMap, e.inserts[1], str(EMFILE)}));
    int number = std::stoi(e.inserts[1]);
    EXPECT_GE(number, 0);
    EXPECT_EQ(fcntl(number, F_GETFD), -1) << "descriptor left open";
    EXPECT_EQ(mssx_locks_held(), 0);
    EXPECT_EQ(open_descriptors(), descriptors);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{30, 31, 34}));
}

TEST_F(MapFiles, OpenArgumentChecks) {
    int32_t fd = -1;
    FILE *stream = nullptr;
    const char *empty = "";
    struct {
        const char *label;
        const char *path;
        int32_t *fd;
        FILE **stream;
        std::vector<std::string> inserts;
    } cases[] = {
        {"null path", nullptr, &fd, &stream, {"idm__ready_mapfile", "1", "0"}},
        {"empty path", empty, &fd, &stream, {"idm__ready_mapfile", "1", hex_of(empty)}},
        {"null descriptor location", "/x", nullptr, &stream, {"idm__ready_mapfile", "2", "0"}},
        {"null stream location", "/x", &fd, nullptr, {"idm__ready_mapfile", "3", "0"}},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::reset_trace();
        oxtest::set_trace_levels(1, 0, 0, 0, 0);
        EXPECT_EQ(idm__ready_mapfile(c.path, c.fd, c.stream), 23);
        EXPECT_TRUE(reported(23, idm::kMsg651, c.inserts));
        const auto r = oxtest::trace_records();
        ASSERT_EQ(r.size(), 1u);
        EXPECT_EQ(r[0].id, 35);
        EXPECT_EQ(r[0].i32(0), std::stoi(c.inserts[1]));
    }
}

TEST_F(MapFiles, OpenFileCleanupHandler) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    idm__thread_cleanup_mapfile(nullptr);
    idm_open_mapfile file{};
    file.fd = -1;
    idm__thread_cleanup_mapfile(&file);  // nothing open: nothing to do
    std::strcpy(file.path, kLocalMap);
    ASSERT_EQ(idm__ready_mapfile(file.path, &file.fd, &file.stream), 0);
    const int32_t fd = file.fd;
    const FILE *stream = file.stream;
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    idm__thread_cleanup_mapfile(&file);
    EXPECT_EQ(mssx_locks_held(), 0);
    EXPECT_EQ(fcntl(fd, F_GETFD), -1);
    EXPECT_EQ(file.fd, -1);
    EXPECT_EQ(file.stream, nullptr);
    EXPECT_EQ(file.path[0], '\0');
    const auto r = oxtest::trace_records();
    ASSERT_EQ(oxtest::trace_ids(), std::vector<int>{87});
    EXPECT_EQ(r[0].text(0), kLocalMap);
    EXPECT_EQ(r[0].i32(1), fd);
    EXPECT_EQ(r[0].u64(2), reinterpret_cast<uint64_t>(stream));
}

// ---------------------------------------------------------------------------
// The change test of one file: the state table
// ---------------------------------------------------------------------------

constexpr uint32_t P = MF_PRESENT, U = MF_IN_USE, X = MF_REMOVED, R = MF_REREAD;

TEST_F(MapFiles, StateTableOfOneFile) {
    OXTEST_REQUIRE_NAMESPACE();
    // File 2 is tested, superseded by file 1, whose flags alone matter.
    struct {
        const char *label;
        int64_t file_mtime;  // -1: no file
        uint32_t flags, mtime, read_time, superseder_flags;
        int32_t result;
        uint32_t flags_after, mtime_after, read_time_after;
        std::vector<int> diag;
    } cases[] = {
        {"still absent", -1, X, 0, 0, 0, 1, 0, 0, 0, {75}},
        {"removed", -1, P | U | R, 100, 200, 0, 0, X, 0, 0, {76}},
        {"appeared, superseded", 100, 0, 0, 0, P, 1, P, 100, 0, {68, 71}},
        {"appeared", 100, X, 0, 0, 0, 0, P | U | R, 100, 0, {68, 69}},
        {"appeared, superseding file just removed", 100, 0, 0, 0, X, 0, P | U | R, 100, 0, {68, 69}},
        {"still present, superseded, unchanged", 100, P | U | R, 100, 200, P, 1, P, 100, 200, {72, 71, 75}},
        {"still present, superseded, read in its second", 100, P | U, 100, 100, P, 1, P, 100, 100, {72, 71}},
        {"still present, superseded, changed", 150, P, 100, 200, P, 1, P, 150, 200, {72, 71}},
        {"selected, changed", 150, P | U, 100, 200, 0, 0, P | U | R, 150, 200, {72, 73, 74}},
        {"selected, read in its second", 100, P | U, 100, 100, 0, 0, P | U | R, 100, 100, {72, 73, 70}},
        {"selected, unchanged", 100, P | U | R, 100, 200, 0, 1, P | U, 100, 200, {72, 73, 75}},
        {"selected again, superseding file removed", 100, P, 100, 200, X, 0, P | U | R, 100, 200, {72, 73, 75, 77}},
        {"selected, changed, superseding file removed", 150, P, 100, 200, X, 0, P | U | R, 150, 200, {72, 73, 74, 77}},
    };
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::remove_file(kOptGlobalMap);
        if (c.file_mtime >= 0) opt(c.file_mtime);
        set->flags[2] = c.flags;
        set->mtimes[2] = c.mtime;
        set->read_times[2] = c.read_time;
        set->flags[1] = c.superseder_flags;
        oxtest::reset_trace();
        oxtest::set_trace_levels(0, 0, 0, 0, 1);
        EXPECT_EQ(idm__native_test_mapfiles_v1(set, 2, 1), c.result);
        EXPECT_EQ(set->flags[2], c.flags_after);
        EXPECT_EQ(set->mtimes[2], c.mtime_after);
        EXPECT_EQ(set->read_times[2], c.read_time_after);
        EXPECT_EQ(set->flags[1], c.superseder_flags);
        EXPECT_EQ(oxtest::trace_ids(), c.diag);
        for (const auto &r : oxtest::trace_records()) EXPECT_EQ(r.text(0), kOptGlobalMap) << r.id;
    }
    idm__native_release_cachef(set);
}

TEST_F(MapFiles, FailedTimeQueryChangesNothing) {
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    set->flags[0] = P | U;
    set->mtimes[0] = 100;
    oxtest::set_trace_levels(0, 1, 0, 0, 1);
    mssx_force_time(kLocalMap, 23);
    EXPECT_EQ(idm__native_test_mapfiles_v1(set, 0, -1), 23);
    EXPECT_EQ(set->flags[0], P | U);
    EXPECT_EQ(set->mtimes[0], 100u);
    EXPECT_EQ(oxtest::trace_ids(), std::vector<int>{67});  // no exit record
    EXPECT_TRUE(oxtest::nothing_reported());
    idm__native_release_cachef(set);
}

TEST_F(MapFiles, SetTestArguments) {
    oxtest::set_trace_levels(1, 0, 0, 0, 0);
    EXPECT_EQ(idm__native_test_mapfiles(nullptr), 1);
    EXPECT_TRUE(reported(4, idm::kMsg651, {"idm__native_test_mapfiles", "1", "0"}));
    EXPECT_EQ(oxtest::trace_ids(), std::vector<int>{81});

    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    oxtest::reset_trace();
    oxtest::set_trace_levels(1, 0, 0, 0, 0);
    set->tag = 0x1dcde502u;
    set->flags[0] = P | U | R;
    set->flags[2] = P | U;
    EXPECT_EQ(idm__native_test_mapfiles(set), 1);
    EXPECT_TRUE(reported(23, idm::kMsg655, {"idm__native_test_mapfiles", "23", "[ignored]"}));
    EXPECT_EQ(set->flags[0], P);
    EXPECT_EQ(set->flags[2], P);
    const auto r = oxtest::trace_records();
    ASSERT_EQ(oxtest::trace_ids(), std::vector<int>{82});
    EXPECT_EQ(r[0].u64(0), 0u);  // a 4-byte item
    EXPECT_EQ(r[0].i32(0), 2);
    idm__native_release_cachef(set);
}

// A failed time query ends the set test: every file is deselected and the
// result says whether an earlier file had changed.
TEST_F(MapFiles, FailedTimeQueryEndsTheSetTest) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    opt(1000);
    mssx_force_time(kVarGlobalMap, 23);
    Pass pass;
    EXPECT_EQ(pass.read(), 0);  // the local file had appeared ...
    EXPECT_EQ(pass.count, 0);   // ... but nothing is selected any more
    EXPECT_EQ(pass.flags(0), P);
    EXPECT_EQ(pass.flags(2), 0u);  // never tested
    EXPECT_TRUE(oxtest::nothing_reported());
    mssx_force_time(nullptr, 0);
    // Not retried by itself: unchanged files stay unread until one changes.
    EXPECT_EQ(pass.read(), 0);  // the /opt file appears now
    EXPECT_EQ(pass.shown(), (Shown{"l=L", "o=O"}));

    mssx_force_time(kLocalMap, 23);
    EXPECT_EQ(pass.read(), 1);  // failure on the first file: nothing changed before it
    EXPECT_EQ(pass.flags(0), P);
    EXPECT_EQ(pass.flags(2), P);
    EXPECT_EQ(pass.shown(), (Shown{"l=L", "o=O"}));
}

TEST_F(MapFiles, SetTestDiagnosticRecords) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    EXPECT_EQ(idm__native_test_mapfiles(set), 0);
    std::vector<oxtest::TraceRecord> state;
    for (const auto &r : oxtest::trace_records())
        if (r.id == 83) state.push_back(r);
    ASSERT_EQ(state.size(), 3u);
    EXPECT_EQ(state[0].i32(0), 0);
    EXPECT_EQ(state[0].text(1), kLocalMap);
    const int32_t expected[] = {1, 1, 0, 1};  // present, in use, removed, reread
    for (int i = 0; i < 4; ++i) EXPECT_EQ(state[0].i32(2 + i), expected[i]);
    EXPECT_EQ(state[0].i32(6), 1000);
    EXPECT_EQ(state[0].i32(7), 0);
    EXPECT_EQ(state[2].text(1), kOptGlobalMap);
    EXPECT_EQ(state[2].i32(2), 0);
    idm__native_release_cachef(set);
}

// ---------------------------------------------------------------------------
// Reading passes over the candidate files
// ---------------------------------------------------------------------------

TEST_F(MapFiles, NoFileAtAll) {
    OXTEST_REQUIRE_NAMESPACE();
    Pass pass;
    EXPECT_EQ(pass.read(), 1);
    ASSERT_NE(pass.set, nullptr);
    EXPECT_EQ(pass.count, 0);
    EXPECT_EQ(pass.entries, nullptr);
    EXPECT_TRUE(oxtest::nothing_reported());
    EXPECT_EQ(pass.read(), 1);
}

TEST_F(MapFiles, OnlyTheOptGlobalFileThenTheVarOneAppears) {
    OXTEST_REQUIRE_NAMESPACE();
    opt(1000);
    Pass pass;
    ASSERT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.shown(), (Shown{"o=O"}));
    EXPECT_EQ(pass.flags(2), P | U);
    EXPECT_EQ(pass.set->read_times[2], 5000u);
    EXPECT_EQ(pass.read(), 1);

    local(1100);
    var(1200);
    ASSERT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.shown(), (Shown{"l=L", "v=V", "vd=!"}));
    EXPECT_EQ(pass.flags(1), P | U);
    EXPECT_EQ(pass.flags(2), P);
    EXPECT_EQ(pass.read(), 1);
}

TEST_F(MapFiles, BothGlobalFilesThenTheVarOneDeleted) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    var(1000);
    opt(1000);
    Pass pass;
    ASSERT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.shown(), (Shown{"l=L", "v=V", "vd=!"}));
    EXPECT_EQ(pass.flags(2), P);

    oxtest::remove_file(kVarGlobalMap);
    cux_set_clock(6000);
    ASSERT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.shown(), (Shown{"l=L", "o=O"}));
    EXPECT_EQ(pass.flags(1), X);
    EXPECT_EQ(pass.flags(2), P | U);
    EXPECT_EQ(pass.set->read_times[2], 6000u);
    // The removal lasts one test.
    EXPECT_EQ(pass.read(), 1);
    EXPECT_EQ(pass.flags(1), 0u);
}

TEST_F(MapFiles, SelectedFileDeleted) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    var(1000);
    Pass pass;
    ASSERT_EQ(pass.read(), 0);
    oxtest::remove_file(kLocalMap);
    ASSERT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.shown(), (Shown{"v=V", "vd=!"}));
    EXPECT_EQ(pass.read(), 1);
}

TEST_F(MapFiles, EveryFileDeletedGivesAnEmptyListOnce) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    var(1000);
    opt(1000);
    Pass pass;
    ASSERT_EQ(pass.read(), 0);
    for (const char *p : {kLocalMap, kVarGlobalMap, kOptGlobalMap}) oxtest::remove_file(p);
    ASSERT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.count, 0);
    EXPECT_EQ(pass.entries, nullptr);
    EXPECT_EQ(pass.read(), 1);
}

TEST_F(MapFiles, TouchingOnlyTheSupersededFile) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    var(1000);
    opt(1000);
    Pass pass;
    ASSERT_EQ(pass.read(), 0);
    oxtest::set_mtime(kOptGlobalMap, 3000);
    EXPECT_EQ(pass.read(), 1);
    oxtest::remove_file(kOptGlobalMap);
    ASSERT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.shown(), (Shown{"l=L", "v=V", "vd=!"}));
}

// A file parsed in the second of its last change is read again at every
// request until a parse happens in a later second.
TEST_F(MapFiles, SameSecondReread) {
    OXTEST_REQUIRE_NAMESPACE();
    cux_set_clock(1000);
    local(1000);
    Pass pass;
    ASSERT_EQ(pass.read(), 0);
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    ASSERT_EQ(pass.read(), 0);
    auto ids = oxtest::trace_ids();
    EXPECT_NE(std::find(ids.begin(), ids.end(), 70), ids.end());
    cux_set_clock(1001);
    ASSERT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.set->read_times[0], 1001u);
    EXPECT_EQ(pass.read(), 1);
    EXPECT_EQ(pass.shown(), (Shown{"l=L"}));
}

TEST_F(MapFiles, RewrittenFileIsReadWithTheOthers) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    var(1000);
    Pass pass;
    ASSERT_EQ(pass.read(), 0);
    local(1001, "mechA:new=N\n");
    ASSERT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.shown(), (Shown{"l=L", "new=N", "v=V", "vd=!"}));
    EXPECT_EQ(pass.read(), 1);
    // Another mechanism gets its own entries from the same files.
    Pass other;
    ASSERT_EQ(other.read("other"), 0);
    EXPECT_EQ(other.shown(), (Shown{"x=y"}));
}

TEST_F(MapFiles, ReadFailureLeavesTheCallersListUntouched) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    var(1000);
    Pass pass;
    ASSERT_EQ(pass.read(), 0);
    idm_mapfile_entry *before = pass.entries;

    var(1001);
    cux_set_clock(6000);
    mssx_force_open(kVarGlobalMap, 12);
    EXPECT_EQ(pass.read(), 36);
    EXPECT_TRUE(reported(36, idm::kMsg653, {"idm__ready_mapfile", kVarGlobalMap}));
    EXPECT_EQ(pass.entries, before);
    EXPECT_EQ(pass.shown(), (Shown{"l=L", "v=V", "vd=!"}));
    EXPECT_EQ(pass.set->read_times[0], 6000u);  // parsed before the failure
    EXPECT_EQ(pass.set->read_times[1], 1001u) << "marked to be read again";
    EXPECT_EQ(mssx_locks_held(), 0);
    // A failed file is read again at the next request: the failure stands
    // until the file can be read.
    EXPECT_EQ(pass.read(), 36);
    mssx_force_open(nullptr, 0);
    EXPECT_EQ(pass.read(), 0);
    EXPECT_EQ(pass.shown(), (Shown{"l=L", "v=V", "vd=!"}));
}

TEST_F(MapFiles, FileVanishedBeforeOpening) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    mssx_force_open(kLocalMap, 21);
    Pass pass;
    EXPECT_EQ(pass.read(), 37);
    EXPECT_TRUE(oxtest::nothing_reported());
    EXPECT_EQ(pass.count, 0);
}

// An allocation failure in the middle of a pass releases what it parsed.
TEST_F(MapFiles, AllocationFailuresDuringAPass) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000, "mechA:l2=L2\n");
    var(1000);
    for (long n = 1;; ++n) {
        SCOPED_TRACE(n);
        Pass pass;
        oxtest::clear_errors();
        idm_test_fail_alloc(n);
        int32_t status = pass.read();
        bool fired = idm_test_alloc_fired() != 0;
        idm_test_fail_alloc(0);
        if (!fired) {
            ASSERT_EQ(status, 0);
            EXPECT_EQ(pass.shown(), (Shown{"l=L", "l2=L2", "v=V", "vd=!"}));
            break;
        }
        ASSERT_TRUE(status == 6 || status == 23) << status;
        EXPECT_EQ(oxtest::reports_since_clear(), 1u);
        EXPECT_EQ(pass.count, 0);
        EXPECT_EQ(pass.entries, nullptr);
        EXPECT_EQ(mssx_locks_held(), 0);
        if (n == 1) {
            EXPECT_EQ(pass.set, nullptr);
        }
        ASSERT_LT(n, 100);
    }
}

TEST_F(MapFiles, PassArgumentChecks) {
    idm_mapfile_set *set = nullptr;
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    const char *empty = "";
    struct {
        const char *label;
        const char *mechanism;
        idm_mapfile_set **set;
        int32_t *count;
        idm_mapfile_entry **entries;
        std::vector<std::string> inserts;
    } cases[] = {
        {"null mechanism", nullptr, &set, &count, &entries, {"idm__native_read_mapfiles", "1", "0"}},
        {"empty mechanism", empty, &set, &count, &entries, {"idm__native_read_mapfiles", "1", hex_of(empty)}},
        {"null set location", "m", nullptr, &count, &entries, {"idm__native_read_mapfiles", "2", "0"}},
        {"null count location", "m", &set, nullptr, &entries, {"idm__native_read_mapfiles", "3", "0"}},
        {"null array location", "m", &set, &count, nullptr, {"idm__native_read_mapfiles", "4", "0"}},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::reset_trace();
        oxtest::set_trace_levels(1, 1, 0, 0, 0);
        EXPECT_EQ(idm__native_read_mapfiles(c.mechanism, c.set, c.count, c.entries), 23);
        EXPECT_TRUE(reported(23, idm::kMsg651, c.inserts));
        EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{4, 6, 5}));
    }
    EXPECT_EQ(set, nullptr);
}

TEST_F(MapFiles, PassTraceRecords) {
    OXTEST_REQUIRE_NAMESPACE();
    local(1000);
    Pass pass;
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    ASSERT_EQ(pass.read(), 0);
    auto r = oxtest::trace_records();
    ASSERT_GE(r.size(), 3u);
    EXPECT_EQ(r.front().id, 4);  // a bare id at level 8 too
    EXPECT_EQ(r[1].id, 8);
    EXPECT_EQ(r[1].text(0), "mechA");
    EXPECT_EQ(r[1].u64(2), 0u);  // no set yet
    const auto &exit = r.back();
    EXPECT_EQ(exit.id, 12);
    EXPECT_EQ(exit.i32(0), 0);
    EXPECT_EQ(exit.u64(2), reinterpret_cast<uint64_t>(pass.set));
    EXPECT_EQ(exit.i32(4), 1);

    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    local(1001);
    ASSERT_EQ(pass.read(), 0);
    std::vector<std::string> parsed;
    for (const auto &rec : oxtest::trace_records())
        if (rec.id == 9) parsed.push_back(rec.text(0));
    EXPECT_EQ(parsed, (std::vector<std::string>{kLocalMap}));
}

// A descriptor that is no regular file is refused by the library itself,
// whatever the platform library checked: no read, no lock left, and the
// next request tries again.
TEST_F(MapFiles, ADescriptorOfNoRegularFileIsRefusedBeforeAnyRead) {
    OXTEST_REQUIRE_NAMESPACE();
    ASSERT_EQ(mkfifo(kLocalMap, 0644), 0);
    mssx_accept_any_file(1);
    Pass pass;
    for (int request = 0; request < 2; ++request) {
        oxtest::clear_errors();
        EXPECT_EQ(pass.read(), 23);
        EXPECT_TRUE(reported(23, idm::kMsg655, {"idm__open_mapfile", "22", "idm__ready_mapfile"}));
        EXPECT_EQ(mssx_locks_held(), 0);
    }
}

// A file that changes while it is parsed is parsed again; one that keeps
// changing fails the pass after three attempts (2650-655, code 11).
std::atomic<int> g_touches_left{0};
void touch_while_parsing(int id) {
    if (id == 43 && g_touches_left.load() > 0 && g_touches_left.fetch_sub(1) > 0)
        oxtest::set_mtime(kLocalMap, 5000 + g_touches_left.load());
}

TEST_F(MapFiles, AFileChangedWhileParsedIsParsedAgainThenRefused) {
    OXTEST_REQUIRE_NAMESPACE();
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    trx_on_record(touch_while_parsing);
    // Every line parsed touches the file while touches are left; the file
    // has two lines: 2 touches move one parse, 6 move all three.
    const struct {
        int touches;
        int32_t status;
    } cases[] = {{2, 0}, {6, 23}};
    for (const auto &c : cases) {
        SCOPED_TRACE(c.touches);
        oxtest::write_file(kLocalMap, "mechA:a=b\nmechA:c=d\n", 1000 + c.touches);
        g_touches_left.store(c.touches);
        Pass pass;
        oxtest::clear_errors();
        EXPECT_EQ(pass.read(), c.status);
        if (c.status == 0) EXPECT_EQ(pass.shown(), (Shown{"a=b", "c=d"})) << "each entry once";
        else EXPECT_TRUE(reported(23, idm::kMsg655, {"idm__parse_mapfile", "11", "idm__native_read_mapfiles"}));
        EXPECT_EQ(mssx_locks_held(), 0);
    }
    trx_on_record(nullptr);
}

}  // namespace
