// Map files on disk: opening one under its shared lock, the change test of
// one file, and reading passes over the three candidate files as they
// appear, change, vanish or fail.  A failure never leaves a descriptor or a
// lock behind and never hands over a partial list.
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "harness.h"
#include "test_mpm.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"

// The library's stream opening goes through this definition: a test makes
// it fail with a chosen error number (the trace walk uses it too).
std::atomic<int> g_fdopen_errno{0};
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

class MapFiles : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        cux_set_clock(5000);
    }
    void TearDown() override {
        g_fdopen_errno.store(0);
        trx_on_record(nullptr);
        oxtest::Test::TearDown();
    }
};

using enum idm::Status;
constexpr uint32_t P = MF_PRESENT, U = MF_IN_USE, X = MF_REMOVED, R = MF_REREAD;

// The change test of file 2, superseded by file 1 (whose flags alone
// matter).  The trace ids witness the branch taken.
TEST_F(MapFiles, ChangeTestOfOneFile) {
    const struct {
        const char *label;
        int64_t file_mtime;  // -1: no file
        uint32_t flags, mtime, read_time, superseder_flags;
        int32_t result;
        uint32_t flags_after, mtime_after, read_time_after;
        std::vector<int> diag;
    } cases[] = {
        {"still absent", -1, X, 0, 0, 0, kUnchanged, 0, 0, 0, {75}},
        {"removed", -1, P | U | R, 100, 200, 0, kOk, X, 0, 0, {76}},
        {"appeared, superseded", 100, 0, 0, 0, P, kUnchanged, P, 100, 0, {68, 71}},
        {"appeared", 100, X, 0, 0, 0, kOk, P | U | R, 100, 0, {68, 69}},
        {"appeared, superseding file just removed", 100, 0, 0, 0, X, kOk, P | U | R, 100, 0, {68, 69}},
        {"superseded, unchanged", 100, P | U | R, 100, 200, P, kUnchanged, P, 100, 200, {72, 71, 75}},
        {"superseded, read in its second", 100, P | U, 100, 100, P, kUnchanged, P, 100, 100, {72, 71}},
        {"superseded, changed", 150, P, 100, 200, P, kUnchanged, P, 150, 200, {72, 71}},
        {"selected, changed", 150, P | U, 100, 200, 0, kOk, P | U | R, 150, 200, {72, 73, 74}},
        {"selected, read in its second", 100, P | U, 100, 100, 0, kOk, P | U | R, 100, 100, {72, 73, 70}},
        {"selected, unchanged", 100, P | U | R, 100, 200, 0, kUnchanged, P | U, 100, 200, {72, 73, 75}},
        {"selected again, superseding file removed", 100, P, 100, 200, X, kOk, P | U | R, 100, 200, {72, 73, 75, 77}},
        {"changed, superseding file removed", 150, P, 100, 200, X, kOk, P | U | R, 150, 200, {72, 73, 74, 77}},
    };
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::remove_file(kOptGlobalMap);
        if (c.file_mtime >= 0) oxtest::write_file(kOptGlobalMap, "", c.file_mtime);
        set->flags[2] = c.flags;
        set->mtimes[2] = c.mtime;
        set->read_times[2] = c.read_time;
        set->flags[1] = c.superseder_flags;
        oxtest::reset_trace();
        oxtest::set_trace_levels(0, 0, 0, 0, 1);
        EXPECT_EQ(idm__native_test_mapfiles_v1(set, 2, 1), c.result);
        EXPECT_EQ((std::vector<uint32_t>{set->flags[2], set->mtimes[2], set->read_times[2]}),
                  (std::vector<uint32_t>{c.flags_after, c.mtime_after, c.read_time_after}));
        EXPECT_EQ(oxtest::trace_ids(), c.diag);
    }
    // A set of another layout version is not tested: every file deselected.
    set->tag = IDM_MAPFILE_SET_TAG + 1;
    set->flags[0] = P | U | R;
    EXPECT_EQ(idm__native_test_mapfiles(set), kUnchanged);
    EXPECT_TRUE(oxtest::reported(kInternal, idm::kMsg655, {"idm__native_test_mapfiles", "23", "[ignored]"}));
    EXPECT_EQ(set->flags[0], P);
    idm__native_release_cachef(set);
}

// Every line parsed touches the local file while touches are left.
std::atomic<int> g_touches_left{0};
void touch_while_parsing(int id) {
    if (id == 43 && g_touches_left.fetch_sub(1) > 0) oxtest::set_mtime(kLocalMap, 6000 + g_touches_left.load());
}

