// Shared internals of libox_idm: the process-wide state records, the
// translator record, error reporting, the allocation seam and the RAII
// holds whose destructors are the library's cancellation clean-ups.
//
// Lock order (outermost first):
//   idm__state.mutex            only inside idm__state_init
//   idm__native_state.mutex     the translator list
//   idm_translator.mutex        one mechanism's routines, map files, entries, rules
//   idmutex (oxsec_lock)        the cluster trees; independent of the above
// Every hold is an RAII object: glibc cancels a C++ thread by a forced
// unwind, which runs the destructor, so a thread cancelled inside an MPM
// routine or while waiting leaves nothing locked.  The library is built with
// exceptions enabled for that reason and never catches the forced unwind.
#ifndef OXIDM_INTERNAL_H
#define OXIDM_INTERNAL_H

#include <pthread.h>
#include <sys/types.h>
#include <strings.h>
#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/asan_interface.h>
#endif

#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include "ox_cu.h"
#include "ox_mss.h"
#include "ox_tr.h"
#include "oxidm.h"
#include "oxidm_trace.h"
#include "oxseclib_msg.h"

struct idm_mapfile_set;

// ---- records of the native mapping service ----

// One registered mechanism.  Created by registration, never freed.
// `next` and `mnemonic` never change once the record is on the list and may
// be read under the native mutex alone; everything else is guarded by `mutex`.
struct idm_translator {
    idm_translator *next;
    pthread_mutex_t mutex;
    char *mnemonic;
    idm_translator_routine translator;
    idm_cleanup_routine cleanup;
    idm_mapfile_set *mapfiles;
    int32_t entry_count;
    idm_mapfile_entry *entries;
    int32_t rule_count;
    idm_rule *rules;
};

struct idm_mapping_service {
    void *state;  // begins with two 32-bit words recorded by the exit traces
    int32_t (*register_translator)(const char *, idm_translator_routine, idm_cleanup_routine);
    int32_t (*map_identity)(const char *, const char *, idm_buffer *);
    int32_t (*get_groups)(idm_buffer *, uint32_t *, idm_buffer **);
};

struct idm_state_t {
    pthread_mutex_t mutex;
    uint32_t mapping_type;
    idm_mapping_service services[1];
};

struct idm_native_state_t {
    uint32_t reserved;          // never set
    uint32_t translator_count;  // written under mutex, read atomically by traces
    pthread_mutex_t mutex;      // guards translators
    idm_translator *translators;
};

extern "C" {
extern idm_state_t idm__state;
extern idm_native_state_t idm__native_state;
extern pthread_once_t idm__init_once_block;
extern pthread_once_t idm__native_init_once_block;

void idm__state_init(void);
void idm__native_state_init(void);
int32_t idm__mapping_type_valid(int32_t mapping_type);

// Native service (oxidm_native).
int32_t idm__native_register_translator(const char *mnemonic, idm_translator_routine translator,
                                        idm_cleanup_routine cleanup);
int32_t idm__native_map_identity(const char *mnemonic, const char *network_id, idm_buffer *local);
int32_t idm__native_get_groups(idm_buffer *user, uint32_t *count, idm_buffer **groups);
int32_t idm__native_get_translator(const char *mnemonic, idm_translator_routine *translator,
                                   idm_cleanup_routine *cleanup);
idm_translator *idm__native_find_translator(const char *mnemonic);

// Cancellation clean-up handlers.
void idm__thread_cleanup_mutex(void *mutex);
}

namespace idm {

// ---- error reporting ----

inline constexpr const char kCatalog[] = "oxseclib.cat";

// Records one failure with cu_set_error_1 and returns its status.  Inserts
// follow the message's positional conversions: const char* for %s, int for
// %d, and a pointer-sized value (see hex()) for the "0x%3$x" insert.
template <class... Inserts>
inline int32_t report(int32_t status, Msg msg, Inserts... inserts) {
    return cu_set_error_1(status, 0, kCatalog, 1, msg, cu_mesgtbl_oxseclib_msg[msg], inserts...);
}

// The offending parameter's value as the "0x%3$x" insert: always passed
// pointer-sized, so a receiver reading either width sees the low 32 bits.
inline const void *hex(uintptr_t value) { return reinterpret_cast<const void *>(value); }
template <class T>
inline const void *hex(T *p) { return p; }

// 2650-650 from an exported function: status 4.
inline int32_t report_bad_param(const char *function, int position, const void *value) {
    return report(4, kMsg650, function, position, value);
}
// 2650-651 from an internal routine.
inline int32_t report_bad_internal_param(int32_t status, const char *function, int position, const void *value) {
    return report(status, kMsg651, function, position, value);
}
// 2650-654: allocation of `bytes` failed in `function`.
inline int32_t report_no_memory(const char *function, size_t bytes, int32_t status = 6) {
    return report(status, kMsg654, function, static_cast<int>(bytes));
}

// ---- allocation seam ----
//
// Every allocation of the library goes through these, so that tests of the
// fault-injection build can fail the n-th one.  The shipped library compiles
// them to the plain calls.
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

// Disables thread cancellation for the scope.  Used where a step must run
// to its end once begun (a rebuild of the cluster trees), and around the
// creation and the closing of a descriptor: glibc acts on a cancellation
// that arrives just as open returns, which would leave the new descriptor
// open with no one owning it, or just as close returns, which would make
// the clean-up close the number again.
class NoCancel {
  public:
    NoCancel() { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &old_); }
    ~NoCancel() { pthread_setcancelstate(old_, nullptr); }
    NoCancel(const NoCancel &) = delete;
    NoCancel &operator=(const NoCancel &) = delete;

  private:
    int old_ = PTHREAD_CANCEL_ENABLE;
};

// The local name a match puts in the caller's buffer, until the call
// returns: a thread cancelled after the match (in the plug-in's cleanup
// routine, or in a trace point on the way out) never hands the name to its
// caller, so the name is released (zeroed) here.  Only a name written after
// the hold was taken is released.
class MappingHold {
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
    MappingHold(const MappingHold &) = delete;
    MappingHold &operator=(const MappingHold &) = delete;

  private:
    idm_buffer *b_;
    char *before_;
};

// Holds a POSIX mutex; the destructor is the cancellation clean-up.
class MutexHold {
  public:
    explicit MutexHold(pthread_mutex_t *m) : m_(m) { pthread_mutex_lock(m_); }
    ~MutexHold() {
        forget_dead_frames();
        if (m_ != nullptr) idm__thread_cleanup_mutex(m_);
    }
    void unlock() {
        idm__thread_cleanup_mutex(m_);
        m_ = nullptr;
    }
    MutexHold(const MutexHold &) = delete;
    MutexHold &operator=(const MutexHold &) = delete;

  private:
    pthread_mutex_t *m_;
};

// Reads the native service's two state words for exit traces.
inline uint32_t native_word(int i) {
    return i == 0 ? __atomic_load_n(&idm__native_state.reserved, __ATOMIC_RELAXED)
                  : __atomic_load_n(&idm__native_state.translator_count, __ATOMIC_RELAXED);
}

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
