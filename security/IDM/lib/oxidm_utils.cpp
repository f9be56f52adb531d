// Small utilities shared by every module: the allocation seam, heap copies
// of texts, zeroing frees, the mutex clean-up handler.  In the
// fault-injection build (tests only) this module also owns the counters that
// make the n-th allocation or a mutex initialisation fail.
#include <strings.h>
#include <cstring>

#include "oxidm_holds.h"

#include <sys/stat.h>

#include <atomic>

namespace idm {

char *xstrdup(const char *s) {
    size_t n = std::strlen(s) + 1;
    char *copy = static_cast<char *>(xmalloc(n));
    if (copy != nullptr) std::memcpy(copy, s, n);
    return copy;
}

void free_secret(char *s) {
    if (s == nullptr) return;
    size_t n = std::strlen(s);
#ifdef OXIDM_FAULT_INJECTION
    explicit_bzero(s, n);
    fault_note_secret_free(s, n + 1);
#else
    explicit_bzero(s, n);
#endif
    std::free(s);
}

void free_zeroed(void *p, size_t n) {
    if (p == nullptr) return;
    explicit_bzero(p, n);
#ifdef OXIDM_FAULT_INJECTION
    fault_note_secret_free(p, n);
#endif
    std::free(p);
}

int mutex_init(pthread_mutex_t *m) {
#ifdef OXIDM_FAULT_INJECTION
    if (int r = fault_mutex_init_result()) return r;
#endif
    return pthread_mutex_init(m, nullptr);
}

#ifdef OXIDM_FAULT_INJECTION
namespace {
std::atomic<long> g_alloc_countdown{0};  // n > 0: the n-th allocation from now fails
std::atomic<long> g_alloc_calls{0};
std::atomic<int> g_alloc_fired{0};
std::atomic<int> g_mutex_init_result{0};
std::atomic<void (*)(const void *, size_t)> g_secret_hook{nullptr};
}  // namespace

bool fault_alloc_fires() {
    g_alloc_calls.fetch_add(1, std::memory_order_relaxed);
    long n = g_alloc_countdown.load(std::memory_order_relaxed);
    if (n <= 0) return false;
    if (g_alloc_countdown.fetch_sub(1) == 1) {
        g_alloc_fired.store(1);
        return true;
    }
    return false;
}
int fault_mutex_init_result() { return g_mutex_init_result.load(); }
void fault_note_secret_free(const void *p, size_t n) {
    if (auto hook = g_secret_hook.load()) hook(p, n);
}
#endif

FileStamp stamp_of(int fd) {
    FileStamp stamp;
    struct stat st;
    if (fstat(fd, &st) == 0) {
        stamp.size = st.st_size;
        stamp.mtime = st.st_mtim;
        stamp.regular = S_ISREG(st.st_mode);
    }
    return stamp;
}

}  // namespace idm

extern "C" void idm__thread_cleanup_mutex(void *mutex) { pthread_mutex_unlock(static_cast<pthread_mutex_t *>(mutex)); }

#ifdef OXIDM_FAULT_INJECTION
// Test hooks of the fault-injection build; not part of the shipped library.
extern "C" {
void idm_test_fail_alloc(long nth) {
    idm::g_alloc_fired.store(0);
    idm::g_alloc_countdown.store(nth);
}
int idm_test_alloc_fired(void) { return idm::g_alloc_fired.load(); }
long idm_test_alloc_calls(void) { return idm::g_alloc_calls.load(); }
void idm_test_fail_mutex_init(int result) { idm::g_mutex_init_result.store(result); }
void idm_test_on_secret_free(void (*hook)(const void *, size_t)) { idm::g_secret_hook.store(hook); }
}
#endif
