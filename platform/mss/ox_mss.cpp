// Stand-in for the maker's security support library libox_mss: opening,
// shared locking and time queries of configuration files.  Locks are
// open-file-description locks so that they belong to the descriptor, not to
// the process.  Forced results (tests) are guarded by g_mutex.
#include "ox_mss.h"

#include <atomic>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <mutex>
#include <string>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

namespace {

std::atomic<int> g_wait_ms{5000};
std::atomic<long> g_locks{0};
std::mutex g_mutex;
std::string *g_open_path = new std::string;  // never destroyed
int g_open_result = 0;
bool g_open_any = false;
std::string *g_time_path = new std::string;
int g_time_result = 0;
bool g_time_any = false;
// Set while a time-query result is forced: the query takes g_mutex only
// then, so that an ordinary query costs the stat and nothing else.
std::atomic<bool> g_time_forced{false};
std::atomic<int> g_lock_result{0};

int forced(const std::string &want, bool any, int result, const char *path) {
    if (result == 0) return 0;
    if (any || (path && want == path)) return result;
    return 0;
}

int lock_op(int fd, short type, bool wait) {
    struct flock fl;
    std::memset(&fl, 0, sizeof fl);
    fl.l_type = type;
    fl.l_whence = SEEK_SET;
    fl.l_start = 0;
    fl.l_len = 0;
    if (!wait) return fcntl(fd, F_OFD_SETLK, &fl) == 0 ? 0 : errno;
    const int total = g_wait_ms.load();
    struct timespec start;
    clock_gettime(CLOCK_MONOTONIC, &start);
    for (;;) {
        if (fcntl(fd, F_OFD_SETLK, &fl) == 0) return 0;
        int e = errno;
        if (e != EAGAIN && e != EACCES && e != EINTR) return e;
        struct timespec now;
        clock_gettime(CLOCK_MONOTONIC, &now);
        long elapsed = (now.tv_sec - start.tv_sec) * 1000 + (now.tv_nsec - start.tv_nsec) / 1000000;
        if (elapsed >= total) return EAGAIN;
        struct timespec pause = {0, 5 * 1000 * 1000};
        nanosleep(&pause, nullptr);  // a cancellation point
    }
}

}  // namespace

// A path that names anything but a regular file (a FIFO, a device, a
// directory, a socket, a symbolic link to one of those or to nothing) is
// refused with 22: opening without O_NONBLOCK would wait for a FIFO's
// writer, and reading a device or a directory never ends or fails.  The
// descriptor stays non-blocking: a regular file's reads never wait anyway,
// and a kernel file that would wait fails its read instead.
// Test switch: hand over whatever opens, as a platform library that does not
// check would.
std::atomic<bool> g_accept_any{false};

extern "C" int sec__open_file(const char *path, int flags, int *fd) {
    (void)flags;
    if (!path || !fd) return 23;
    {
        std::lock_guard<std::mutex> lock(g_mutex);
        if (int r = forced(*g_open_path, g_open_any, g_open_result, path)) return r;
    }
    int d = open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
    if (d < 0) {
        struct stat link;
        switch (errno) {
        case EACCES:
        case EPERM: return 12;
        case ENOENT: return lstat(path, &link) == 0 ? 22 : 21;  // a dangling link exists
        case ENOTDIR: return 21;
        case ENXIO:   // a socket, or a device without its driver
        case ELOOP: return 22;
        case ENOMEM: return 6;
        default: return 23;
        }
    }
    struct stat st;
    if (!g_accept_any.load() && (fstat(d, &st) != 0 || !S_ISREG(st.st_mode))) {
        close(d);
        return 22;
    }
    *fd = d;
    return 0;
}

extern "C" int sec__readlock_file(int fd, const char *caller) {
    (void)caller;
    if (int r = g_lock_result.load()) return r;
    int e = lock_op(fd, F_RDLCK, true);
    if (e == 0) {
        g_locks.fetch_add(1);
        return 0;
    }
    return e == EAGAIN ? 30 : 23;
}

extern "C" int sec__unlock_file(int fd, const char *caller) {
    (void)caller;
    if (lock_op(fd, F_UNLCK, false) != 0) return 23;
    g_locks.fetch_sub(1);
    return 0;
}

extern "C" int sec__close_file(int *fd) {
    if (!fd || *fd < 0) return 23;
    int r = close(*fd);
    *fd = -1;
    return r == 0 ? 0 : 23;
}

extern "C" int sec__time_file(const char *path, uint32_t *mtime) {
    if (!path || !mtime) return 23;
    if (g_time_forced.load(std::memory_order_acquire)) {
        std::lock_guard<std::mutex> lock(g_mutex);
        if (int r = forced(*g_time_path, g_time_any, g_time_result, path)) return r;
    }
    // One lstat for the usual case of a plain file or none; a symbolic link
    // costs a second look at its target.  A link to nothing counts as
    // present with the link's own time, so that the caller goes on to open
    // it and fails there instead of taking the file for absent.
    struct stat st;
    if (lstat(path, &st) != 0) {
        if (errno == ENOENT || errno == ENOTDIR) return 21;
        if (errno == EACCES) return 12;
        return 23;
    }
    if (S_ISLNK(st.st_mode)) {
        struct stat target;
        if (stat(path, &target) == 0) st = target;
        else if (errno == EACCES) return 12;
        else if (errno != ENOENT) return 23;
    }
    *mtime = static_cast<uint32_t>(st.st_mtime);
    return 0;
}

extern "C" void mssx_accept_any_file(int on) { g_accept_any.store(on != 0); }
extern "C" void mssx_set_lock_wait_ms(int ms) { g_wait_ms.store(ms < 0 ? 0 : ms); }
extern "C" void mssx_force_open(const char *path, int result) {
    std::lock_guard<std::mutex> lock(g_mutex);
    *g_open_path = path ? path : "";
    g_open_any = path == nullptr;
    g_open_result = result;
}
extern "C" void mssx_force_readlock(int result) { g_lock_result.store(result); }
extern "C" void mssx_force_time(const char *path, int result) {
    std::lock_guard<std::mutex> lock(g_mutex);
    *g_time_path = path ? path : "";
    g_time_any = path == nullptr;
    g_time_result = result;
    g_time_forced.store(result != 0, std::memory_order_release);
}
extern "C" long mssx_locks_held(void) { return g_locks.load(); }
extern "C" void mssx_reset(void) {
    mssx_force_open(nullptr, 0);
    mssx_force_time(nullptr, 0);
    mssx_force_readlock(0);
    mssx_accept_any_file(0);
    g_wait_ms.store(5000);
}
