// Node information file, loaded from /var/ox/cfg/oxsec.nodeinfo in the
// private namespace: the reload rule on the whole-second modification time,
// all-or-nothing loads, the failures of stat, open and read (a file that
// shrinks or grows between stat and read is made so by a fanotify handler
// that answers the library's own open), allocation failures counted through
// the seam, lookups, and the trace points.
#include <fcntl.h>
#include <poll.h>
#include <sys/fanotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "harness.h"
#include "oxidm_clmap.h"
#include "oxidm_state.h"

namespace {

using oxtest::kNodeInfo;
using oxtest::reported;
using oxtest::write_file;

struct Lookup {
    int32_t status;
    std::vector<std::string> clusters;
    bool operator==(const Lookup &o) const { return status == o.status && clusters == o.clusters; }
};
std::ostream &operator<<(std::ostream &os, const Lookup &l) {
    os << "{" << l.status;
    for (const auto &c : l.clusters) os << " " << c;
    return os << "}";
}
const Lookup kNotFound{1, {}};

Lookup lookup(const char *host) {
    pthread_once(&idm__init_once_block, idm__state_init);
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = -1;
    Lookup r{sec__get_cluster_names(hold, host, &clusters, &count), {}};
    if (r.status != 0) {
        EXPECT_EQ(clusters, nullptr);
        EXPECT_EQ(count, 0);
    }
    for (int32_t i = 0; i < count; ++i) r.clusters.emplace_back(clusters[i]);
    return r;
}

uint32_t tree_sizes() { return nametree.rst_node_cnt * 1000 + iptree.rst_node_cnt; }

const char kExample[] =
    "# cluster hosts\nNODE:\nNAME: hosta hosta-alt\nADDRESS: 10.1.1.1 fd00::1\nCLUSTER: clA clB\n"
    "node:\naddress: 10.1.1.2\ncluster: clA\n";

class ClusterFile : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        pthread_once(&idm__init_once_block, idm__state_init);
    }
    void TearDown() override {
        idm_test_fail_alloc(0);
        oxtest::Test::TearDown();
    }
};

TEST_F(ClusterFile, LookupsInTheExample) {
    write_file(kNodeInfo, kExample, 1000);
    const struct {
        const char *host;
        Lookup expected;
    } cases[] = {
        {"hosta", {0, {"clA", "clB"}}},
        {"hosta-alt", {0, {"clA", "clB"}}},
        {"10.1.1.1", {0, {"clA", "clB"}}},
        {"fd00::1", {0, {"clA", "clB"}}},
        {"10.1.1.2", {0, {"clA"}}},
        {"HostA", kNotFound},
        {"fd00:0::1", kNotFound},
        {"10.1.1.3", kNotFound},
        {"", kNotFound},
        {nullptr, kNotFound},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.host ? c.host : "(null)");
        oxtest::clear_errors();
        EXPECT_EQ(lookup(c.host), c.expected);
        EXPECT_TRUE(oxtest::nothing_but_list_ends());
    }
    EXPECT_EQ(tree_sizes(), 2003u);
    EXPECT_EQ(lastmod, 1000);
}

TEST_F(ClusterFile, AnAddressTextIsSearchedOnlyAmongAddresses) {
    write_file(kNodeInfo, "NODE:\nNAME: 10.0.0.9 ::1 plain\nCLUSTER: c\nNODE:\nADDRESS: plain2\nCLUSTER: d\n", 1000);
    EXPECT_EQ(lookup("10.0.0.9"), kNotFound);
    EXPECT_EQ(lookup("::1"), kNotFound);
    EXPECT_EQ(lookup("plain"), (Lookup{0, {"c"}}));
    EXPECT_EQ(lookup("plain2"), kNotFound) << "a name is searched among the names";
}

