// Shared pieces of the group lookup tests: the nss_wrapper database files,
// a call of sec_idm_get_groups that takes the result apart and frees it as a
// caller must, and control of the getgrent_r/endgrent interposition that this
// program puts between the library and nss_wrapper.
#ifndef OXIDM_TEST_GROUPS_DB_H
#define OXIDM_TEST_GROUPS_DB_H

#include <cstdint>
#include <string>
#include <vector>

#include "harness.h"

namespace groupstest {

// Writes the passwd and group files that nss_wrapper serves (the paths come
// from NSS_WRAPPER_PASSWD and NSS_WRAPPER_GROUP, set by ctest).  Each file is
// replaced by a rename, which nss_wrapper notices at its next lookup.
void write_db(const std::string &passwd, const std::string &group);

struct Result {
    int32_t status;
    std::vector<std::string> groups;
};
// Calls sec_idm_get_groups for `user` with outputs preset to garbage, checks
// the output contract (count 0 and null array on failure or when empty,
// length = name length + 1 for every element) and frees the result with
// free(), element values first, as the public header documents.
Result get_groups(const char *user);

// How an injected getgrent_r failure is returned.
enum class Style {
    kResult,  // glibc: the error number is the result, errno untouched
    kErrno,   // -1 with errno set (as nss_wrapper reports ERANGE)
};
// From the `at`-th getgrent_r call on (1-based, counted from now), `times`
// calls fail with `error` without reaching the database, so the enumeration
// position does not move.
void inject_getgrent_error(int at, int times, Style style, int error);
// The `at`-th getgrent_r call from now blocks in a cancellation point until
// the thread is cancelled (or 30 s pass); block_entered() tells when it is there.
void block_getgrent_at(int at);
bool block_entered();
// Counters since the last reset_interposition().
int getgrent_calls();
int endgrent_calls();
void reset_interposition();

// Base fixture: checks that nss_wrapper is preloaded, gives this process its
// own database directory and clears the interposition.
class Fixture : public oxtest::Test {
  protected:
    void SetUp() override;
};

}  // namespace groupstest

#endif
