// The exported cluster queries through the shipped library: 1, 0 and -1
// for listed, unlisted and unknown hosts and active clusters.
#include <string>

#include "harness.h"
#include "oxidm.h"
#include "oxseclib_msg.h"

namespace {

using oxtest::kNodeInfo;

const char kFile[] = "NODE:\nNAME: hosta\nADDRESS: 10.1.1.1\nCLUSTER: clA clB\nNODE:\nNAME: hostc\nCLUSTER: ClA\n"
                     "NODE:\nNAME: beef 1host\nADDRESS: ::1 fd00::1 FD00::2 1.2.3.4\nCLUSTER: clD\n";

class ClusterQueries : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
    }
};

TEST_F(ClusterQueries, Answers) {
    const struct {
        const char *label, *host;
        const char *active;  // nullptr: the active cluster is not known
        int32_t any, in_active;
    } rows[] = {
        {"no file", "hosta", "clA", -1, -1},
        {"active is its first cluster", "hosta", "clA", 1, 1},
        {"another cluster is active", "hosta", "clC", 1, 0},
        {"no active cluster known", "hosta", nullptr, 1, -1},
        {"by address", "10.1.1.1", "clB", 1, 1},
        {"cluster names with case", "hostc", "clA", 1, 0},
        {"a prefix of the active name", "hosta", "clAx", 1, 0},
        {"not listed", "hostb", "clA", -1, -1},
        {"address from a colon", "::1", "clD", 1, 1},      {"from a hex letter", "fd00::1", "clD", 1, 1},
        {"from an upper-case one", "FD00::2", "clD", 1, 1}, {"name of hex letters", "beef", "clD", 1, 1},
        {"name from a digit", "1host", "clD", 1, 1},        {"address with a dot second", "1.2.3.4", "clD", 1, 1},
        {"null host", nullptr, "clA", -1, -1},
    };
    for (const auto &row : rows) {
        SCOPED_TRACE(row.label);
        if (&row != rows) oxtest::write_file(kNodeInfo, kFile, 1000);
        cux_fail_cluster_info(row.active == nullptr);
        cux_set_active_cluster(row.active);
        oxtest::clear_errors();
        EXPECT_EQ(sec_is_in_any_cluster(row.host), row.any);
        EXPECT_EQ(sec_is_in_active_cluster(row.host), row.in_active);
        EXPECT_TRUE(oxtest::nothing_but_list_ends());
    }
}

}  // namespace