TEST_F(ClusterFile, TheFirstRecordOfAHostWins) {
    write_file(kNodeInfo,
               "NODE:\nNAME: h\nADDRESS: 10.0.0.1\nCLUSTER: first\n"
               "NODE:\nNAME: h other\nADDRESS: 10.0.0.1\nCLUSTER: second\n",
               1000);
    EXPECT_EQ(lookup("h"), (Lookup{0, {"first"}}));
    EXPECT_EQ(lookup("10.0.0.1"), (Lookup{0, {"first"}}));
    EXPECT_EQ(lookup("other"), (Lookup{0, {"second"}}));
    EXPECT_EQ(tree_sizes(), 2001u);
}

TEST_F(ClusterFile, MissingAndEmptyFiles) {
    EXPECT_EQ(lookup("hosta"), kNotFound);
    EXPECT_TRUE(oxtest::nothing_reported());
    write_file(kNodeInfo, kExample, 1000);
    EXPECT_EQ(lookup("hosta").status, 0);
    oxtest::remove_file(kNodeInfo);
    EXPECT_EQ(lookup("hosta"), kNotFound) << "a removed file empties the trees";
    EXPECT_EQ(tree_sizes(), 0u);
    EXPECT_EQ(lastmod, 1000) << "a missing file leaves the time alone";
    write_file(kNodeInfo, kExample, 1000);
    EXPECT_EQ(lookup("hosta").status, 1) << "the same time as before: not loaded again";
    write_file(kNodeInfo, "", 2000);
    EXPECT_EQ(lookup("hosta"), kNotFound);
    EXPECT_EQ(lastmod, 2000);
    write_file(kNodeInfo, "# only\n\n  \t\n# comments\n", 3000);
    EXPECT_EQ(lookup("hosta"), kNotFound);
    EXPECT_EQ(lastmod, 3000);
    EXPECT_TRUE(oxtest::nothing_but_list_ends());
}

TEST_F(ClusterFile, ReloadOnlyWhenTheWholeSecondChanges) {
    write_file(kNodeInfo, "NODE:\nNAME: h\nCLUSTER: v1\n", 5000);
    EXPECT_EQ(lookup("h"), (Lookup{0, {"v1"}}));
    // Rewritten within the same second (the nanoseconds differ): not reloaded.
    write_file(kNodeInfo, "NODE:\nNAME: h\nCLUSTER: v2\n");
    struct timespec t[2] = {{5000, 700000000}, {5000, 700000000}};
    ASSERT_EQ(utimensat(AT_FDCWD, kNodeInfo, t, 0), 0);
    EXPECT_EQ(lookup("h"), (Lookup{0, {"v1"}}));
    // An earlier time counts as a change.
    oxtest::set_mtime(kNodeInfo, 4000);
    EXPECT_EQ(lookup("h"), (Lookup{0, {"v2"}}));
    EXPECT_EQ(lastmod, 4000);
}

TEST_F(ClusterFile, ASyntaxErrorEmptiesTheTreesAndIsNotRetriedUntilTheTimeChanges) {
    write_file(kNodeInfo, kExample, 1000);
    ASSERT_EQ(lookup("hosta").status, 0);
    write_file(kNodeInfo, std::string(kExample) + "NODE:\n", 2000);
    oxtest::clear_errors();
    EXPECT_EQ(lookup("hosta").status, 21);
    EXPECT_TRUE(reported(21, idm::kMsg690, {}));
    EXPECT_EQ(tree_sizes(), 0u) << "no partial load";
    oxtest::clear_errors();
    EXPECT_EQ(lookup("hosta"), kNotFound);
    EXPECT_TRUE(oxtest::nothing_reported());
    write_file(kNodeInfo, kExample, 3000);
    EXPECT_EQ(lookup("hosta").status, 0);
}

