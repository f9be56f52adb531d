// Stand-in for the maker's utility library libox_cu: per-thread current
// error, clock, POSIX-locale case-insensitive compare, active cluster name.
// Thread-safety: the error record is thread-local; the cluster override and
// clock override are guarded by g_mutex / atomics.
#include "ox_cu.h"

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <mutex>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>
#include <set>
#include <unordered_map>
#include <string>
#include <vector>

namespace {

struct Conv {
    int index;      // 1-based insert number
    char type;      // 's', 'd', 'x', 'u'
    size_t begin;   // position of '%'
    size_t end;     // one past the conversion character
};

}  // namespace

// One error.  The current error of a thread is formatted lazily: recording
// keeps the inserts and a pointer to the default text (a catalogue's static
// text), and the message is put together only when someone asks for it, so
// that reporting stays cheap for callers that report on hot paths.
struct cu_error {
    int status = 0;
    int reserved = 0;
    std::string catalog;
    int set = 0;
    int msgno = 0;
    const char *deftext_ptr = "";
    std::string deftext_copy;  // used by handles, which outlive the caller's text
    bool owns_deftext = false;
    std::vector<Conv> convs;
    std::vector<std::string> inserts;
    std::vector<unsigned long long> raw;
    mutable std::string text;
    mutable bool text_valid = false;

    const char *deftext() const { return owns_deftext ? deftext_copy.c_str() : deftext_ptr; }
    const std::string &formatted() const;
    cu_error() = default;
    cu_error(const cu_error &o) { *this = o; }
    cu_error &operator=(const cu_error &o) {
        if (this == &o) return *this;
        status = o.status;
        reserved = o.reserved;
        catalog = o.catalog;
        set = o.set;
        msgno = o.msgno;
        deftext_copy = o.deftext();
        deftext_ptr = "";
        owns_deftext = true;
        convs = o.convs;
        inserts = o.inserts;
        raw = o.raw;
        text_valid = false;
        return *this;
    }
};

namespace {

thread_local bool t_pending = false;
thread_local cu_error t_error;
thread_local unsigned long t_count = 0;
// Parsed conversions per default text (texts are static catalogue entries).
thread_local std::unordered_map<const char *, std::vector<Conv>> t_conv_cache;

// Handles handed out by cu_get_error_1 stay reachable from here until
// released: a caller that keeps one for the life of the process (trace
// registration does) does not leak it.
std::mutex g_handle_mutex;
std::set<cu_error *> *g_handles = new std::set<cu_error *>;  // never destroyed

std::mutex g_mutex;
bool g_cluster_override = false;
std::string g_cluster_name;
std::atomic<int> g_cluster_fail{0};
std::atomic<int64_t> g_clock{0};

// Finds the positional conversions "%N$s", "%N$d", "%N$x" (plain "%s"/"%d"
// count in order of appearance).  "%%" is a literal percent sign.
std::vector<Conv> conversions(const char *text) {
    std::string fmt(text);
    std::vector<Conv> out;
    int next = 1;
    for (size_t i = 0; i < fmt.size(); ++i) {
        if (fmt[i] != '%') continue;
        if (i + 1 < fmt.size() && fmt[i + 1] == '%') { ++i; continue; }
        size_t j = i + 1;
        int index = 0;
        size_t k = j;
        while (k < fmt.size() && fmt[k] >= '0' && fmt[k] <= '9') index = index * 10 + (fmt[k++] - '0');
        if (k < fmt.size() && fmt[k] == '$' && index > 0) j = k + 1; else index = next++;
        while (j < fmt.size() && std::strchr("-+ #0123456789.l", fmt[j])) ++j;
        if (j >= fmt.size()) break;
        char t = fmt[j];
        if (t == 'i') t = 'd';
        if (t == 'X') t = 'x';
        if (std::strchr("sdxu", t)) out.push_back({index, t, i, j + 1});
        i = j;
    }
    return out;
}

}  // namespace