// Reading passes of one translator.  Each step changes the files or the
// platform, then asks for a pass; the list is always checked (a pass that
// changes nothing or fails leaves the caller's list as it was).
//   L@T V@T O@T: the local, /var global and /opt global file written, of
//   modification time T;  N@T, C@T, E@T: the local file with a line more,
//   with a cut (unterminated) last line, ending in an empty line;
//   -L: removed;  t=S: the clock;
//   open:V=R, time:V=R: the platform's open or time query of V fails with
//   R (open:- and time:- end it);  lock=R, fdopen=E: every lock fails with
//   R, every stream opening with errno E (0 ends it);  fifo:V: V is a FIFO,
//   which the platform lets through;  mech=M: the mechanism asked for;
//   touch=N: the next N lines parsed each change the local file's time.
const std::map<char, std::pair<const char *, std::string>> kFiles = {
    {'L', {kLocalMap, "# local\nmechA:l=L\nother:x=y\n"}},
    {'N', {kLocalMap, "mechA:l=L\nmechA:new=N\n"}},
    {'C', {kLocalMap, "mechA:l=L\nmechA:cut=C"}},
    {'E', {kLocalMap, "mechA:l=L\n\n"}},
    {'V', {kVarGlobalMap, "mechA:v=V\nmechA:!vd\n"}},
    {'O', {kOptGlobalMap, "mechA:o=O\n"}},
};
struct Step {
    const char *before;
    int32_t status;
    const char *shown;
    int msgno = 0;                  // the report of a failed pass (0: nothing reported)
    const char *inserts = nullptr;  // its inserts, blank-separated (null: not checked)
};
const struct {
    const char *label;
    std::vector<Step> steps;
} kScenarios[] = {
    {"no file at all", {{"", kUnchanged, ""}, {"", kUnchanged, ""}}},
    {"the /opt global file, then the others appear",
     {{"O@1000", kOk, "o=O"}, {"", kUnchanged, "o=O"}, {"L@1100 V@1200", kOk, "l=L v=V !vd"},
      {"", kUnchanged, "l=L v=V !vd"}}},
    {"the /var global file removed, the /opt one takes over",
     {{"L@1000 V@1000 O@1000", kOk, "l=L v=V !vd"}, {"-V t=6000", kOk, "l=L o=O"}, {"", kUnchanged, "l=L o=O"}}},
    {"a superseded file changes nothing until it takes over",
     {{"L@1000 V@1000 O@1000", kOk, "l=L v=V !vd"}, {"O@3000", kUnchanged, "l=L v=V !vd"}, {"-L", kOk, "v=V !vd"},
      {"-V", kOk, "o=O"}, {"-O", kOk, ""}, {"", kUnchanged, ""}}},
    {"a rewritten file is read with the others, another mechanism apart",
     {{"L@1000 V@1000", kOk, "l=L v=V !vd"}, {"N@1001", kOk, "l=L new=N v=V !vd"},
      {"mech=other L@1002", kOk, "x=y"}}},
    {"parsed in the second of its change: read again until a later second",
     {{"t=1000 L@1000", kOk, "l=L"}, {"", kOk, "l=L"}, {"t=1001", kOk, "l=L"}, {"", kUnchanged, "l=L"}}},
    {"a cut last line is held back while the file is fresh",
     {{"C@4999", kOk, "l=L"}, {"", kOk, "l=L"}, {"t=5001", kOk, "l=L cut=C"}, {"", kUnchanged, "l=L cut=C"}}},
    {"an empty last line is no cut line", {{"E@4999", kOk, "l=L"}, {"", kUnchanged, "l=L"}}},
    {"a failed file fails every pass until it can be read, and leaves nothing open",
     {{"L@1000 V@1000", kOk, "l=L v=V !vd"},
      {"V@1001 open:V=12", kMapfileInaccessible, "l=L v=V !vd", idm::kMsg653, "idm__ready_mapfile /var/ox/cfg/oxsec_map.global"},
      {"", kMapfileInaccessible, "l=L v=V !vd", idm::kMsg653},
      {"open:V=6", kMapfileInaccessible, "l=L v=V !vd", idm::kMsg654, "idm__ready_mapfile 0"},
      {"open:V=99", kInternal, "l=L v=V !vd", idm::kMsg655, "idm__open_mapfile 99 idm__ready_mapfile"},
      {"open:- lock=30", kMapfileLocked, "l=L v=V !vd", idm::kMsg656, "idm__readlock_mapfile /var/ox/cfg/oxsec_map.local"},
      {"lock=23", kInternal, "l=L v=V !vd", idm::kMsg655, "idm__readlock_mapfile 23 idm__ready_mapfile"},
      {"lock=0 fdopen=24", kInternal, "l=L v=V !vd", idm::kMsg657},
      {"fdopen=0", kOk, "l=L v=V !vd"}, {"", kUnchanged, "l=L v=V !vd"},
      {"-V fifo:V", kInternal, "l=L v=V !vd", idm::kMsg655, "idm__open_mapfile 22 idm__ready_mapfile"},
      {"-V", kOk, "l=L"}}},
    {"a file gone before it is opened", {{"L@1000 open:L=21", kMapfileMissing, ""}}},
    // Three lines: 2 touches move one parse, 9 move all three.
    {"a file changed while parsed is parsed again, three times at most",
     {{"touch=2 L@1000", kOk, "l=L"},
      {"touch=9 L@1001", kInternal, "l=L", idm::kMsg655, "idm__parse_mapfile 11 idm__native_read_mapfiles"}, {"", kOk, "l=L"}}},
    {"a failed time query deselects every file",
     {{"L@1000 O@1000 time:V=23", kOk, ""}, {"time:-", kOk, "l=L o=O"}, {"time:L=23", kUnchanged, "l=L o=O"}}},
};

