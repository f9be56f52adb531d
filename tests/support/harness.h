// Test harness shared by every test program: a private mount namespace with
// fresh configuration directories, assertions on the last reported error
// and on trace records, and the fault-injection hooks of the internal build.
#ifndef OXIDM_TEST_HARNESS_H
#define OXIDM_TEST_HARNESS_H

#include <gtest/gtest.h>
#include <pthread.h>
#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

#include "ox_cu.h"
#include "ox_mss.h"
#include "ox_tr.h"
#include "namespace.h"

namespace oxtest {

// Writes a file (creating it), optionally setting its modification time.
void write_file(const std::string &path, const std::string &content, int64_t mtime = -1);
void set_mtime(const std::string &path, int64_t mtime);
void remove_file(const std::string &path);

// Skips the current test unless the private namespace is active.
#define OXTEST_REQUIRE_NAMESPACE()                                                   \
    do {                                                                             \
        if (!::oxtest::in_private_namespace()) GTEST_SKIP() << "no mount namespace"; \
    } while (0)

// ---- last reported error (libox_cu stand-in, this thread) ----
struct Error {
    int status;
    int msgno;
    std::vector<std::string> inserts;
};
// The current error of this thread, as recorded by cu_set_error_1.
Error last_error();
// Checks status, message number and every insert of the current error, and
// that catalogue "oxseclib.cat", set 1 and reserved 0 were passed.
::testing::AssertionResult reported(int status, int msgno, const std::vector<std::string> &inserts);
// No cu_set_error_1 call since the last clear_errors().
::testing::AssertionResult nothing_reported();
// Nothing reported but the 2650-690 that a node file load leaves behind at
// the end of every blank-separated value list.
::testing::AssertionResult nothing_but_list_ends();
void clear_errors();
// Number of cu_set_error_1 calls on this thread since the last clear_errors().
unsigned long reports_since_clear();

// ---- trace records (libox_tr stand-in) ----
struct TraceRecord {
    int id;
    int kind;  // TRX_ID, TRX_DATA, TRX_STRINGS
    std::vector<std::string> items;  // raw bytes, texts with their NUL
    int32_t i32(size_t j) const;
    std::string text(size_t j) const;  // without the NUL
};
std::vector<TraceRecord> trace_records();
// Levels of "_SEI": Error, API, Mapping, Milestone, Diag.
void set_trace_levels(unsigned char error, unsigned char api, unsigned char mapping, unsigned char milestone,
                      unsigned char diag);
void reset_trace();  // all levels 0, records cleared

// Base fixture: resets errors, traces, stand-in overrides and (when the
// namespace is active) gives empty configuration directories.
class Test : public ::testing::Test {
  protected:
    void SetUp() override;
    void TearDown() override;
};

// Runs `body` in a child process; returns its exit status (or 128+signal).
// True when `m` is free (taken and given back at once).
inline bool unlocked(pthread_mutex_t *m) { return pthread_mutex_trylock(m) == 0 && pthread_mutex_unlock(m) == 0; }

int run_in_child(void (*body)(void *), void *arg);

}  // namespace oxtest

#ifdef OXIDM_FAULT_INJECTION
extern "C" {
void idm_test_fail_alloc(long nth);  // the nth allocation from now fails (0: off)
int idm_test_alloc_fired(void);
void idm_test_fail_mutex_init(int result);
void idm_test_on_secret_free(void (*hook)(const void *, size_t));
}
#endif

#endif
