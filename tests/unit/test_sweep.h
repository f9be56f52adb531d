// Allocation-failure sweeps: the 1st, 2nd, ... allocation of a whole
// operation fails in turn, until the operation completes without reaching a
// failure.  Each step must make exactly one 2650-654/658/691 report, of a
// site listed in the operation's table (message, function, status), answer
// what that row says now and at the next call, leak nothing, leave no lock
// held and free every block that held an identity or a path zeroed.
// Every row must be hit by some step, so a site that stops failing, or
// starts failing elsewhere, is noticed.
#ifndef OXIDM_TEST_SWEEP_H
#define OXIDM_TEST_SWEEP_H

#include <algorithm>
#include <atomic>
#include <functional>
#include <set>
#include <string>
#include <vector>

#include "harness.h"
#include "oxseclib_msg.h"
#include "test_mpm.h"

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/lsan_interface.h>
#endif

namespace sweep {

// A status and what follows it, as the operations give their answers.
inline std::string st(int status, const char *rest = "") { return std::to_string(status) + rest; }

// True when the leak checker finds no unreachable block now (always true
// without the address sanitizer; the exit check still runs).
inline bool no_leaks() {
#if defined(__SANITIZE_ADDRESS__)
    return __lsan_do_recoverable_leak_check() == 0;
#else
    return true;
#endif
}

inline std::atomic<int> g_unzeroed{0};
inline void check_zeroed(const void *p, size_t n) {
    const auto *b = static_cast<const unsigned char *>(p);
    if (std::any_of(b, b + n, [](unsigned char c) { return c != 0; })) g_unzeroed.fetch_add(1);
}

// Reports made during a step.  A later report replaces the current error,
// so an operation that goes on after a failure (a mapping walk) calls note()
// from its callbacks as well.
inline std::vector<oxtest::Error> g_notes;
inline unsigned long g_seen = 0;
inline void note() {
    if (cux_error_count() == g_seen) return;
    g_seen = cux_error_count();
    g_notes.push_back(oxtest::last_error());
}

// One failure site: its report, and the answers of the failed call and of
// the next one (nothing changed in between; any of `next`).
struct Row {
    const char *label;
    int msgno;
    const char *function;  // first insert ("" for a report without inserts)
    int recorded;          // status given with the report
    std::string now;
    std::set<std::string> next;
    std::set<std::string> sizes = {};  // second insert, when the row names the sizes of its allocations
    int hits = 0;
};

struct Operation {
    std::function<void(long n)> prepare;  // state before step n
    std::function<std::string()> call;    // the operation; its answer as a text
    std::string right;                    // the answer without a failure
    std::function<void()> settled;        // checks: no lock held, nothing left open
    std::function<void()> after;          // after a failure: checks that everything comes back
};

// Runs the sweep; returns the number of allocations the operation makes.
inline long run(const Operation &op, std::vector<Row> &rows, long limit = 400) {
    idm_test_on_secret_free(check_zeroed);
    struct Off {
        ~Off() {
            idm_test_fail_alloc(0);
            idm_test_on_secret_free(nullptr);
            EXPECT_EQ(g_unzeroed.exchange(0), 0) << "a block that held an identity or a path was freed unzeroed";
        }
    } off;
    for (long n = 1; n <= limit; ++n) {
        SCOPED_TRACE("failing allocation " + std::to_string(n));
        op.prepare(n);
        oxtest::clear_errors();
        g_notes.clear();
        g_seen = cux_error_count();
        idm_test_fail_alloc(n);
        const std::string got = op.call();
        const bool fired = idm_test_alloc_fired() != 0;
        idm_test_fail_alloc(0);
        note();
        op.settled();
        std::vector<oxtest::Error> failures;
        for (const oxtest::Error &e : g_notes)
            if (e.msgno == idm::kMsg654 || e.msgno == idm::kMsg658 || e.msgno == idm::kMsg691) failures.push_back(e);
        if (!fired) {
            EXPECT_EQ(got, op.right);
            EXPECT_TRUE(failures.empty());
            EXPECT_TRUE(no_leaks());
            for (const Row &r : rows) EXPECT_GT(r.hits, 0) << "no step failed at: " << r.label;
            return n - 1;
        }
        EXPECT_EQ(failures.size(), 1u) << "one report per failure";
        if (failures.empty()) continue;
        const oxtest::Error &e = failures.front();
        Row *row = nullptr;
        for (Row &r : rows)
            if (r.msgno == e.msgno && (*r.function == '\0' ? e.inserts.empty()
                                                             : e.inserts.size() == 2 && e.inserts[0] == r.function &&
                                                                   (r.sizes.empty() || r.sizes.count(e.inserts[1]))))
                row = &r;
        if (row == nullptr) {
            ADD_FAILURE() << "no row for message " << e.msgno << " inserts " << ::testing::PrintToString(e.inserts);
            continue;
        }
        SCOPED_TRACE(row->label);
        ++row->hits;
        EXPECT_EQ(e.status, row->recorded);
        EXPECT_EQ(got, row->now);
        const std::string next = op.call();
        EXPECT_TRUE(row->next.count(next)) << "next call answered " << next;
        op.after();
        op.settled();
        EXPECT_TRUE(no_leaks());
    }
    ADD_FAILURE() << "the operation never completed within " << limit << " allocations";
    return -1;
}

}  // namespace sweep

#endif