TEST_F(ClusterFile, StatOpenAndReadFailures) {
    write_file(kNodeInfo, kExample, 1000);
    ASSERT_EQ(lookup("hosta").status, 0);
    oxtest::remove_file(kNodeInfo);
    // stat fails with ELOOP: reported, nothing changes.
    ASSERT_EQ(symlink(kNodeInfo, kNodeInfo), 0);
    oxtest::clear_errors();
    EXPECT_EQ(lookup("hosta").status, 21);
    EXPECT_TRUE(reported(21, idm::kMsg692, {}));
    EXPECT_EQ(tree_sizes(), 2003u);
    EXPECT_EQ(lastmod, 1000);
    // A directory is no file to read: never opened, reported at every
    // query; the trees and the time stay.
    oxtest::remove_file(kNodeInfo);
    ASSERT_EQ(mkdir(kNodeInfo, 0755), 0);
    oxtest::set_mtime(kNodeInfo, 2000);
    for (int query = 0; query < 2; ++query) {
        oxtest::clear_errors();
        EXPECT_EQ(lookup("hosta").status, 21);
        EXPECT_TRUE(reported(21, idm::kMsg693, {}));
        EXPECT_EQ(tree_sizes(), 2003u);
        EXPECT_EQ(lastmod, 1000);
    }
    rmdir(kNodeInfo);
}

// Answers the permission event of every open of `path` (by anyone but the
// handler): the first one is denied, or the file is rewritten before the
// open is allowed.  Skips the test when fanotify is not available.
class OpenHandler {
  public:
    enum Action { kDeny, kTruncate, kAppend };
    OpenHandler(const char *path, Action action, size_t arg = 0, std::string more = {})
        : action_(action), arg_(arg), more_(std::move(more)) {
        fd_ = fanotify_init(FAN_CLASS_CONTENT | FAN_CLOEXEC, O_RDWR | O_LARGEFILE);
        if (fd_ < 0) return;
        if (fanotify_mark(fd_, FAN_MARK_ADD, FAN_OPEN_PERM, AT_FDCWD, path) != 0) {
            close(fd_);
            fd_ = -1;
            return;
        }
        thread_ = std::thread([this] { serve(); });
    }
    ~OpenHandler() {
        stop_ = true;
        if (thread_.joinable()) thread_.join();
        if (fd_ >= 0) close(fd_);
    }
    bool active() const { return fd_ >= 0; }
    int events() const { return events_.load(); }

  private:
    void serve() {
        while (!stop_) {
            pollfd p{fd_, POLLIN, 0};
            if (poll(&p, 1, 20) <= 0) continue;
            alignas(fanotify_event_metadata) char buf[4096];
            ssize_t n = read(fd_, buf, sizeof buf);
            for (auto *m = reinterpret_cast<fanotify_event_metadata *>(buf); n > 0 && FAN_EVENT_OK(m, n);
                 m = FAN_EVENT_NEXT(m, n)) {
                fanotify_response r{m->fd, FAN_ALLOW};
                if (events_++ == 0) {
                    if (action_ == kDeny) r.response = FAN_DENY;
                    if (action_ == kTruncate && ftruncate(m->fd, static_cast<off_t>(arg_)) != 0) ADD_FAILURE();
                    if (action_ == kAppend &&
                        pwrite(m->fd, more_.data(), more_.size(), static_cast<off_t>(arg_)) !=
                            static_cast<ssize_t>(more_.size()))
                        ADD_FAILURE();
                }
                if (write(fd_, &r, sizeof r) != sizeof r) ADD_FAILURE();
                close(m->fd);
            }
        }
    }
    Action action_;
    size_t arg_;
    std::string more_;
    int fd_ = -1;
    std::atomic<bool> stop_{false};
    std::atomic<int> events_{0};
    std::thread thread_;
};

TEST_F(ClusterFile, OpenDeniedKeepsTheTreesAndTakesTheTime) {
    write_file(kNodeInfo, kExample, 1000);
    ASSERT_EQ(lookup("hosta").status, 0);
    write_file(kNodeInfo, "NODE:\nNAME: other\nCLUSTER: c\n", 2000);
    OpenHandler handler(kNodeInfo, OpenHandler::kDeny);
    if (!handler.active()) GTEST_SKIP() << "fanotify not available";
    oxtest::clear_errors();
    EXPECT_EQ(lookup("hosta").status, 21);
    EXPECT_TRUE(reported(21, idm::kMsg693, {}));
    EXPECT_EQ(handler.events(), 1);
    EXPECT_EQ(tree_sizes(), 2003u);
    EXPECT_EQ(lastmod, 2000);
    EXPECT_EQ(lookup("hosta").status, 0) << "not retried until the time changes";
    EXPECT_EQ(lookup("other"), kNotFound);
    EXPECT_EQ(handler.events(), 1);
}

