// Threads for the concurrency tests: a thread that can be cancelled, waits
// bounded by progress (30 s at most, for a loaded machine), and the
// condition variable a thread sleeps on, read from /proc, so that "waits to
// read" and "waits to write" are established without guessing by time.
#ifndef OXIDM_TEST_THREADS_H
#define OXIDM_TEST_THREADS_H

#include <pthread.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <functional>
#include <string>
#include <thread>

#include "harness.h"
#include "oxsec_lock.h"

namespace threads {

inline bool eventually(const std::function<bool()> &done) {
    for (int i = 0; i < 300000 && !done(); ++i) usleep(100);
    return done();
}

struct Thread {
    std::atomic<pid_t> tid_{0};
    std::atomic<bool> returned_{false};
    explicit Thread(std::function<void()> body)
        : thread_([this, body] {
              tid_ = static_cast<pid_t>(syscall(SYS_gettid));
              body();
              returned_ = true;
          }) {}
    ~Thread() { (void)cancel(false); }
    pid_t tid() const { return eventually([this] { return tid_ != 0; }), tid_.load(); }
    // Cancels (or only joins) the thread; true when it ended by cancellation.
    bool cancel(bool really = true) {
        if (!thread_.joinable()) return false;
        if (really) pthread_cancel(thread_.native_handle());
        thread_.join();
        return !returned_;
    }
    std::thread thread_;  // last: runs once the rest is set up
};

// What thread `tid` sleeps on: 'R' readers_ok or 'W' writer_ok of `lock`, else 0.
inline char waits_on(pid_t tid, const sec_rwlock &lock) {
    std::ifstream f("/proc/self/task/" + std::to_string(tid) + "/syscall");
    long nr = -1;
    std::string arg;
    if (!(f >> nr >> arg) || nr != SYS_futex) return 0;
    const uintptr_t a = std::stoull(arg, nullptr, 16);
    auto in = [a](const pthread_cond_t &c) { return a >= uintptr_t(&c) && a < uintptr_t(&c) + sizeof c; };
    return in(lock.readers_ok) ? 'R' : in(lock.writer_ok) ? 'W' : 0;
}
inline bool can_see_blocked_threads() { return std::ifstream("/proc/self/syscall").peek() != EOF; }

using Counts = std::pair<int32_t, uint32_t>;  // lock_count, waiting_writers
// Read under the lock's mutex, which also proves that no thread left it locked.
inline Counts counts(sec_rwlock &lock) {
    pthread_mutex_lock(&lock.mutex);
    const Counts c{lock.lock_count, lock.waiting_writers};
    pthread_mutex_unlock(&lock.mutex);
    return c;
}

// The fixture of the tests with files: the private namespace, and /proc
// showing what a thread sleeps on.
class Test : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        if (!can_see_blocked_threads()) GTEST_SKIP() << "/proc/<pid>/syscall not readable";
    }
};

}  // namespace threads

#endif