const std::string &cu_error::formatted() const {
    if (text_valid) return text;
    std::string def = deftext();
    std::string out;
    size_t pos = 0;
    for (const Conv &c : convs) {
        out.append(def, pos, c.begin - pos);
        if (c.index >= 1 && c.index <= static_cast<int>(inserts.size())) out += inserts[c.index - 1];
        pos = c.end;
    }
    out.append(def, pos, std::string::npos);
    // "%%" stands for one percent sign.
    for (size_t i = 0; (i = out.find("%%", i)) != std::string::npos; ++i) out.erase(i, 1);
    text = std::move(out);
    text_valid = true;
    return text;
}

extern "C" int cu_set_error_1(int status, int reserved, const char *catalog, int set, int msgno,
                              const char *deftext, ...) {
    cu_error &e = t_error;
    e.status = status;
    e.reserved = reserved;
    e.catalog = catalog ? catalog : "";
    e.set = set;
    e.msgno = msgno;
    e.deftext_ptr = deftext ? deftext : "";
    e.owns_deftext = false;
    e.text_valid = false;
    auto it = t_conv_cache.find(e.deftext_ptr);
    if (it == t_conv_cache.end()) it = t_conv_cache.emplace(e.deftext_ptr, conversions(e.deftext_ptr)).first;
    e.convs = it->second;
    int n = 0;
    for (const Conv &c : e.convs) n = std::max(n, c.index);
    char types[16] = {};
    for (const Conv &c : e.convs)
        if (c.index < 16) types[c.index] = c.type;
    e.inserts.resize(n);
    e.raw.assign(n, 0);
    va_list ap;
    va_start(ap, deftext);
    for (int i = 1; i <= n; ++i) {
        char buf[32];
        switch (i < 16 ? types[i] : 'd') {
        case 's': {
            const char *s = va_arg(ap, const char *);
            e.inserts[i - 1].assign(s ? s : "(null)");
            break;
        }
        case 'x': {
            // Pointer-sized on purpose: callers pass the offending value itself.
            unsigned long long v = va_arg(ap, unsigned long long);
            e.raw[i - 1] = v;
            std::snprintf(buf, sizeof buf, "%x", static_cast<unsigned>(v));
            e.inserts[i - 1].assign(buf);
            break;
        }
        case 'u': {
            unsigned v = va_arg(ap, unsigned);
            e.raw[i - 1] = v;
            std::snprintf(buf, sizeof buf, "%u", v);
            e.inserts[i - 1].assign(buf);
            break;
        }
        default: {
            int v = va_arg(ap, int);
            e.raw[i - 1] = static_cast<unsigned long long>(static_cast<long long>(v));
            std::snprintf(buf, sizeof buf, "%d", v);
            e.inserts[i - 1].assign(buf);
            break;
        }
        }
    }
    va_end(ap);
    t_pending = true;
    ++t_count;
    return status;
}

extern "C" int cu_get_error_1(cu_error_t **handle) {
    if (!handle) return 4;
    if (!t_pending) return 0;
    cu_error *copy = new (std::nothrow) cu_error(t_error);
    if (!copy) return 6;
    std::lock_guard<std::mutex> lock(g_handle_mutex);
    g_handles->insert(copy);
    *handle = copy;
    return 0;
}

extern "C" int cu_pset_error_1(const cu_error_t *handle) {
    if (!handle) return 4;
    t_error = *handle;
    t_pending = true;
    return 0;
}

extern "C" void cu_rel_error_1(cu_error_t *handle) {
    if (!handle) return;
    {
        std::lock_guard<std::mutex> lock(g_handle_mutex);
        g_handles->erase(handle);
    }
    delete handle;
}

extern "C" int cu_gettimeofday_1(struct timeval *tv, void *tz) {
    if (!tv) return 4;
    int64_t fixed = g_clock.load(std::memory_order_relaxed);
    if (fixed != 0) {
        tv->tv_sec = static_cast<time_t>(fixed);
        tv->tv_usec = 0;
        return 0;
    }
    return gettimeofday(tv, static_cast<struct timezone *>(tz)) == 0 ? 0 : errno;
}

