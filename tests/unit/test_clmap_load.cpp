// The node information file /var/ox/cfg/oxsec.nodeinfo in the private
// namespace, one script of file changes and lookups: where a host is looked
// up, the reload rule on the whole-second modification time, what each kind
// of failure reports and leaves in the trees, a cut last line, the record
// budget; and a file that changes while it is read.
#include <fcntl.h>
#include <poll.h>
#include <sys/fanotify.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <string>
#include <thread>
#include <tuple>
#include <utility>
#include <vector>

#include "harness.h"
#include "oxidm_clmap.h"
#include "oxidm_state.h"

namespace {

using oxtest::kNodeInfo;

using idm::kOk, idm::kUnchanged, idm::kNodeFileInvalid, idm::kNoMemory;

// Status and clusters ("a,b") of one lookup.
std::pair<int32_t, std::string> lookup(const char *host) {
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = -1;
    std::pair<int32_t, std::string> r{sec__get_cluster_names(hold, host, &clusters, &count), ""};
    for (int32_t i = 0; i < count; ++i) r.second += (i ? "," : "") + std::string(clusters[i]);
    return r;
}

std::string words(const char *stem, int n) {
    std::string t;
    for (int i = 0; i < n; ++i) t += " " + std::string(stem) + std::to_string(i);
    return t;
}

const char kExample[] = "NODE:\nNAME: hosta hosta-alt\nADDRESS: 10.1.1.1 fd00::1\nCLUSTER: clA clB\n"
                        "node:\naddress: 10.1.1.2\ncluster: clA\n";
const char kSplit[] = "NODE:\nNAME: 10.0.0.9 plain\nCLUSTER: c\nNODE:\nADDRESS: plain2\nCLUSTER: d\n";

class ClusterFile : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        pthread_once(&idm__init_once_block, idm__state_init);
    }
};

TEST_F(ClusterFile, Script) {
    enum Act { kKeep, kWrite, kSameSecond, kTouch, kRemove, kLoop, kDir, kDangling, kNoDescriptor, kClock };
    const struct {
        const char *label;
        Act act;
        std::string text;
        int64_t time;  // file time (kClock: the clock)
        const char *host;
        int32_t status;
        const char *clusters;  // "a,b"
        int msg;             // reported with the status (0: nothing)
        uint32_t trees;      // names * 1000 + addresses
        int64_t lastmod;
        std::vector<std::string> inserts = {};
    } steps[] = {
        {"no file", kKeep, "", 0, "hosta", kUnchanged, "", 0, 0, 0},
        {"by name", kWrite, kExample, 1000, "hosta-alt", kOk, "clA,clB", 0, 2003, 1000},
        {"by address", kKeep, "", 0, "fd00::1", kOk, "clA,clB", 0, 2003, 1000},
        {"address texts exactly", kKeep, "", 0, "fd00:0::1", kUnchanged, "", 0, 2003, 1000},
        {"null host", kKeep, "", 0, nullptr, kUnchanged, "", 0, 2003, 1000},
        {"an address among addresses", kWrite, kSplit, 1001, "10.0.0.9", kUnchanged, "", 0, 2001, 1001},
        {"a name among names", kKeep, "", 0, "plain2", kUnchanged, "", 0, 2001, 1001},
        {"a name", kKeep, "", 0, "plain", kOk, "c", 0, 2001, 1001},
        {"same second: not read", kSameSecond, "NODE:\nNAME: h\nCLUSTER: v2\n", 1001, "plain", kOk, "c", 0, 2001, 1001},
        {"an earlier time is a change", kTouch, "", 900, "h", kOk, "v2", 0, 1000, 900},
        {"removed: empty, time kept", kRemove, "", 0, "h", kUnchanged, "", 0, 0, 900},
        {"back with that time: not read", kWrite, "NODE:\nNAME: h\nCLUSTER: v2\n", 900, "h", kUnchanged, "", 0, 0, 900},
        {"empty file", kWrite, "", 2000, "h", kUnchanged, "", 0, 0, 2000},
        {"loaded", kWrite, kExample, 4000, "hosta", kOk, "clA,clB", 0, 2003, 4000},
        {"invalid: empty trees", kWrite, std::string(kExample) + "NODE:\n", 4001, "hosta", kNodeFileInvalid, "", idm::kMsg690, 0, 4001},
        {"invalid: not read again", kKeep, "", 0, "hosta", kUnchanged, "", 0, 0, 4001},
        {"valid again", kWrite, kExample, 4002, "hosta", kOk, "clA,clB", 0, 2003, 4002},
        {"stat fails", kLoop, "", 0, "hosta", kNodeFileInvalid, "", idm::kMsg692, 2003, 4002},
        {"a directory", kDir, "", 0, "hosta", kNodeFileInvalid, "", idm::kMsg693, 2003, 4002},
        {"a link to nothing", kDangling, "", 0, "hosta", kNodeFileInvalid, "", idm::kMsg693, 2003, 4002},
        {"open fails", kNoDescriptor, kSplit, 5001, "hosta", kNodeFileInvalid, "", idm::kMsg693, 2003, 5001},
        {"open failed: not retried", kKeep, "", 0, "plain", kUnchanged, "", 0, 2003, 5001},
        {"a cut line just written", kWrite, "NODE:\nNAME: cut\nCLUSTER: c", 5999, "cut", kUnchanged, "", 0, 2003, INT64_MIN},
        {"read again at the next query", kClock, "", 6001, "cut", kOk, "c", 0, 1000, 5999},
        {"a list grows past 32", kWrite, "NODE:\nCLUSTER: c\nNAME:" + words("n", 70) + "\n", 7000, "n69", kOk, "c", 0, 70000,
         7000},
        {"the record budget", kWrite, "NODE:\nNAME:" + words("n", 3000) + "\nCLUSTER:" + words("c", 3000) + "\n", 8000,
         "n0", kNoMemory, "", idm::kMsg654, 0, 8000, {"idm__getnode", "24000"}},
    };
    cux_set_clock(6000);
    for (const auto &s : steps) {
        SCOPED_TRACE(s.label);
        switch (s.act) {
        case kKeep: break;
        case kNoDescriptor: oxtest::remove_file(kNodeInfo); [[fallthrough]];
        case kWrite: oxtest::write_file(kNodeInfo, s.text, s.time); break;
        case kSameSecond:  // the same whole second, other nanoseconds
            oxtest::write_file(kNodeInfo, s.text);
            ASSERT_EQ(utimensat(AT_FDCWD, kNodeInfo, std::array{timespec{s.time, 7}, timespec{s.time, 7}}.data(), 0), 0);
            break;
        case kTouch: oxtest::set_mtime(kNodeInfo, s.time); break;
        case kRemove: oxtest::remove_file(kNodeInfo); break;
        case kLoop: ASSERT_EQ(unlink(kNodeInfo) == 0 && symlink(kNodeInfo, kNodeInfo) == 0, true); break;
        case kDir: ASSERT_EQ(unlink(kNodeInfo) == 0 && mkdir(kNodeInfo, 0755) == 0, true); break;
        case kDangling: ASSERT_EQ(rmdir(kNodeInfo) == 0 && symlink("nothing", kNodeInfo) == 0, true); break;
        case kClock: cux_set_clock(s.time); break;
        }
        oxtest::clear_errors();
        const int lowest = open("/dev/null", O_RDONLY);  // the lowest free number as the limit: no open succeeds
        close(lowest);
        struct rlimit saved {};
        getrlimit(RLIMIT_NOFILE, &saved);
        const struct rlimit tight = {rlim_t(lowest), saved.rlim_max};
        if (s.act == kNoDescriptor) { ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &tight), 0); }
        EXPECT_EQ(lookup(s.host), std::pair(s.status, std::string(s.clusters)));
        setrlimit(RLIMIT_NOFILE, &saved);
        EXPECT_TRUE(s.msg ? oxtest::reported(s.status, s.msg, s.inserts) : oxtest::nothing_but_list_ends());
        EXPECT_EQ(nametree.rst_node_cnt * 1000 + iptree.rst_node_cnt, s.trees);
        EXPECT_EQ(lastmod, s.lastmod);
    }
}