// A file cut short as it is opened ends in a cut line, just written: the
// load does not act on it, the trees keep what they held, and the next
// query loads again.
TEST_F(ClusterFile, AFileCutShortAsItIsOpenedIsNotActedOn) {
    write_file(kNodeInfo, kExample, 1000);
    ASSERT_EQ(lookup("hosta").status, 0);
    write_file(kNodeInfo, "NODE:\nNAME: other\nCLUSTER: c\n", 2000);
    {
        OpenHandler handler(kNodeInfo, OpenHandler::kTruncate, 14);  // "NODE:\nNAME: ot"
        if (!handler.active()) GTEST_SKIP() << "fanotify not available";
        EXPECT_EQ(lookup("ot"), kNotFound);
        EXPECT_EQ(lookup("hosta").status, 0) << "the trees keep what they held";
        EXPECT_EQ(handler.events(), 2) << "loaded again at the next query";
    }
    write_file(kNodeInfo, "NODE:\nNAME: other\nCLUSTER: c\n", 3000);
    EXPECT_EQ(lookup("other"), (Lookup{0, {"c"}}));
}

// A file that grows as it is opened is read to its end, not for the size
// its time query saw: here the appended text makes it invalid.
TEST_F(ClusterFile, AFileThatGrowsAsItIsOpenedIsReadToItsEnd) {
    const std::string first = "NODE:\nNAME: other\nCLUSTER: c\n";
    write_file(kNodeInfo, first, 2000);
    OpenHandler handler(kNodeInfo, OpenHandler::kAppend, first.size(), "NODE:\nNAME: late\n");
    if (!handler.active()) GTEST_SKIP() << "fanotify not available";
    oxtest::clear_errors();
    EXPECT_EQ(lookup("other").status, 21);
    EXPECT_TRUE(reported(21, idm::kMsg690, {}));
    EXPECT_EQ(tree_sizes(), 0u);
}

// Every allocation of a load and a lookup, failed in turn: the message and
// inserts, the status, and what the trees hold afterwards.
TEST_F(ClusterFile, EveryAllocationFailureOfALoad) {
    const std::string text = "NODE:\nNAME: hosta\nCLUSTER: clA\n";
    write_file(kNodeInfo, "NODE:\nNAME: old\nCLUSTER: c\n", 1000);
    ASSERT_EQ(lookup("old").status, 0);
    write_file(kNodeInfo, text, 2000);
    enum Trees { kOld, kEmpty, kNew };
    const std::string size1 = std::to_string(text.size() + 1);
    const struct Case {
        const char *label;
        int32_t status;
        int msgno;
        std::vector<std::string> inserts;
        Trees trees;
    } cases[] = {
        {"file buffer", 6, idm::kMsg654, {"idm__read_clmap_file", size1}, kOld},
        {"names list", 6, idm::kMsg654, {"idm__construct_clcfg", "256"}, kEmpty},
        {"addresses list", 6, idm::kMsg654, {"idm__construct_clcfg", "256"}, kEmpty},
        {"clusters list", 6, idm::kMsg654, {"idm__construct_clcfg", "256"}, kEmpty},
        {"value hosta", 6, idm::kMsg654, {"idm__extract_attr_value", "6"}, kEmpty},
        {"value clA", 6, idm::kMsg654, {"idm__extract_attr_value", "4"}, kEmpty},
        {"record", 6, idm::kMsg654, {"idm__getnode", std::to_string(sizeof(idm_clnode))}, kEmpty},
        {"key copy", 6, idm::kMsg654, {"idm__getnode", "5"}, kEmpty},
        {"cluster array", 6, idm::kMsg654, {"idm__getnode", "8"}, kEmpty},
        {"cluster copy", 6, idm::kMsg654, {"idm__getnode", "3"}, kEmpty},
        {"tree node", 23, idm::kMsg691, {}, kEmpty},
        {"probe record", 6, idm::kMsg654, {"idm__getnode", std::to_string(sizeof(idm_clnode))}, kNew},
        {"probe key", 6, idm::kMsg654, {"idm__getnode", "5"}, kNew},
    };
    long n = 1;
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        // Back to the old trees, then a changed time for the failing load.
        write_file(kNodeInfo, "NODE:\nNAME: old\nCLUSTER: c\n", 1000 + n);
        ASSERT_EQ(lookup("old").status, 0);
        write_file(kNodeInfo, text, 2000 + n);
        oxtest::clear_errors();
        idm_test_fail_alloc(n++);
        EXPECT_EQ(lookup("hosta").status, c.status);
        EXPECT_TRUE(idm_test_alloc_fired());
        EXPECT_TRUE(reported(c.status, c.msgno, c.inserts));
        idm_test_fail_alloc(0);
        const Lookup old = lookup("old"), fresh = lookup("hosta");
        EXPECT_EQ(old.status == 0, c.trees == kOld);
        EXPECT_EQ(fresh.status == 0, c.trees == kNew);
    }
    idm_test_fail_alloc(n);
    write_file(kNodeInfo, text, 5000);
    EXPECT_EQ(lookup("hosta"), (Lookup{0, {"clA"}}));
    EXPECT_FALSE(idm_test_alloc_fired()) << "the table covers every allocation";
}

