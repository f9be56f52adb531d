// Allocation-failure sweep of a whole cluster load: a node information file
// of several records (one with enough names to grow its working list, one
// that lists a host again) is read, parsed into the two trees and queried.
#include <string>
#include <vector>

#include "oxidm_clmap.h"
#include "oxidm_state.h"
#include "test_sweep.h"

namespace {

using oxtest::num;

using oxtest::kNodeInfo;
using sweep::Row;

struct Lookup {
    int32_t status;
    std::vector<std::string> clusters;
    bool operator==(const Lookup &o) const { return status == o.status && clusters == o.clusters; }
};
std::ostream &operator<<(std::ostream &os, const Lookup &l) {
    os << "{" << l.status;
    for (const std::string &c : l.clusters) os << " " << c;
    return os << "}";
}

Lookup lookup(const char *host) {
    idm::clmap::MapHold hold(&idmutex);
    char **clusters = nullptr;
    int32_t count = 0;
    Lookup l{sec__get_cluster_names(hold, host, &clusters, &count), {}};
    for (int32_t i = 0; i < count; ++i) l.clusters.emplace_back(clusters[i]);
    return l;
}

bool lock_is_free() {
    pthread_mutex_lock(&idmutex.mutex);
    const bool free = idmutex.lock_count == 0 && idmutex.waiting_writers == 0;
    pthread_mutex_unlock(&idmutex.mutex);
    return free;
}

// The file of step n.  Record 4 repeats hosta (the first record wins, the
// repeat's node is released) and gives 34 names, so that the names list
// fills its 32 entries and grows.
std::string new_text(long n) {
    const std::string v = num("v", n);
    std::string t = num("# version ", n) + "\n";
    t += "NODE:\n  NAME: hosta hosta-alt\n  ADDRESS: 10.1.1.1 fd00::1\n  CLUSTER: " + v + " clA\n";
    t += "node: name: hostb\ncluster: " + v + " clB\n";
    t += "NODE:\nADDRESS: 10.1.1.2\nCLUSTER: " + v + "\n";
    t += "NODE:\nNAME: hosta";
    for (int i = 0; i < 33; ++i) t += num(" n", i);
    t += "\nCLUSTER: dup\n";
    return t;
}
const char kOldText[] = "NODE:\nNAME: hosta\nCLUSTER: old\n";

// The values of new_text(n), in no particular order.
std::vector<std::string> values_of(long n) {
    std::vector<std::string> v = {"hosta", "hosta-alt", "10.1.1.1", "fd00::1", "hostb", "10.1.1.2",
                                  "clA",   "clB",       "dup",      num("v", n)};
    for (int i = 0; i < 33; ++i) v.push_back(num("n", i));
    return v;
}

enum Outcome {
    kTreesKept,      // the file was not read: the trees keep the old version
    kTreesEmpty,     // the parse failed: both trees are empty
    kTreesEmptyOrNew,  // a record allocation: while storing (empty) or for the lookup's probe (new, loaded)
};

class SweepCluster : public oxtest::Test {
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

TEST_F(SweepCluster, EveryAllocationOfALoadOfSeveralRecords) {
    // What each site may ask for, over the versions a sweep can reach.
    std::set<std::string> node_sizes{std::to_string(sizeof(idm_clnode)), "8", "16"};  // record, cluster arrays
    std::set<std::string> copy_sizes, file_sizes;
    for (long n = 1; n < 400; ++n) {
        for (const std::string &v : values_of(n)) {
            node_sizes.insert(std::to_string(v.size()));     // key and cluster copies
            copy_sizes.insert(std::to_string(v.size() + 1));  // value copies
        }
        file_sizes.insert(std::to_string(new_text(n).size() + 1));
    }

    std::vector<Row> rows = {
        {"file buffer", idm::kMsg654, "idm__read_clmap_file", file_sizes, 6, 6, kTreesKept},
        {"working list", idm::kMsg654, "idm__construct_clcfg", {"256"}, 6, 6, kTreesEmpty},
        {"working list growth", idm::kMsg654, "idm__construct_clcfg", {"512"}, 6, 6, kTreesEmpty},
        {"value copy", idm::kMsg654, "idm__extract_attr_value", copy_sizes, 6, 6, kTreesEmpty},
        {"tree record", idm::kMsg654, "idm__getnode", node_sizes, 6, 6, kTreesEmptyOrNew},
        {"tree node", idm::kMsg691, "", {}, 23, 23, kTreesEmpty},
    };
    int64_t mtime = 10000;
    std::vector<long> probe_steps;  // steps whose failure hit the lookup's probe
    const Lookup kOld{0, {"old"}};
    auto fresh = [](long n) { return Lookup{0, {num("v", n), "clA"}}; };
    int steps = sweep::run([&](long n) {
        oxtest::write_file(kNodeInfo, kOldText, mtime += 10);
        EXPECT_EQ(lookup("hosta"), kOld);
        oxtest::write_file(kNodeInfo, new_text(n), mtime += 10);
        oxtest::clear_errors();

        idm_test_fail_alloc(n);
        const Lookup got = lookup("hosta");
        const bool fired = idm_test_alloc_fired() != 0;
        idm_test_fail_alloc(0);
        EXPECT_TRUE(lock_is_free());
        if (!fired) {
            EXPECT_TRUE(sweep::no_leaks());
            EXPECT_EQ(got, fresh(n));
            EXPECT_TRUE(oxtest::nothing_but_list_ends());
            return false;
        }
        const oxtest::Error e = oxtest::last_error();
        Row *row = sweep::row_of(rows, e);
        if (row == nullptr) {
            ADD_FAILURE() << "no failure row for " << sweep::describe(e);
            return true;
        }
        SCOPED_TRACE(row->label);
        ++row->hits;
        EXPECT_EQ(e.status, row->recorded);
        EXPECT_EQ(got, (Lookup{row->returned, {}}));

        // The next query, the file unchanged, answers from the trees as the
        // failure left them.
        const Lookup next = lookup("hosta");
        switch (row->outcome) {
        case kTreesKept: EXPECT_EQ(next, kOld); break;
        case kTreesEmpty: EXPECT_EQ(next, (Lookup{1, {}})); break;
        case kTreesEmptyOrNew:
            if (next == fresh(n)) {
                probe_steps.push_back(n);
            } else {
                EXPECT_EQ(next, (Lookup{1, {}}));
            }
            break;
        }
        EXPECT_EQ(lookup("10.1.1.1").status, next == fresh(n) ? 0 : 1);
        // A change of the file loads it whole.
        oxtest::set_mtime(kNodeInfo, mtime += 10);
        EXPECT_EQ(lookup("hosta"), fresh(n));
        EXPECT_EQ(lookup("hostb"), (Lookup{0, {num("v", n), "clB"}}));
        EXPECT_EQ(lookup("fd00::1"), fresh(n));
        EXPECT_EQ(lookup("10.1.1.2"), (Lookup{0, {num("v", n)}}));
        EXPECT_EQ(lookup("n32"), (Lookup{0, {"dup"}}));
        EXPECT_EQ(nametree.rst_node_cnt, 36u);
        EXPECT_EQ(iptree.rst_node_cnt, 3u);
        EXPECT_TRUE(lock_is_free());
        EXPECT_TRUE(sweep::no_leaks());
        return true;
    });
    RecordProperty("allocations", steps);
    EXPECT_GT(steps, 100);
    sweep::expect_all_hit(rows);
    // Only the lookup's own probe (its record and its key), the last two
    // allocations of the query, fail after the trees were built.
    EXPECT_EQ(probe_steps, (std::vector<long>{steps - 1, steps}));
}

}  // namespace