// A file that changes while it is read: a fanotify permission handler
// appends to it before each of the library's first `appends` reads goes on.
// A file read while it grew is read again, three times at most; then the load
// fails with 2650-694, keeps the trees and is tried again at the next query.
TEST_F(ClusterFile, AFileChangedWhileReadIsReadAgain) {
    for (const auto &[appends, status, clusters] : {std::tuple{1, kOk, "d"}, {100, kNodeFileInvalid, ""}}) {
        oxtest::write_file(kNodeInfo, "#" + std::string(5000, 'x') + "\nNODE:\nNAME: early\nCLUSTER: c\n",
                           2000 + appends);
        const int fan = fanotify_init(FAN_CLASS_CONTENT | FAN_CLOEXEC, O_RDWR);
        if (fan < 0 || fanotify_mark(fan, FAN_MARK_ADD, FAN_ACCESS_PERM, AT_FDCWD, kNodeInfo) != 0)
            GTEST_SKIP() << "fanotify not available";
        std::atomic<bool> done{false};
        std::thread handler([&, appends = appends] {
            const std::string more = "NODE:\nNAME:" + words("late", 1000) + "\nCLUSTER: d\n";
            alignas(fanotify_event_metadata) char buf[4096];
            for (int n = 0; !done;) {
                if (pollfd p{fan, POLLIN, 0}; poll(&p, 1, 20) != 1) continue;
                ssize_t got = read(fan, buf, sizeof buf);
                for (auto *m = reinterpret_cast<fanotify_event_metadata *>(buf); FAN_EVENT_OK(m, got);
                     m = FAN_EVENT_NEXT(m, got)) {
                    if (n++ < appends) { EXPECT_GT(pwrite(m->fd, more.data(), more.size(), lseek(m->fd, 0, SEEK_END)), 0); }
                    const fanotify_response r{m->fd, FAN_ALLOW};
                    EXPECT_EQ(write(fan, &r, sizeof r), ssize_t(sizeof r));
                    close(m->fd);
                }
            }
        });
        oxtest::clear_errors();
        EXPECT_EQ(lookup("late999"), std::pair(int32_t{status}, std::string(clusters)));
        done = true;
        EXPECT_TRUE(appends == 1 ? oxtest::nothing_but_list_ends() : oxtest::reported(kNodeFileInvalid, idm::kMsg694, {}));
        EXPECT_EQ(lastmod, appends == 1 ? 2001 : INT64_MIN);
        handler.join();
        close(fan);
    }
}

}  // namespace

// A record copies its key and its cluster names; a null name stays null.
TEST(ClusterRecord, CopiesKeyAndNamesKeepingNullEntries) {
    char name[] = "clA";
    char *names[] = {nullptr, name};
    idm_clnode *node = nullptr;
    ASSERT_EQ(idm__getnode("host", names, 2, &node), kOk);
    name[0] = 'x';
    EXPECT_STREQ(node->key, "host");
    ASSERT_EQ(node->count, 2);
    EXPECT_EQ(node->clusters[0], nullptr);
    EXPECT_STREQ(node->clusters[1], "clA");
    idm__rtree_cleanup_routine(node);
}
