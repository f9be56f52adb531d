// Allocation-failure sweeps: the 1st, 2nd, ... allocation of a whole
// operation fails in turn, until the operation completes without reaching
// a failure.  Each step must report the failure row of the site that
// failed (message, status, inserts), leak nothing, leave no lock held and
// no descriptor open, and the calls after it must give the right answer.
//
// The failure rows of an operation are listed once; a step's report picks
// its row by message and inserts, and every row must be hit by some step,
// so a site that stops failing (or starts failing elsewhere) is noticed.
#ifndef OXIDM_TEST_SWEEP_H
#define OXIDM_TEST_SWEEP_H

#include <dirent.h>

#include <functional>
#include <set>
#include <string>
#include <vector>

#include "harness.h"
#include "test_mpm.h"

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/lsan_interface.h>
#endif

namespace sweep {

// True when the leak checker finds no unreachable block now (always true
// without the address sanitizer; the process exit check still runs).
inline bool no_leaks() {
#if defined(__SANITIZE_ADDRESS__)
    return __lsan_do_recoverable_leak_check() == 0;
#else
    return true;
#endif
}

inline bool unlocked(pthread_mutex_t *m) {
    if (pthread_mutex_trylock(m) != 0) return false;
    pthread_mutex_unlock(m);
    return true;
}

// One failure site: the report it makes and what the operation does then.
struct Row {
    const char *label;
    int msgno;
    std::string function;        // first insert
    std::set<std::string> sizes;  // second insert: the bytes of any allocation of this site
    int recorded;                // status given to cu_set_error_1
    int returned;                // status of the whole operation
    int outcome;                 // meaning defined by the sweep
    int hits = 0;
};

// The row whose message, function and size match `e` (a row without a
// function: a message without inserts), or nullptr.
inline Row *row_of(std::vector<Row> &rows, const oxtest::Error &e) {
    for (Row &r : rows) {
        if (r.msgno != e.msgno) continue;
        if (r.function.empty() ? e.inserts.empty()
                               : e.inserts.size() == 2 && e.inserts[0] == r.function && r.sizes.count(e.inserts[1]))
            return &r;
    }
    return nullptr;
}

inline std::string describe(const oxtest::Error &e) {
    std::string s = "status " + std::to_string(e.status) + " message " + std::to_string(e.msgno) + " [";
    for (const std::string &i : e.inserts) s += "\"" + i + "\" ";
    return s + "]";
}

// Runs step(n) for n = 1, 2, ... with the n-th allocation from the start of
// the operation failing; step returns whether the failure fired.  Returns
// the number of allocations the operation makes (the steps that fired).
inline int run(const std::function<bool(long)> &step, long limit = 400) {
    for (long n = 1; n <= limit; ++n) {
        SCOPED_TRACE("failing allocation " + std::to_string(n));
        if (!step(n)) return static_cast<int>(n - 1);
        if (::testing::Test::HasFatalFailure()) return -1;
    }
    ADD_FAILURE() << "the operation never completed within " << limit << " allocations";
    return -1;
}

// Every row was reached by at least one step.
inline void expect_all_hit(const std::vector<Row> &rows) {
    for (const Row &r : rows) EXPECT_GT(r.hits, 0) << "no step failed at: " << r.label;
}

}  // namespace sweep

#endif
