// Loads that race queries.  A query that finds the file's time claimed by a
// load still running waits for that load's outcome: it never answers from
// trees the load has not built yet.  A node file replaced by turns by a
// regular file and a FIFO never makes a query block.
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "harness.h"
#include "oxidm.h"

namespace {

using oxtest::kNodeInfo;

constexpr int kLoadStartPoint = 155;  // the parse of a loaded text begins

std::atomic<bool> g_hold_load{false};
std::atomic<int> g_loads_held{0};
void hold_first_load(int id) {
    if (id != kLoadStartPoint || g_loads_held.fetch_add(1) != 0) return;
    while (g_hold_load.load()) usleep(1000);
}

class NodeFileRaces : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
    }
    void TearDown() override {
        trx_on_record(nullptr);
        oxtest::Test::TearDown();
    }
};

// The first query is held inside its load, after it claimed the file's time;
// a second query of the same time must wait and answer from the new trees.
TEST_F(NodeFileRaces, AQueryWaitsForTheLoadThatClaimedItsTime) {
    oxtest::write_file(kNodeInfo, "NODE:\nNAME: hosta\nCLUSTER: c\n", 1000);
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    g_hold_load.store(true);
    trx_on_record(hold_first_load);
    std::atomic<int32_t> first{0}, second{0};
    std::thread loader([&] { first.store(sec_is_in_any_cluster("hosta")); });
    while (g_loads_held.load() == 0) usleep(1000);
    std::atomic<bool> answered{false};
    std::thread waiter([&] {
        second.store(sec_is_in_any_cluster("hosta"));
        answered.store(true);
    });
    // Long enough for an unguarded query to answer from the empty trees.
    for (int i = 0; i < 200 && !answered.load(); ++i) usleep(1000);
    EXPECT_FALSE(answered.load()) << "answered while the load of its file's time was still running";
    g_hold_load.store(false);
    loader.join();
    waiter.join();
    EXPECT_EQ(first.load(), 1);
    EXPECT_EQ(second.load(), 1);
    EXPECT_EQ(g_loads_held.load(), 1) << "the waiting query loaded the file again";
}

// A starting daemon's threads query while the file is replaced every 2 ms;
// every version lists the host.
TEST_F(NodeFileRaces, FirstQueriesOfManyThreadsAgainstReplacedFiles) {
    oxtest::write_file(kNodeInfo, "NODE:\nNAME: hosta\nCLUSTER: v0\n", 1000);
    std::atomic<bool> stop{false};
    std::thread writer([&] {
        for (int v = 1; !stop.load(); ++v) {
            oxtest::write_file(kNodeInfo, "NODE:\nNAME: hosta\nCLUSTER: v" + std::to_string(v) + "\n", 1000 + v);
            usleep(2000);
        }
    });
    std::atomic<int> wrong{0};
    std::vector<std::thread> queries;
    for (int t = 0; t < 4; ++t)
        queries.emplace_back([&] {
            for (int i = 0; i < 3000; ++i)
                if (sec_is_in_any_cluster("hosta") != 1) wrong.fetch_add(1);
        });
    for (auto &q : queries) q.join();
    stop.store(true);
    writer.join();
    EXPECT_EQ(wrong.load(), 0);
}

// Queries while the node file is replaced by turns by a regular file and a
// FIFO: none blocks, and each answers 1 (listed) or -1 (the FIFO reported
// with 2650-693, or the trees a failed load left).  Run in a
// child under an alarm, so that a blocked query fails the test.
void flip_while_querying(void *) {
    alarm(30);
    const std::string regular = std::string(oxtest::kVarCfg) + "/.regular";
    const std::string fifo = std::string(oxtest::kVarCfg) + "/.fifo";
    std::atomic<bool> stop{false};
    std::thread flipper([&] {
        for (int v = 1; !stop.load(); ++v) {
            oxtest::write_file(regular, "NODE:\nNAME: hosta\nCLUSTER: c\n", 1000 + v);
            rename(regular.c_str(), kNodeInfo);
            usleep(500);
            mkfifo(fifo.c_str(), 0644);
            rename(fifo.c_str(), kNodeInfo);
            usleep(500);
        }
    });
    std::atomic<int> wrong{0};
    std::vector<std::thread> queries;
    for (int t = 0; t < 4; ++t)
        queries.emplace_back([&] {
            for (int i = 0; i < 2000; ++i) {
                const int32_t answer = sec_is_in_any_cluster("hosta");
                if (answer != 1 && answer != -1) wrong.fetch_add(1);
            }
        });
    for (auto &q : queries) q.join();
    stop.store(true);
    flipper.join();
    _exit(wrong.load() == 0 ? 0 : 1);
}

TEST_F(NodeFileRaces, ANodeFileFlippedToAFifoNeverBlocksAQuery) {
    EXPECT_EQ(oxtest::run_in_child(flip_while_querying, nullptr), 0) << "128+14: a query blocked";
}

}  // namespace
