// The reader-writer lock with real threads: writer preference, whom a release
// wakes, promotion and demotion, and cancellation of every kind of waiter.
// Each wait is established by the condition variable the thread sleeps on.
#include <memory>
#include <sstream>
#include <vector>

#include "harness.h"
#include "threads.h"

namespace {

using threads::eventually;

void run(sec_rwlock *lock, char op) {
    void (*const ops[])(sec_rwlock *) = {sec__lock_read,   sec__lock_write,  sec__lock_promote,
                                         sec__lock_demote, sec__unlock_read, sec__unlock_write};
    ops[std::string("rwpduU").find(op)](lock);
}

// A thread obeying one order at a time: r/w lock, p promote, d demote, u/U
// unlock read/write, x leave.  held() is what it holds once its order is done.
struct Actor {
    std::atomic<char> order_{0}, held_{0};
    std::atomic<bool> busy_{false};
    explicit Actor(sec_rwlock *lock)
        : thread_([this, lock] {
              for (char c;; busy_ = false) {
                  while ((c = order_.exchange(0)) == 0) usleep(100);
                  if (c == 'x') return;
                  run(lock, c);
                  held_ = c == 'w' || c == 'p' ? 'w' : c == 'r' || c == 'd' ? 'r' : 0;
              }
          }) {}
    ~Actor() { busy_ ? (void)thread_.cancel() : order('x'); }  // still waiting: a failed scenario
    void order(char c) { busy_ = true, order_ = c; }
    bool busy() const { return busy_; }
    char held() const { return busy_ ? 0 : held_.load(); }
    threads::Thread thread_;  // last: started once the rest is set up
};

// Steps: "M<op>" the test thread runs r, w, u or U; "A<op><then>" actor A
// (to D) is ordered op and then has it ('>') or sleeps on readers_ok ('R')
// or writer_ok ('W'); "A>" A's order completes; "A." A still waits; "Ac" A
// is cancelled while it waits; "*U" the actor holding the write hold
// releases it; "Mz" the test thread's read hold ends without waking anyone
// (as when the writer it wakes is cancelled at once); "=h,w" the counters
// become lock_count h, waiting_writers w.
const char *const kScenarios[][2] = {
    {"a waiting writer holds back new readers and goes first",
     "Mr Mr AwW BrR =2,1 Mu =1,1 A. Mu A> =-1,0 B. AU B> =1,0 Bu =0,0"},
    {"a cancelled waiting writer releases the readers it held back", "Mr Mr AwW BrR Ac B> =3,0 Mu Mu Bu =0,0"},
    {"a writer cancelled as the last reader leaves passes its wake-up on to the readers", "Mr AwW CrR Mz Ac C> =1,0 Cu =0,0"},
    {"a cancelled waiting reader leaves the counters alone", "Mw ArR Ac =-1,0 Mt- MU =0,0 Mt+ =-1,0 MU Mr Mt- Mu"},
    {"a leaving writer wakes every reader when no writer waits", "Mw ArR BrR CrR MU A> B> C> =3,0 Au Bu Cu =0,0"},
    {"a leaving writer passes the lock to one waiting writer",
     "Mw AwW BwW CrR MU =-1,1 C. *U =-1,0 C. *U C> =1,0 Cu =0,0"},
    {"two readers promote one after the other, then a sole reader at once", "Ar> Br> ApW =1,1 Bp> =-1,1 A. BU A> =-1,0 AU =0,0 Cr> Cp> =-1,0 CU =0,0"},
    {"a cancelled promoter holds nothing and releases the readers", "Mr Ar> ApW BrR =1,1 Ac B> =2,0 Mu Bu =0,0"},
    {"a demoting writer waits behind both waiting writers",
     "Aw> BwW CwW AdR =-1,1 A. *U =-1,0 A. *U A> =1,0 Au =0,0"},
    {"a cancelled demoter holds nothing", "Aw> BwW AdR =-1,0 Ac =-1,0 BU =0,0"},
};

TEST(Lock, Scenarios) {
    if (!threads::can_see_blocked_threads()) GTEST_SKIP() << "/proc/<pid>/syscall not readable";
    for (const auto &s : kScenarios) {
        SCOPED_TRACE(s[0]);
        sec_rwlock lock;
        sec__lock_init(&lock);
        std::vector<std::unique_ptr<Actor>> actors;
        for (int i = 0; i < 4; ++i) actors.push_back(std::make_unique<Actor>(&lock));
        std::istringstream in(s[1]);
        for (std::string step; in >> step;) {
            SCOPED_TRACE(step);
            Actor *a = step[0] >= 'A' && step[0] <= 'D' ? actors[step[0] - 'A'].get() : nullptr;
            auto done = [&a] { return !a->busy(); };
            if (step[0] == '=') {
                const threads::Counts want(std::stoi(step.substr(1)), std::stoi(step.substr(step.find(',') + 1)));
                ASSERT_TRUE(eventually([&] { return threads::counts(lock) == want; }));
            } else if (step[1] == 't') {  // "Mt+", "Mt-": the try-lock takes the write hold, or fails
                EXPECT_EQ(sec__trylock_write(&lock), step[2] == '+' ? 0 : -1);
            } else if (step == "Mz") {  // a read hold ends; its wake-up is lost with a writer being cancelled
                pthread_mutex_lock(&lock.mutex);
                --lock.lock_count;
                pthread_mutex_unlock(&lock.mutex);
            } else if (step[0] == 'M') {
                run(&lock, step[1]);
            } else if (step == "*U") {
                ASSERT_TRUE(eventually([&] {
                    for (auto &b : actors)
                        if (b && b->held() == 'w') return a = b.get(), true;
                    return false;
                }));
                a->order('U');
                ASSERT_TRUE(eventually(done));
            } else if (step[1] == '>') {
                ASSERT_TRUE(eventually(done));
            } else if (step[1] == '.') {
                EXPECT_TRUE(a->busy());
            } else if (step[1] == 'c') {
                ASSERT_TRUE(a->thread_.cancel());
                actors[step[0] - 'A'].reset();
            } else {
                a->order(step[1]);
                ASSERT_TRUE(eventually([&] { return step[2] == '>' ? done() : threads::waits_on(a->thread_.tid(), lock) == step[2]; }));
            }
        }
        actors.clear();
        sec__lock_destroy(&lock);
    }
}

}  // namespace