TEST_F(ClusterFile, AFullWorkingListGrowsBy32) {
    std::string names;
    for (int i = 0; i < 64; ++i) names += " n" + std::to_string(i);
    write_file(kNodeInfo, "NODE:\nNAME:" + names + "\nCLUSTER: c\n", 1000);
    oxtest::set_trace_levels(1, 0, 0, 0, 0);
    // Buffer, three lists, 32 values: then the list grows to 64 entries.
    idm_test_fail_alloc(1 + 3 + 32 + 1);
    EXPECT_EQ(lookup("n0").status, 6);
    EXPECT_TRUE(reported(6, idm::kMsg654, {"idm__construct_clcfg", "512"}));
    auto records = oxtest::trace_records();
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].id, 163);
    EXPECT_EQ(records[0].items.size(), 2u);
    EXPECT_EQ(records[0].items[1].size(), 8u);
    EXPECT_EQ(records[0].u64(1), 512u);
    idm_test_fail_alloc(0);
    write_file(kNodeInfo, "NODE:\nNAME:" + names + "\nCLUSTER: c\n", 2000);
    EXPECT_EQ(lookup("n63"), (Lookup{0, {"c"}}));
    EXPECT_EQ(nametree.rst_node_cnt, 64u);
}

TEST_F(ClusterFile, AHostileRecordStopsAtTheRecordBudget) {
    // 3,000 names times 3,000 clusters would ask for 9,000,000 cluster copies.
    std::string names, clusters;
    for (int i = 0; i < 3000; ++i) {
        names += " n" + std::to_string(i);
        clusters += " c" + std::to_string(i);
    }
    write_file(kNodeInfo, "NODE:\nNAME:" + names + "\nCLUSTER:" + clusters + "\n", 1000);
    EXPECT_EQ(lookup("n0").status, 6);
    EXPECT_TRUE(reported(6, idm::kMsg654, {"idm__getnode", "24000"}));
    EXPECT_EQ(tree_sizes(), 0u);
}

