// Group membership lookups (sec_idm_get_groups) against nss_wrapper
// databases: one table of users and databases -> groups, or the failure
// reported once with status 15 and empty outputs (getgrent_r errors are
// injected between the library and nss_wrapper); the precedence of
// failures; and the allocation-failure sweep of a whole lookup.
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <future>
#include <string>
#include <vector>

#include "../unit/test_sweep.h"
#include "groups_db.h"
#include "oxidm_state.h"

namespace {

using groupstest::Style;
using oxtest::num;

// Primary group id 4294967295 is -1: no primary group.
const std::string kPasswd =
    "alice:x:1000:100::/:/bin/sh\nbob:x:1001:200::/:/bin/sh\ncarol:x:1002:4294967295::/:/bin/sh\n"
    "dave:x:1003:300::/:/bin/sh\nerin:x:1004:4294967295::/:/bin/sh\nfrank:x:1005:999::/:/bin/sh\n"
    "gina:x:1006:504::/:/bin/sh\n";
// Enumeration order deliberately differs from name and id order.
const std::string kGroup =
    "zeta:x:500:alice,bob\nusers:x:100:alice,carol\ntwice:x:501:carol,alice,carol\ncase:x:502:Alice,ALICE,bob\n"
    "prefix:x:503:alicex,alic,xalice\nempty:x:504:\nstaff:x:200:\nalpha:x:505:alice,dave\nsolo:x:300:\n";

struct Row {
    const char *label;
    const char *user;
    std::vector<std::string> groups;  // when status is 0
    int msgno = 0;                    // else: the one report, status 15
    std::string insert = "";
    struct {
        int at = 0, times = 1;  // getgrent_r calls that fail (0: none)
        Style style = Style::kResult;
        int error = 0;
    } inject = {};
    std::string passwd = kPasswd, group = kGroup;
};

class Groups : public groupstest::Fixture {};

TEST_F(Groups, UsersToGroupsOrTheFailure) {
    const long gr = sysconf(_SC_GETGR_R_SIZE_MAX), pw = sysconf(_SC_GETPW_R_SIZE_MAX);
    ASSERT_GT(gr, 0);
    ASSERT_GT(pw, 0);
    // Entries just over the buffers: there is no retry with a larger buffer.
    const std::string long_gecos(static_cast<size_t>(2 * pw), 'g');
    std::string members = "x";
    while (members.size() < static_cast<size_t>(gr)) members += ",member";
    const std::string small = "kim:x:1010:700::/:/bin/sh\nlee:x:1011:701::/:/bin/sh\n";
    const std::vector<std::string> all = {"users", "zeta", "twice", "alpha"}, first_two = {"users", "zeta"};
    const Row rows[] = {
        {"primary group also lists the user: listed once, first", "alice", all},
        {"member names compare exactly (letter case, prefixes)", "bob", {"staff", "zeta", "case"}},
        {"primary id -1; a group naming the user twice is listed twice", "carol", {"users", "twice", "twice"}},
        {"primary group after the member group in the file", "dave", {"solo", "alpha"}},
        {"primary id -1 and no group: empty result", "erin", {}},
        {"no group lists the user: primary only", "gina", {"empty"}},
        {"unknown user", "nobody", {}, idm::kMsg698, "nobody"},
        {"user names compare exactly", "Alice", {}, idm::kMsg698, "Alice"},
        {"primary group missing", "frank", {}, idm::kMsg699, "999"},
        {"user entry larger than its buffer", "hank", {}, idm::kMsg698, "hank", {},
         "hank:x:1009:100:" + long_gecos + ":/:/bin/sh\n"},
        {"primary group entry larger than its buffer", "kim", {}, idm::kMsg699, "700", {}, small,
         "big:x:700:" + members + "\n"},
        {"scanned group larger than the buffer: ERANGE", "lee", {}, idm::kMsg700, std::to_string(ERANGE), {}, small,
         "own:x:701:\nlisted:x:702:lee\nbig:x:703:" + members + "\nlater:x:704:lee\n"},
        {"EINTR as result: repeated in place", "alice", all, 0, "", {2, 3, Style::kResult, EINTR}},
        {"EINTR in errno with -1: repeated in place", "alice", all, 0, "", {4, 2, Style::kErrno, EINTR}},
        {"EINTR on the first call", "alice", all, 0, "", {1, 1, Style::kResult, EINTR}},
        {"ENOENT as result ends the scan", "alice", first_two, 0, "", {3, 1, Style::kResult, ENOENT}},
        {"ENOENT in errno ends the scan", "alice", first_two, 0, "", {3, 1, Style::kErrno, ENOENT}},
        {"-1 with errno 0 ends the scan", "alice", first_two, 0, "", {3, 1, Style::kErrno, 0}},
        {"EIO as result fails", "alice", {}, idm::kMsg700, std::to_string(EIO), {3, 1, Style::kResult, EIO}},
        {"EIO in errno fails", "alice", {}, idm::kMsg700, std::to_string(EIO), {5, 1, Style::kErrno, EIO}},
        {"EACCES on the first call fails", "alice", {}, idm::kMsg700, std::to_string(EACCES),
         {1, 1, Style::kResult, EACCES}},
    };
    for (const Row &row : rows) {
        SCOPED_TRACE(row.label);
        groupstest::write_db(row.passwd, row.group);
        oxtest::clear_errors();
        groupstest::reset_interposition();
        if (row.inject.at > 0)
            groupstest::inject_getgrent_error(row.inject.at, row.inject.times, row.inject.style, row.inject.error);
        const groupstest::Result r = groupstest::get_groups(row.user);
        EXPECT_EQ(r.groups, row.groups);
        if (row.msgno == 0) {
            EXPECT_EQ(r.status, 0);
            EXPECT_TRUE(oxtest::nothing_reported());
        } else {
            EXPECT_EQ(r.status, 15);
            EXPECT_TRUE(oxtest::reported(15, row.msgno, {row.insert}));
            EXPECT_EQ(oxtest::reports_since_clear(), 1u);
        }
        // A scan (there is one once the user and the primary group are known)
        // closes the enumeration once; the next scan is whole again.
        EXPECT_EQ(groupstest::endgrent_calls(), row.msgno == idm::kMsg698 || row.msgno == idm::kMsg699 ? 0 : 1);
        groupstest::reset_interposition();
        if (row.inject.at > 0) {
            EXPECT_EQ(groupstest::get_groups("alice").groups, all);
        }
    }
}

// An append failure lets the scan go on; a later enumeration failure is the
// last failure recorded and gives the status.
TEST_F(Groups, LastFailureGivesTheStatus) {
    groupstest::write_db(kPasswd, kGroup);
    ASSERT_EQ(groupstest::get_groups("alice").status, 0);  // once-controls outside the count
    oxtest::clear_errors();
    groupstest::reset_interposition();
    idm_test_fail_alloc(6);                                        // growing the array for "zeta", 1st group
    groupstest::inject_getgrent_error(9, 1, Style::kResult, EIO);  // in place of "solo", 9th group
    EXPECT_EQ(groupstest::get_groups("alice").status, 15);
    idm_test_fail_alloc(0);
    EXPECT_EQ(oxtest::reports_since_clear(), 2u);
    EXPECT_TRUE(oxtest::reported(idm::kGroupsUnavailable, idm::kMsg700, {std::to_string(EIO)}));
    EXPECT_EQ(groupstest::getgrent_calls(), 9) << "the scan went on after the append failure";
}

std::string answer(const groupstest::Result &r) {
    std::string s = std::to_string(r.status);
    for (const std::string &g : r.groups) s += " " + g;
    return s;
}

// Every allocation of a lookup for a user in a dozen groups fails in turn
// (2650-654 with the size of an allocation of the lookup, status 6, empty
// outputs); the scan lock is free afterwards and the next lookup is whole.
TEST_F(Groups, SweepEveryAllocationOfALookup) {
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
