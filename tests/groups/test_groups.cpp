// Group membership lookups (sec_idm_get_groups) against nss_wrapper
// databases: membership rules, failure rows, enumeration errors, allocation
// failures at every site, trace points.
#include <unistd.h>

#include <cerrno>
#include <string>
#include <vector>

#include "groups_db.h"
#include "oxidm.h"

using groupstest::get_groups;
using groupstest::Style;
using groupstest::write_db;
using Names = std::vector<std::string>;

namespace {

constexpr int kMsg654 = 275, kMsg698 = 323, kMsg699 = 324, kMsg700 = 325;

// Primary group id 4294967295 is -1: no primary group.
const char kPasswd[] =
    "alice:x:1000:100:Alice:/home/alice:/bin/sh\n"
    "bob:x:1001:200::/home/bob:/bin/sh\n"
    "carol:x:1002:4294967295::/home/carol:/bin/sh\n"
    "dave:x:1003:300::/:/bin/sh\n"
    "erin:x:1004:4294967295::/:/bin/sh\n"
    "frank:x:1005:999::/:/bin/sh\n"
    "gina:x:1006:504::/:/bin/sh\n";

// Enumeration order deliberately differs from name and id order.
const char kGroup[] =
    "zeta:x:500:alice,bob\n"
    "users:x:100:alice,carol\n"
    "twice:x:501:carol,alice,carol\n"
    "case:x:502:Alice,ALICE,bob\n"
    "prefix:x:503:alicex,alic,xalice\n"
    "empty:x:504:\n"
    "staff:x:200:\n"
    "alpha:x:505:alice,dave\n"
    "solo:x:300:\n";

class Groups : public groupstest::Fixture {};

// ---- membership ----

struct MembershipRow {
    const char *label;
    const char *user;
    Names expected;
};

TEST_F(Groups, MembershipFollowsPrimaryThenEnumerationOrder) {
    const MembershipRow rows[] = {
        {"primary group also lists the user: listed once, first", "alice", {"users", "zeta", "twice", "alpha"}},
        {"member names compare exactly (letter case, prefixes)", "bob", {"staff", "zeta", "case"}},
        {"primary id -1; a group naming the user twice is listed twice", "carol", {"users", "twice", "twice"}},
        {"primary group appears after the member group", "dave", {"solo", "alpha"}},
        {"primary id -1 and no group: empty result", "erin", {}},
        {"no group lists the user: primary only", "gina", {"empty"}},
    };
    write_db(kPasswd, kGroup);
    for (const MembershipRow &row : rows) {
        SCOPED_TRACE(row.label);
        oxtest::clear_errors();
        int endgrent_before = groupstest::endgrent_calls();
        groupstest::Result r = get_groups(row.user);
        EXPECT_EQ(r.status, 0);
        EXPECT_EQ(r.groups, row.expected);
        EXPECT_TRUE(oxtest::nothing_reported());
        EXPECT_EQ(groupstest::endgrent_calls() - endgrent_before, 1) << "enumeration closed once per scan";
    }
}

// ---- failure rows ----

struct FailureRow {
    const char *label;
    std::string passwd;
    std::string group;
    const char *user;
    int msgno;
    std::vector<std::string> inserts;
};

TEST_F(Groups, FailuresReportOnceAndLeaveEmptyOutputs) {
    const long gr_size = sysconf(_SC_GETGR_R_SIZE_MAX);
    const long pw_size = sysconf(_SC_GETPW_R_SIZE_MAX);
    ASSERT_GT(gr_size, 0);
    ASSERT_GT(pw_size, 0);
    // Entries just over the buffers: no retry with a larger buffer.
    const std::string long_gecos(static_cast<size_t>(2 * pw_size), 'g');
    std::string long_members = "x";
    while (long_members.size() < static_cast<size_t>(gr_size)) long_members += ",member";
    const std::string small_passwd = "kim:x:1010:700::/:/bin/sh\nlee:x:1011:701::/:/bin/sh\n";

    const FailureRow rows[] = {
        {"unknown user", kPasswd, kGroup, "nobody", kMsg698, {"nobody"}},
        {"user names compare exactly", kPasswd, kGroup, "Alice", kMsg698, {"Alice"}},
        {"primary group missing", kPasswd, kGroup, "frank", kMsg699, {"999"}},
        {"user entry larger than its buffer", "hank:x:1009:100:" + long_gecos + ":/:/bin/sh\n", kGroup, "hank",
         kMsg698, {"hank"}},
        {"primary group entry larger than its buffer", small_passwd, "big:x:700:" + long_members + "\n", "kim",
         kMsg699, {"700"}},
        {"scanned group entry larger than the buffer: getgrent_r fails with ERANGE", small_passwd,
         "own:x:701:\nlisted:x:702:lee\nbig:x:703:" + long_members + "\nlater:x:704:lee\n", "lee", kMsg700,
         {std::to_string(ERANGE)}},
    };
    for (const FailureRow &row : rows) {
        SCOPED_TRACE(row.label);
        write_db(row.passwd, row.group);
        oxtest::clear_errors();
        groupstest::Result r = get_groups(row.user);
        EXPECT_EQ(r.status, 15);
        EXPECT_TRUE(oxtest::reported(15, row.msgno, row.inserts));
        EXPECT_EQ(oxtest::reports_since_clear(), 1u);
    }
}

// ---- enumeration errors (interposed getgrent_r) ----

struct EnumerationRow {
    const char *label;
    int at;  // first failing getgrent_r call of the scan
    int times;
    Style style;
    int error;
    int status;
    std::vector<std::string> inserts;  // of 2650-700 when status is 15
    Names expected;                    // when status is 0
};

TEST_F(Groups, EnumerationErrorsRetryEndOrFail) {
    const Names all = {"users", "zeta", "twice", "alpha"};
    const EnumerationRow rows[] = {
        {"EINTR as result: repeated in place", 2, 3, Style::kResult, EINTR, 0, {}, all},
        {"EINTR in errno with -1: repeated in place", 4, 2, Style::kErrno, EINTR, 0, {}, all},
        {"EINTR on the first call", 1, 1, Style::kResult, EINTR, 0, {}, all},
        {"ENOENT as result ends the scan", 3, 1, Style::kResult, ENOENT, 0, {}, {"users", "zeta"}},
        {"ENOENT in errno ends the scan", 3, 1, Style::kErrno, ENOENT, 0, {}, {"users", "zeta"}},
        {"-1 with errno 0 ends the scan", 3, 1, Style::kErrno, 0, 0, {}, {"users", "zeta"}},
        {"EIO as result fails", 3, 1, Style::kResult, EIO, 15, {std::to_string(EIO)}, {}},
        {"EIO in errno fails", 5, 1, Style::kErrno, EIO, 15, {std::to_string(EIO)}, {}},
        {"EACCES on the first call fails", 1, 1, Style::kResult, EACCES, 15, {std::to_string(EACCES)}, {}},
    };
    write_db(kPasswd, kGroup);
    for (const EnumerationRow &row : rows) {
        SCOPED_TRACE(row.label);
        oxtest::clear_errors();
        groupstest::reset_interposition();
        groupstest::inject_getgrent_error(row.at, row.times, row.style, row.error);
        groupstest::Result r = get_groups("alice");
        EXPECT_EQ(r.status, row.status);
        if (row.status == 0) {
            EXPECT_EQ(r.groups, row.expected);
            EXPECT_TRUE(oxtest::nothing_reported());
        } else {
            EXPECT_TRUE(oxtest::reported(15, kMsg700, row.inserts));
            EXPECT_EQ(oxtest::reports_since_clear(), 1u);
        }
        EXPECT_EQ(groupstest::endgrent_calls(), 1);
    }
    // Nothing left behind: the next scan is complete.
    groupstest::reset_interposition();
    EXPECT_EQ(get_groups("alice").groups, all);
}

// ---- allocation failures ----

struct AllocationRow {
    const char *label;
    const char *user;
    std::vector<long> sizes;  // bytes requested at each allocation site, in order
};

// Every allocation of the call fails once, in turn: status 6 with the size
// requested, count 0 and null array, nothing leaked (ASan/LSan), and the
// call after it works.
TEST_F(Groups, EachAllocationFailureReportsItsSize) {
    const long pw = sysconf(_SC_GETPW_R_SIZE_MAX);
    const long gr = sysconf(_SC_GETGR_R_SIZE_MAX);
    const long element = sizeof(idm_buffer);
    const AllocationRow rows[] = {
        {"primary group, then appends that grow the array",
         "alice",
         {2 * pw, gr, element, 6 /* users */, gr, 2 * element, 5 /* zeta */, 3 * element, 6 /* twice */,
          4 * element, 6 /* alpha */}},
        {"no primary group: the first append makes the array",
         "carol",
         {2 * pw, gr, element, 6 /* users */, 2 * element, 6 /* twice */, 3 * element, 6 /* twice */}},
    };
    write_db(kPasswd, kGroup);
    ASSERT_EQ(get_groups("alice").status, 0);  // once-controls run outside the count
    for (const AllocationRow &row : rows) {
        SCOPED_TRACE(row.label);
        for (size_t site = 0; site < row.sizes.size(); ++site) {
            SCOPED_TRACE("allocation " + std::to_string(site + 1));
            oxtest::clear_errors();
            idm_test_fail_alloc(static_cast<long>(site) + 1);
            groupstest::Result r = get_groups(row.user);
            EXPECT_TRUE(idm_test_alloc_fired());
            EXPECT_EQ(r.status, 6);
            EXPECT_TRUE(oxtest::reported(6, kMsg654, {"idm__native_get_groups", std::to_string(row.sizes[site])}));
            EXPECT_EQ(oxtest::reports_since_clear(), 1u);
        }
        idm_test_fail_alloc(static_cast<long>(row.sizes.size()) + 1);
        long before = idm_test_alloc_calls();
        EXPECT_EQ(get_groups(row.user).status, 0);
        EXPECT_FALSE(idm_test_alloc_fired()) << "more allocation sites than listed";
        EXPECT_EQ(idm_test_alloc_calls() - before, static_cast<long>(row.sizes.size()));
        idm_test_fail_alloc(0);
    }
}

// An append failure lets the scan go on; a later enumeration failure is the
// last failure recorded and gives the status.
TEST_F(Groups, LastFailureGivesTheStatus) {
    write_db(kPasswd, kGroup);
    ASSERT_EQ(get_groups("alice").status, 0);
    oxtest::clear_errors();
    groupstest::reset_interposition();
    idm_test_fail_alloc(6);                                        // growing the array for "zeta", 1st group
    groupstest::inject_getgrent_error(9, 1, Style::kResult, EIO);  // in place of "solo", 9th group
    groupstest::Result r = get_groups("alice");
    EXPECT_EQ(r.status, 15);
    EXPECT_EQ(oxtest::reports_since_clear(), 2u);
    EXPECT_TRUE(oxtest::reported(15, kMsg700, {std::to_string(EIO)}));
    EXPECT_EQ(groupstest::getgrent_calls(), 9) << "the scan went on after the append failure";
    idm_test_fail_alloc(0);
}

// ---- trace ----

TEST_F(Groups, TracePoints) {
    write_db(kPasswd, kGroup);
    ASSERT_EQ(get_groups("alice").status, 0);  // the library's initialisation traces on its own
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    ASSERT_EQ(get_groups("alice").status, 0);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{98, 113, 116, 101}));

    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    idm_buffer user{7, const_cast<char *>("nobody")};
    uint32_t count = 0;
    idm_buffer *list = nullptr;
    ASSERT_EQ(sec_idm_get_groups(&user, &count, &list), 15);
    std::vector<oxtest::TraceRecord> records = oxtest::trace_records();
    ASSERT_EQ(records.size(), 4u);
    EXPECT_EQ(records[0].id, 100);
    EXPECT_EQ(records[1].id, 115);
    ASSERT_EQ(records[1].items.size(), 3u);
    EXPECT_EQ(records[1].u64(0), reinterpret_cast<uintptr_t>(&user));
    EXPECT_EQ(records[1].u64(1), reinterpret_cast<uintptr_t>(&count));
    EXPECT_EQ(records[1].u64(2), reinterpret_cast<uintptr_t>(&list));
    EXPECT_EQ(records[2].id, 117);
    ASSERT_EQ(records[2].items.size(), 1u);
    EXPECT_EQ(records[2].i32(0), 15);
    EXPECT_EQ(records[3].id, 102);
}

}  // namespace