TEST_F(ClusterFile, TracePointsOfALoad) {
    write_file(kNodeInfo, "NODE:\nNAME: h\nADDRESS: 10.0.0.1\nCLUSTER: c\n", 1000);
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    ASSERT_EQ(lookup("h").status, 0);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{150, 154, 173, 152}));
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    EXPECT_EQ(lookup(nullptr).status, 1);
    auto records = oxtest::trace_records();
    ASSERT_EQ(records.size(), 4u);
    EXPECT_EQ(records[0].id, 151);
    EXPECT_EQ(records[0].text(0), "<null string>");
    EXPECT_EQ(records[1].id, 154);
    EXPECT_EQ(records[2].id, 173);
    EXPECT_EQ(records[2].i32(0), 0);
    EXPECT_EQ(records[3].id, 153);
    EXPECT_EQ(records[3].i32(0), 1);
    // Any other non-zero API level: only the load's own points.
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 2, 0, 0, 0);
    lookup("h");
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{154, 173}));
    // Diag: the text, the record and each value.
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    write_file(kNodeInfo, "NODE:\nNAME: h\nADDRESS: 10.0.0.1\nCLUSTER: c d\n", 2000);
    lookup("h");
    records = oxtest::trace_records();
    ASSERT_EQ(records.size(), 6u);
    EXPECT_EQ(records[0].id, 155);
    EXPECT_EQ(records[0].items[0].size(), 8u);
    EXPECT_EQ(records[0].u64(1), 46u) << "the file and the appended LF";
    EXPECT_EQ(records[1].id, 158);
    EXPECT_EQ(records[2].id, 159);
    EXPECT_EQ(records[2].i32(0), 0);
    EXPECT_EQ(records[2].text(1), "h");
    EXPECT_EQ(records[3].id, 160);
    EXPECT_EQ(records[3].text(1), "10.0.0.1");
    EXPECT_EQ(records[4].id, 161);
    EXPECT_EQ(records[5].id, 161);
    EXPECT_EQ(records[5].i32(0), 1);
    EXPECT_EQ(records[5].text(1), "d");
}

TEST_F(ClusterFile, EachSyntaxErrorRecordsItsTracePoint) {
    const struct {
        const char *text;
        int point;
    } cases[] = {
        {"NODE:\n", 157},           {"NODE\n", 164},
        {"NAME: h\n", 165},         {"NODE:\nNAME h\n", 166},
        {"ADDRESS: a\n", 167},      {"NODE:\nADDRESS a\n", 168},
        {"CLUSTER: c\n", 169},      {"NODE:\nNAME: h\nCLUSTER c\n", 170},
        {"junk\n", 171},
    };
    int64_t t = 1000;
    for (const auto &c : cases) {
        SCOPED_TRACE(c.text);
        for (unsigned char error : {1, 0}) {
            oxtest::reset_trace();
            oxtest::set_trace_levels(error, 0, 0, 0, static_cast<unsigned char>(1 - error));
            write_file(kNodeInfo, c.text, ++t);
            oxtest::clear_errors();
            EXPECT_EQ(lookup("h").status, 21);
            EXPECT_TRUE(reported(21, idm::kMsg690, {}));
            std::vector<int> ids = oxtest::trace_ids();
            ASSERT_FALSE(ids.empty());
            EXPECT_EQ(ids.back(), c.point);
        }
    }
}

TEST_F(ClusterFile, InsertionFailureTracesTheTree) {
    write_file(kNodeInfo, "NODE:\nADDRESS: a\nCLUSTER: c\n", 1000);
    oxtest::set_trace_levels(1, 0, 0, 0, 0);
    // Buffer, three lists, two values, four for the record: then the node.
    idm_test_fail_alloc(1 + 3 + 2 + 4 + 1);
    EXPECT_EQ(lookup("a").status, 23);
    EXPECT_TRUE(reported(23, idm::kMsg691, {}));
    auto records = oxtest::trace_records();
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].id, 172);
    EXPECT_EQ(records[0].text(0), "ADDRESS");
    // With Diag on, a failing record allocation names the value.
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    write_file(kNodeInfo, "NODE:\nADDRESS: a\nCLUSTER: c\n", 2000);
    idm_test_fail_alloc(1 + 3 + 2 + 1);
    EXPECT_EQ(lookup("a").status, 6);
    records = oxtest::trace_records();
    ASSERT_FALSE(records.empty());
    EXPECT_EQ(records.back().id, 162);
    EXPECT_EQ(records.back().text(0), "ADDRESS");
    EXPECT_EQ(records.back().text(1), "a");
}

}  // namespace
