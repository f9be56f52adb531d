// Allocation-failure sweep of a whole cluster load: a node information file
// of several records (one with enough names to grow the working list, one
// that lists a host again) is read, parsed into the two trees and queried.
#include <cstring>
#include <string>

#include "oxidm_clmap.h"
#include "oxidm_state.h"
#include "test_sweep.h"

namespace {

using oxtest::kNodeInfo;
using oxtest::num;

// Status and clusters of one query, as a text.
std::string lookup(const char *host) {
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = 0;
    std::string answer = std::to_string(sec__get_cluster_names(hold, host, &clusters, &count));
    for (int32_t i = 0; i < count; ++i) answer += std::string(" ") + clusters[i];
    return answer;
}

// Record 4 repeats hosta (the first record wins) and gives 34 names, so the
// names list fills its 32 entries and grows.
std::string new_text() {
    std::string t = "# version 2\nNODE:\n  NAME: hosta hosta-alt\n  ADDRESS: 10.1.1.1 fd00::1\n  CLUSTER: v clA\n"
                    "node: name: hostb\ncluster: v clB\nNODE:\nADDRESS: 10.1.1.2\nCLUSTER: v\nNODE:\nNAME: hosta";
    for (int i = 0; i < 33; ++i) t += num(" n", i);
    return t + "\nCLUSTER: dup\n";
}

class SweepCluster : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        pthread_once(&idm__init_once_block, idm__state_init);
    }
};

TEST_F(SweepCluster, LoadOfSeveralRecords) {
    // After a failure the file counts as read and the host is not listed until it changes.
    const std::string fresh = "0 v clA", nomem = sweep::st(idm::kNoMemory), unchanged = sweep::st(idm::kUnchanged);
    std::vector<sweep::Row> rows = {
        {"file buffer, the file's size and its NUL: the trees keep the old version", idm::kMsg654,
         "idm__read_clmap_file", idm::kNoMemory, nomem, {"0 old"}, {std::to_string(new_text().size() + 1)}},
        {"working list and its growth", idm::kMsg654, "idm__construct_clcfg", idm::kNoMemory, nomem, {unchanged}},
        {"tree record", idm::kMsg654, "idm__getnode", idm::kNoMemory, nomem, {unchanged}},
        {"tree node", idm::kMsg691, "", idm::kInternal, sweep::st(idm::kInternal), {unchanged}},
    };
    int64_t mtime = 10000;
    sweep::Operation op{
        [&](long) {
            oxtest::write_file(kNodeInfo, "NODE:\nNAME: hosta\nCLUSTER: old\n", mtime += 10);
            EXPECT_EQ(lookup("hosta"), "0 old");
            oxtest::write_file(kNodeInfo, new_text(), mtime += 10);
        },
        [] { return lookup("hosta"); },
        fresh,
        [] {
            pthread_mutex_lock(&idmutex.mutex);
            EXPECT_EQ(idmutex.lock_count, 0);
            EXPECT_EQ(idmutex.waiting_writers, 0);
            pthread_mutex_unlock(&idmutex.mutex);
        },
        [&] {  // a change of the file loads it whole
            oxtest::set_mtime(kNodeInfo, mtime += 10);
            EXPECT_EQ(lookup("hosta"), fresh);
            EXPECT_EQ(lookup("hostb"), "0 v clB");
            EXPECT_EQ(lookup("fd00::1"), fresh);
            EXPECT_EQ(lookup("10.1.1.2"), "0 v");
            EXPECT_EQ(lookup("n32"), "0 dup");
            EXPECT_EQ(nametree.rst_node_cnt, 36u);
            EXPECT_EQ(iptree.rst_node_cnt, 3u);
        },
    };
    EXPECT_GT(sweep::run(op, rows), 80);
}

}  // namespace
