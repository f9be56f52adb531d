// Threads for the lock and cluster-map tests: a POSIX thread running a
// closure (so it can be cancelled), and a wait until a thread sleeps in a
// futex wait on a given object, read from /proc/self/task/<tid>/syscall.
// That tells "blocked on readers_ok" from "blocked on writer_ok" without
// any sleep-based guessing.
#ifndef TEST_CLUSTER_THREADS_H
#define TEST_CLUSTER_THREADS_H

#include <pthread.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <functional>
#include <string>
#include <thread>

namespace cluster_test {

class Thread {
  public:
    explicit Thread(std::function<void()> body) : body_(std::move(body)) {
        started_ = pthread_create(&thread_, nullptr, &Thread::run, this) == 0;
    }
    ~Thread() {
        if (started_ && !joined_) join();
    }
    Thread(const Thread &) = delete;
    Thread &operator=(const Thread &) = delete;

    pid_t tid() const {
        while (tid_.load() == 0) std::this_thread::yield();
        return tid_.load();
    }
    void cancel() { pthread_cancel(thread_); }
    // True when the thread ended by cancellation.
    bool join() {
        void *result = nullptr;
        pthread_join(thread_, &result);
        joined_ = true;
        return result == PTHREAD_CANCELED;
    }

  private:
    static void *run(void *self) {
        auto *t = static_cast<Thread *>(self);
        t->tid_.store(static_cast<pid_t>(syscall(SYS_gettid)));
        t->body_();
        return nullptr;
    }
    std::function<void()> body_;
    pthread_t thread_{};
    std::atomic<pid_t> tid_{0};
    bool started_ = false;
    bool joined_ = false;
};

// True once thread `tid` sleeps in futex() on an address inside `object`
// (a condition variable); false after about 30 s.
template <class T>
bool blocked_on(pid_t tid, const T &object) {
    const auto begin = reinterpret_cast<uintptr_t>(&object);
    const std::string path = "/proc/self/task/" + std::to_string(tid) + "/syscall";
    for (int i = 0; i < 300000; ++i) {
        std::ifstream f(path);
        long nr = -1;
        std::string arg;
        if (f >> nr >> arg && nr == SYS_futex) {
            uintptr_t address = std::stoull(arg, nullptr, 16);
            if (address >= begin && address < begin + sizeof(T)) return true;
        }
        usleep(100);
    }
    return false;
}

// Whether /proc shows the system call a thread sleeps in (blocked_on needs it).
inline bool can_see_blocked_threads() {
    std::ifstream f("/proc/self/syscall");
    long nr = -1;
    return static_cast<bool>(f >> nr);
}

// Spins (yielding) until `flag` is true; false after about 30 s.
inline bool eventually(const std::atomic<bool> &flag) {
    for (int i = 0; i < 300000 && !flag.load(); ++i) usleep(100);
    return flag.load();
}

}  // namespace cluster_test

#endif
