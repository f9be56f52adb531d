// The exported cluster queries through the shipped library: the answers 1,
// 0 and -1, the active cluster from libox_cu, what stays reported after a
// failed load, and the API trace records of both queries and of the
// cluster map's set-up.
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm.h"

namespace {

using oxtest::kNodeInfo;
using oxtest::reported;
using oxtest::write_file;

constexpr int kMsg690 = 315;
constexpr int kMsg692 = 317;

const char kFile[] =
    "NODE:\nNAME: hosta\nADDRESS: 10.1.1.1\nCLUSTER: clA clB\n"
    "NODE:\nNAME: hostc\nCLUSTER: ClA\n";

class ClusterQueries : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
    }
};

TEST_F(ClusterQueries, Answers) {
    write_file(kNodeInfo, kFile, 1000);
    const struct {
        const char *label;
        const char *host;
        const char *active;  // nullptr: cu_get_cluster_info_1 fails
        int32_t any;
        int32_t in_active;
    } cases[] = {
        {"listed, active is its first cluster", "hosta", "clA", 1, 1},
        {"listed, active is its second cluster", "hosta", "clB", 1, 1},
        {"listed, another cluster is active", "hosta", "clC", 1, 0},
        {"listed, no active cluster known", "hosta", nullptr, 1, -1},
        {"listed by address", "10.1.1.1", "clB", 1, 1},
        {"cluster names compare with case", "hostc", "clA", 1, 0},
        {"a prefix of the active name is not it", "hosta", "clAx", 1, 0},
        {"not listed", "hostb", "clA", -1, -1},
        {"not listed by that case", "HOSTA", "clA", -1, -1},
        {"empty host", "", "clA", -1, -1},
        {"null host", nullptr, "clA", -1, -1},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        cux_fail_cluster_info(c.active == nullptr);
        cux_set_active_cluster(c.active);
        oxtest::clear_errors();
        EXPECT_EQ(sec_is_in_any_cluster(c.host), c.any);
        EXPECT_EQ(sec_is_in_active_cluster(c.host), c.in_active);
        EXPECT_TRUE(oxtest::nothing_but_list_ends());
    }
}

TEST_F(ClusterQueries, TheActiveClusterFromItsFile) {
    write_file(kNodeInfo, kFile, 1000);
    EXPECT_EQ(sec_is_in_active_cluster("hosta"), -1) << "no file, no active cluster";
    write_file("/var/ox/cfg/active_cluster", "clB\n");
    EXPECT_EQ(sec_is_in_active_cluster("hosta"), 1);
    EXPECT_EQ(sec_is_in_active_cluster("hostc"), 0);
}

TEST_F(ClusterQueries, AMissingFileAnswersMinusOneForEveryHost) {
    cux_set_active_cluster("clA");
    for (const char *host : {"hosta", "10.1.1.1", ""}) {
        EXPECT_EQ(sec_is_in_any_cluster(host), -1);
        EXPECT_EQ(sec_is_in_active_cluster(host), -1);
    }
    EXPECT_TRUE(oxtest::nothing_reported());
}

TEST_F(ClusterQueries, AFailedLoadStaysReportedOnlyForTheQueryThatRanIt) {
    cux_set_active_cluster("clA");
    write_file(kNodeInfo, std::string(kFile) + "CLUSTER: stray\n", 1000);
    EXPECT_EQ(sec_is_in_active_cluster("hosta"), -1);
    EXPECT_TRUE(reported(21, kMsg690, {}));
    oxtest::clear_errors();
    EXPECT_EQ(sec_is_in_active_cluster("hosta"), -1);
    EXPECT_EQ(sec_is_in_any_cluster("hosta"), -1);
    EXPECT_TRUE(oxtest::nothing_reported());
    write_file(kNodeInfo, kFile, 1001);
    EXPECT_EQ(sec_is_in_any_cluster("hosta"), 1);
    EXPECT_EQ(sec_is_in_active_cluster("hosta"), 1);
    // stat failing for another reason than a missing file.
    oxtest::remove_file(kNodeInfo);
    ASSERT_EQ(symlink(kNodeInfo, kNodeInfo), 0);
    EXPECT_EQ(sec_is_in_any_cluster("hosta"), -1);
    EXPECT_TRUE(reported(21, kMsg692, {}));
}

TEST_F(ClusterQueries, NoLookupWithoutAnActiveCluster) {
    write_file(kNodeInfo, kFile, 1000);
    cux_fail_cluster_info(1);
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    EXPECT_EQ(sec_is_in_active_cluster("hosta"), -1);
    // The set-up of the cluster map (148, 149) runs inside the first query;
    // no lookup (150...) follows.
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{140, 148, 149, 142}));
}

TEST_F(ClusterQueries, TraceRecordsOfTheQueries) {
    write_file(kNodeInfo, kFile, 1000);
    cux_set_active_cluster("clC");
    EXPECT_EQ(sec_is_in_any_cluster("hostb"), -1);  // set-up and load, untraced
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    sec_is_in_any_cluster("hosta");
    sec_is_in_active_cluster("hosta");
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{144, 150, 154, 173, 152, 146, 140, 150, 154, 173, 152, 142}));
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    EXPECT_EQ(sec_is_in_any_cluster(nullptr), -1);
    EXPECT_EQ(sec_is_in_active_cluster("hosta"), 0);
    auto records = oxtest::trace_records();
    std::vector<int> ids;
    for (const auto &r : records) ids.push_back(r.id);
    ASSERT_EQ(ids, (std::vector<int>{145, 151, 154, 173, 153, 147, 141, 151, 154, 173, 153, 143}));
    EXPECT_EQ(records[0].text(0), "<null string>");
    EXPECT_EQ(records[5].items.size(), 1u);
    EXPECT_EQ(records[5].i32(0), -1);
    EXPECT_EQ(records[6].text(0), "hosta");
    EXPECT_EQ(records[11].i32(0), 0);
    // Levels other than 1 and 8 record no entry or exit of the queries.
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 4, 0, 0, 0);
    sec_is_in_any_cluster("hosta");
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{154, 173}));
}

TEST_F(ClusterQueries, SetUpIsTracedWithBareIdsAtLevelEight) {
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    sec_is_in_any_cluster("hosta");
    auto records = oxtest::trace_records();
    ASSERT_GE(records.size(), 3u);
    EXPECT_EQ(records[1].id, 148);
    EXPECT_EQ(records[1].kind, TRX_ID);
    EXPECT_EQ(records[2].id, 149);
    EXPECT_EQ(records[2].kind, TRX_ID);
}

}  // namespace
