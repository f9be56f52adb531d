// Allocation-failure sweep of a whole group lookup for a user who belongs to
// a dozen groups: every allocation of the call fails in turn.  At every
// step: 2650-654 with the size of an allocation of the lookup, status 6,
// count 0 and a null array, nothing leaked, the enumeration closed, the
// scan lock free (a lookup on another thread completes), and the next
// lookup gives the whole answer.
#include <unistd.h>

#include <chrono>
#include <future>
#include <string>
#include <vector>

#include "../unit/test_sweep.h"
#include "groups_db.h"
#include "oxidm.h"
#include "oxidm_state.h"

namespace {

using oxtest::num;

using Names = std::vector<std::string>;

std::string passwd_db() {
    return "many:x:2000:3000::/:/bin/sh\n"
           "none:x:2001:4294967295::/:/bin/sh\n";
}

// "many" has primary group g3000 and is a member of twelve more (one of
// them names the user twice); the groups lie between groups of others.
std::string group_db(Names *expected) {
    std::string text = "g3000:x:3000:many\n";
    expected->assign({"g3000"});
    for (int i = 1; i <= 12; ++i) {
        const std::string name = "group-" + std::string(i, 'x');  // names of growing length
        text += num("other", i) + num(":x:", 3100 + i) + ":someone\n";
        text += name + num(":x:", 3000 + i) + ":a,many" + (i == 7 ? ",many" : "") + ",b\n";
        expected->push_back(name);
        if (i == 7) expected->push_back(name);
    }
    return text;
}

class SweepGroups : public groupstest::Fixture {
  protected:
    void TearDown() override {
        idm_test_fail_alloc(0);
        groupstest::Fixture::TearDown();
    }
};

TEST_F(SweepGroups, EveryAllocationOfALookupForAUserInManyGroups) {
    Names expected;
    groupstest::write_db(passwd_db(), group_db(&expected));
    ASSERT_EQ(groupstest::get_groups("many").groups, expected);  // once-controls outside the count

    const long pw = sysconf(_SC_GETPW_R_SIZE_MAX), gr = sysconf(_SC_GETGR_R_SIZE_MAX);
    std::set<std::string> sizes{std::to_string(2 * pw), std::to_string(gr)};
    for (size_t i = 1; i <= expected.size(); ++i) sizes.insert(std::to_string(i * sizeof(idm_buffer)));
    for (const std::string &g : expected) sizes.insert(std::to_string(g.size() + 1));
    std::vector<sweep::Row> rows = {{"any allocation of the lookup", idm::kMsg654, "idm__native_get_groups", sizes,
                                     6, 6, 0}};
    std::set<std::string> sizes_seen;

    int steps = sweep::run([&](long n) {
        oxtest::clear_errors();
        const int endgrent_before = groupstest::endgrent_calls();
        idm_test_fail_alloc(n);
        const groupstest::Result r = groupstest::get_groups("many");
        const bool fired = idm_test_alloc_fired() != 0;
        idm_test_fail_alloc(0);
        // The enumeration is opened after the first five allocations, and
        // closed whenever it was opened.
        EXPECT_EQ(groupstest::endgrent_calls() - endgrent_before, !fired || n > 5 ? 1 : 0);
        if (!fired) {
            EXPECT_EQ(r.status, 0);
            EXPECT_EQ(r.groups, expected);
            EXPECT_TRUE(sweep::no_leaks());
            return false;
        }
        EXPECT_EQ(r.status, 6);
        EXPECT_TRUE(r.groups.empty());
        const oxtest::Error e = oxtest::last_error();
        sweep::Row *row = sweep::row_of(rows, e);
        if (row == nullptr) {
            ADD_FAILURE() << "no failure row for " << sweep::describe(e);
        } else {
            ++row->hits;
            sizes_seen.insert(e.inserts[1]);
        }
        // The scan lock is free: another thread's lookup completes.
        auto other = std::async(std::launch::async, [] { return groupstest::get_groups("none"); });
        if (other.wait_for(std::chrono::seconds(20)) != std::future_status::ready) {
            ADD_FAILURE() << "a lookup on another thread does not complete: the scan lock was left held";
            std::abort();  // the blocked thread cannot be joined
        }
        EXPECT_EQ(other.get().status, 0);
        EXPECT_EQ(groupstest::get_groups("many").groups, expected);
        EXPECT_TRUE(sweep::no_leaks());
        return true;
    });
    // User buffer, group buffer, the first element and its name, the scan
    // buffer, then each of 13 appends grows the array and copies a name.
    EXPECT_EQ(steps, 5 + 2 * 13);
    sweep::expect_all_hit(rows);
    EXPECT_EQ(sizes_seen, sizes) << "every size of the lookup was reported by some step";
}

}  // namespace
