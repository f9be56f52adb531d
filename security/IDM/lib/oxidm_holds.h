// Allocation and holds: every allocation of the library goes through the
// seam below, and every hold (a lock, a descriptor, a half-built record) is
// an RAII object whose destructor is the named cancellation clean-up.  glibc
// cancels a C++ thread by a forced unwind, which runs the destructors, so a
// thread cancelled inside an MPM routine or while waiting leaves nothing
// locked or open.  The library is built with exceptions enabled for that
// reason and never catches the forced unwind.
#ifndef OXIDM_HOLDS_H
#define OXIDM_HOLDS_H

#include <pthread.h>
#include <sys/types.h>
#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/asan_interface.h>
#endif

#include <cstddef>
#include <cstdlib>
#include <ctime>
#include <utility>

#include "oxidm.h"
#include "oxidm_annotations.h"

extern "C" {
// The clean-up handler of a held mutex: unlocks it.
void idm__thread_cleanup_mutex(void *mutex);
}

namespace idm {

// ---- allocation seam ----
//
// Tests of the fault-injection build fail the n-th allocation through these;
// the shipped library compiles them to the plain calls.
#ifdef OXIDM_FAULT_INJECTION
bool fault_alloc_fires();
inline void *xmalloc(size_t n) { return fault_alloc_fires() ? nullptr : std::malloc(n); }
inline void *xcalloc(size_t n, size_t size) { return fault_alloc_fires() ? nullptr : std::calloc(n, size); }
inline void *xrealloc(void *p, size_t n) { return fault_alloc_fires() ? nullptr : std::realloc(p, n); }
int fault_mutex_init_result();
void fault_note_secret_free(const void *p, size_t n);
#else
inline void *xmalloc(size_t n) { return std::malloc(n); }
inline void *xcalloc(size_t n, size_t size) { return std::calloc(n, size); }
inline void *xrealloc(void *p, size_t n) { return std::realloc(p, n); }
#endif

// Heap copy of `s` (length + 1 bytes), or nullptr.
char *xstrdup(const char *s);
// Zeroes a text that held an identity or a path over its length, then frees it.
void free_secret(char *s);
// Zeroes `n` bytes at p, then frees p.
void free_zeroed(void *p, size_t n);
// pthread_mutex_init with default attributes (a seam for tests).
int mutex_init(pthread_mutex_t *m);

// ---- holds ----

// Called by a hold's destructor before its clean-up routine.  When a thread
// is cancelled, glibc unwinds it without telling AddressSanitizer, whose
// shadow then still marks the unwound frames' locals; the clean-up's own
// frame lands on that stale shadow.  Forgetting everything below the current
// frame is always correct (it is dead stack); elsewhere this is nothing.
#if defined(__SANITIZE_ADDRESS__)
inline void forget_dead_frames() { __asan_handle_no_return(); }
#else
inline void forget_dead_frames() {}
#endif

// What every hold is: bound to its scope, never copied or moved.
class Pinned {
  protected:
    Pinned() = default;
    ~Pinned() = default;

  public:
    Pinned(const Pinned &) = delete;
    Pinned &operator=(const Pinned &) = delete;
};

// Holds a T* and hands it to `Cleanup` when the scope ends, unless it was
// released first: the one template behind the library's pointer holds.
template <class T, auto Cleanup>
class Hold : Pinned {
  public:
    explicit Hold(T *p = nullptr) : p_(p) {}
    ~Hold() {
        if (p_ == nullptr) return;
        forget_dead_frames();
        Cleanup(p_);
    }
    void hold(T *p) { p_ = p; }
    T *get() const { return p_; }
    T *release() { return std::exchange(p_, nullptr); }

  private:
    T *p_;
};

// Disables thread cancellation for the scope.  Used where a step must run
// to its end once begun (a rebuild of the cluster trees), and around the
// creation and the closing of a descriptor: glibc acts on a cancellation
// that arrives just as open returns, which would leave the new descriptor
// open with no one owning it, or just as close returns, which would make
// the clean-up close the number again.
class NoCancel : Pinned {
  public:
    NoCancel() { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &old_); }
    ~NoCancel() { pthread_setcancelstate(old_, nullptr); }

  private:
    int old_ = PTHREAD_CANCEL_ENABLE;
};

// Holds a POSIX mutex; the destructor is the cancellation clean-up.
class OXIDM_SCOPED_CAPABILITY MutexHold : Pinned {
  public:
    explicit MutexHold(idm_mutex_t *m) OXIDM_ACQUIRE(*m) : m_(m) { pthread_mutex_lock(m_); }
    ~MutexHold() OXIDM_RELEASE() {
        forget_dead_frames();
        if (m_ != nullptr) idm__thread_cleanup_mutex(m_);
    }
    void unlock() OXIDM_RELEASE() {
        idm__thread_cleanup_mutex(m_);
        m_ = nullptr;
    }

  private:
    idm_mutex_t *m_;
};

// The local name a match puts in the caller's buffer, until the call
// returns: a thread cancelled after the match (in the plug-in's cleanup
// routine, or in a trace point on the way out) never hands the name to its
// caller, so the name is released (zeroed) here.  Only a name written after
// the hold was taken is released.
class MappingHold : Pinned {
  public:
    explicit MappingHold(idm_buffer *b) : b_(b), before_(b->value) {}
    ~MappingHold() {
        if (b_ == nullptr || b_->value == before_) return;
        forget_dead_frames();
        free_secret(b_->value);
        b_->value = nullptr;
        b_->length = 0;
    }
    void keep() { b_ = nullptr; }

  private:
    idm_buffer *b_;
    char *before_;
};

// ---- files ----

// A file's size and modification time as fstat reports them on an open
// descriptor (size -1 when fstat fails): what a reader compares before and
// after reading, to tell a file that a writer changed meanwhile.
struct FileStamp {
    off_t size = -1;
    struct timespec mtime {};
    bool regular = false;
    bool operator==(const FileStamp &o) const {
        return size == o.size && regular == o.regular && mtime.tv_sec == o.mtime.tv_sec &&
               mtime.tv_nsec == o.mtime.tv_nsec;
    }
};
FileStamp stamp_of(int fd);

}  // namespace idm

#endif
