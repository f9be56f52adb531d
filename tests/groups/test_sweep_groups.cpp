// Allocation-failure sweep of a whole group lookup for a user in a dozen
// groups: every allocation of the call fails in turn (2650-654 with the size
// of an allocation of the lookup, status 6, empty outputs); the scan lock is
// free afterwards (a lookup on another thread completes) and the next lookup
// gives the whole answer.
#include <unistd.h>

#include <chrono>
#include <future>

#include "../unit/test_sweep.h"
#include "groups_db.h"
#include "oxidm_internal.h"

namespace {

using oxtest::num;

class SweepGroups : public groupstest::Fixture {
  protected:
    void TearDown() override {
        idm_test_fail_alloc(0);
        groupstest::Fixture::TearDown();
    }
};

std::string answer(const groupstest::Result &r) {
    std::string s = std::to_string(r.status);
    for (const std::string &g : r.groups) s += " " + g;
    return s;
}

TEST_F(SweepGroups, LookupForAUserInManyGroups) {
    // Primary group g3000, then twelve groups of growing name length among
    // groups of others; the 7th names the user twice.
    std::string group = "g3000:x:3000:many\n", right = "0 g3000";
    for (int i = 1; i <= 12; ++i) {
        const std::string name = "group-" + std::string(i, 'x');
        group += num("other", i) + num(":x:", 3100 + i) + ":someone\n" + name + num(":x:", 3000 + i) + ":a,many" +
                 (i == 7 ? ",many" : "") + ",b\n";
        right += " " + name + (i == 7 ? " " + name : "");
    }
    groupstest::write_db("many:x:2000:3000::/:/bin/sh\nnone:x:2001:4294967295::/:/bin/sh\n", group);
    ASSERT_EQ(answer(groupstest::get_groups("many")), right);  // once-controls outside the count

    const long pw = sysconf(_SC_GETPW_R_SIZE_MAX), gr = sysconf(_SC_GETGR_R_SIZE_MAX);
    std::set<std::string> sizes{std::to_string(2 * pw), std::to_string(gr), "6"};  // buffers, "g3000"
    for (size_t i = 1; i <= 14; ++i) sizes.insert(std::to_string(i * sizeof(idm_buffer)));
    for (size_t i = 1; i <= 12; ++i) sizes.insert(std::to_string(7 + i));
    std::vector<sweep::Row> rows = {{"any allocation", idm::kMsg654, "idm__native_get_groups", sizes, 6, "6", {right}}};
    sweep::Operation op{
        [](long) {},
        [] { return answer(groupstest::get_groups("many")); },
        right,
        [] {  // the scan lock is free: another thread's lookup completes
            auto other = std::async(std::launch::async, [] { return groupstest::get_groups("none").status; });
            if (other.wait_for(std::chrono::seconds(20)) != std::future_status::ready) {
                ADD_FAILURE() << "a lookup on another thread does not complete: the scan lock was left held";
                std::_Exit(1);  // the blocked thread cannot be joined
            }
            EXPECT_EQ(other.get(), 0);
        },
        [] {},
    };
    // User buffer, group buffer, the first element and its name, the scan
    // buffer, then each of 13 appends grows the array and copies a name.
    EXPECT_EQ(sweep::run(op, rows), 5 + 2 * 13);
}

}  // namespace
