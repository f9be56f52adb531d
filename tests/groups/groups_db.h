// Shared pieces of the group lookup tests: the nss_wrapper database files, a
// call of sec_idm_get_groups that checks the output contract and frees the
// result as a caller must, and the getgrent_r/endgrent interposition this
// program puts between the library and nss_wrapper.
#ifndef OXIDM_TEST_GROUPS_DB_H
#define OXIDM_TEST_GROUPS_DB_H

#include <cstdint>
#include <string>
#include <vector>

#include "harness.h"

namespace groupstest {

// Replaces the passwd and group files that nss_wrapper serves (paths from
// NSS_WRAPPER_PASSWD and NSS_WRAPPER_GROUP, in the private /tmp).
void write_db(const std::string &passwd, const std::string &group);

struct Result {
    int32_t status;
    std::vector<std::string> groups;
};
// sec_idm_get_groups for `user`, outputs preset to garbage: checks count 0
// and a null array on failure or when empty, length = name length + 1 for
// every element, and frees each value, then the array.
Result get_groups(const char *user);

// How an injected getgrent_r failure is returned: glibc's way (the error
// number as the result) or -1 with errno set (nss_wrapper's ERANGE).
enum class Style { kResult, kErrno };
// From the `at`-th getgrent_r call from now on (1-based), `times` calls fail
// with `error` without reaching the database (the position does not move).
void inject_getgrent_error(int at, int times, Style style, int error);
// The `at`-th getgrent_r call from now blocks in a cancellation point until
// the thread is cancelled (or 30 s pass); block_entered() tells when.
void block_getgrent_at(int at);
bool block_entered();
// Calls since the last reset_interposition().
int getgrent_calls();
int endgrent_calls();
void reset_interposition();

// Needs the private namespace and nss_wrapper preloaded (run through ctest).
class Fixture : public oxtest::Test {
  protected:
    void SetUp() override;
};

}  // namespace groupstest

#endif