TEST_F(MapFiles, ReadingPasses) {
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    trx_on_record(touch_while_parsing);
    for (const auto &scenario : kScenarios) {
        SCOPED_TRACE(scenario.label);
        oxtest::fresh_config_dirs();
        mssx_reset();
        cux_set_clock(5000);
        idm_mapfile_set *set = nullptr;
        int32_t count = 0;
        idm_mapfile_entry *entries = nullptr;
        std::string mechanism = "mechA";
        const int descriptors = oxtest::open_descriptors();
        for (const Step &step : scenario.steps) {
            SCOPED_TRACE(step.before);
            std::istringstream actions(step.before);
            for (std::string a; actions >> a;) {
                const std::string value = a.substr(a.find_first_of("@=") + 1);
                const char *path = a.size() > 5 && kFiles.contains(a[5]) ? kFiles.at(a[5]).first : nullptr;
                if (a[1] == '@') oxtest::write_file(kFiles.at(a[0]).first, kFiles.at(a[0]).second, std::stoll(value));
                else if (a[0] == '-') oxtest::remove_file(kFiles.at(a[1]).first);
                else if (a.starts_with("lock")) mssx_force_readlock(std::stoi(value));
                else if (a.starts_with("fdopen")) g_fdopen_errno.store(std::stoi(value));
                else if (a.starts_with("fifo")) mssx_accept_any_file(mkfifo(path, 0644) == 0);
                else if (a.starts_with("touch")) g_touches_left.store(std::stoi(value));
                else if (a.starts_with("t=")) cux_set_clock(std::stoll(value));
                else if (a.starts_with("mech=")) mechanism = value;
                else (a[0] == 'o' ? mssx_force_open : mssx_force_time)(path, path ? std::stoi(value) : 0);
            }
            oxtest::clear_errors();
            EXPECT_EQ(idm__native_read_mapfiles(mechanism.c_str(), &set, &count, &entries), step.status);
            std::string shown;
            for (int32_t i = 0; i < count; ++i)
                shown += std::string(shown.empty() ? "" : " ") + (entries[i].local_id ? "" : "!") +
                         entries[i].network_id + (entries[i].local_id ? "=" + std::string(entries[i].local_id) : "");
            EXPECT_EQ(shown, step.shown);
            EXPECT_EQ(count == 0, entries == nullptr);
            if (step.msgno == 0) EXPECT_TRUE(oxtest::nothing_reported());
            else EXPECT_EQ(oxtest::last_error().msgno, step.msgno);
            std::string inserts;
            for (const std::string &i : oxtest::last_error().inserts) inserts += (inserts.empty() ? "" : " ") + i;
            EXPECT_EQ(inserts, step.inserts != nullptr ? step.inserts : inserts);
            EXPECT_EQ(mssx_locks_held(), 0);
            EXPECT_EQ(oxtest::open_descriptors(), descriptors) << "descriptor left open";
        }
        idm__native_release_entry_list(count, entries);
        idm__native_release_cachef(set);
    }
}

}  // namespace