extern "C" int cu_8bit_strncasecmp_posix_1(const char *s1, const char *s2, size_t n) {
    // The POSIX locale maps only A-Z to a-z, whatever the process locale is.
    auto lower = [](unsigned char c) { return (c >= 'A' && c <= 'Z') ? c + ('a' - 'A') : c; };
    for (size_t i = 0; i < n; ++i) {
        int a = lower(static_cast<unsigned char>(s1[i]));
        int b = lower(static_cast<unsigned char>(s2[i]));
        if (a != b) return a - b;
        if (a == 0) return 0;
    }
    return 0;
}

extern "C" int cu_get_cluster_info_1(cu_cluster_info_t *info) {
    if (!info) return 4;
    if (g_cluster_fail.load()) return 1;
    std::string name;
    {
        std::lock_guard<std::mutex> lock(g_mutex);
        if (g_cluster_override) name = g_cluster_name;
    }
    if (name.empty()) {
        bool overridden;
        {
            std::lock_guard<std::mutex> lock(g_mutex);
            overridden = g_cluster_override;
        }
        if (overridden) return 1;
        // A short read of a small file, with cancellation off so that a
        // cancelled caller does not leave the stream open.  Only a regular
        // file is read: the open does not wait for a FIFO's writer.
        int cancel_state;
        pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &cancel_state);
        FILE *f = nullptr;
        int fd = open(CU_ACTIVE_CLUSTER_FILE, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
        struct stat st;
        if (fd >= 0 && fstat(fd, &st) == 0 && S_ISREG(st.st_mode)) f = fdopen(fd, "r");
        if (f == nullptr && fd >= 0) close(fd);
        char line[256];
        bool got = f != nullptr && std::fgets(line, sizeof line, f) != nullptr;
        if (f) std::fclose(f);
        pthread_setcancelstate(cancel_state, nullptr);
        if (!got) return 1;
        line[std::strcspn(line, "\r\n")] = '\0';
        name = line;
        if (name.empty()) return 1;
    }
    std::memset(info, 0, sizeof *info);
    info->version = 1;
    std::snprintf(info->cluster_name, sizeof info->cluster_name, "%s", name.c_str());
    return 0;
}

// ---- inspection ----
extern "C" int cux_error_pending(void) { return t_pending ? 1 : 0; }
extern "C" void cux_clear_error(void) { t_pending = false; t_error = cu_error(); }
extern "C" unsigned long cux_error_count(void) { return t_count; }
extern "C" int cux_error_status(void) { return t_pending ? t_error.status : 0; }
extern "C" int cux_error_reserved(void) { return t_error.reserved; }
extern "C" const char *cux_error_catalog(void) { return t_error.catalog.c_str(); }
extern "C" int cux_error_set(void) { return t_error.set; }
extern "C" int cux_error_msgno(void) { return t_pending ? t_error.msgno : 0; }
extern "C" const char *cux_error_deftext(void) { return t_error.deftext(); }
extern "C" const char *cux_error_text(void) { return t_error.formatted().c_str(); }
extern "C" int cux_error_insert_count(void) { return static_cast<int>(t_error.inserts.size()); }
extern "C" const char *cux_error_insert(int i) {
    if (i < 1 || i > static_cast<int>(t_error.inserts.size())) return nullptr;
    return t_error.inserts[i - 1].c_str();
}
extern "C" unsigned long long cux_error_insert_raw(int i) {
    if (i < 1 || i > static_cast<int>(t_error.raw.size())) return 0;
    return t_error.raw[i - 1];
}
extern "C" unsigned long cux_handles_live(void) {
    std::lock_guard<std::mutex> lock(g_handle_mutex);
    return g_handles->size();
}
extern "C" void cux_set_active_cluster(const char *name) {
    std::lock_guard<std::mutex> lock(g_mutex);
    g_cluster_override = name != nullptr;
    g_cluster_name = name ? name : "";
}
extern "C" void cux_fail_cluster_info(int fail) { g_cluster_fail.store(fail); }
extern "C" void cux_set_clock(int64_t seconds) { g_clock.store(seconds); }
