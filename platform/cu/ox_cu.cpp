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
#include <ctime>
#include <fcntl.h>
#include <mutex>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>
#include <set>
#include <algorithm>
#include <string>
#include <vector>

namespace {

constexpr int kMaxInserts = 16;       // inserts 1..16 of a text are kept
constexpr size_t kInlineTexts = 480;  // text inserts, inline
constexpr size_t kTypeSlots = 64;     // conversion types remembered per thread

// A recorded error, as plain bytes: recording one is a few stores and copies,
// with no constructor, no formatting and no heap allocation while the text
// inserts fit `texts`.  The message is put together only when someone reads
// it (cux_error_text, cux_error_insert).  The catalogue name and the default
// text are a catalogue's static texts and are kept by address, as passed.
struct Record {
    int status;
    int reserved;
    int set;
    int msgno;
    const char *catalog;                  // as passed; a copy's own after cu_pset_error_1
    const char *deftext;                  // likewise
    int count;                            // inserts recorded
    char types[kMaxInserts];              // 's', 'd', 'x' or 'u' for insert i + 1
    unsigned long long raw[kMaxInserts];  // integer inserts as passed (0 for texts)
    uint32_t text_at[kMaxInserts];        // where a text insert starts in the texts
    uint32_t used;                        // bytes of the texts in use
    bool spilled;                         // the texts live in the thread's spill string
    char texts[kInlineTexts];
};

// Types of the inserts of one default text (texts are static catalogue
// entries: the address identifies the text).
struct TypeSlot {
    const char *deftext;
    int count;
    char types[kMaxInserts];
};

// Everything the recording path touches, in one thread-local block of plain
// bytes: no guard, no destructor to register.
struct ThreadErrors {
    bool pending;
    unsigned long count;     // cu_set_error_1 calls
    unsigned long serial;    // changes whenever the current error does
    Record current;
    TypeSlot slots[kTypeSlots];
};

// Reached through the dynamic TLS models only (the library is built with TLS
// descriptors, -mtls-dialect=gnu2, so after the first call of a thread this
// is one indirect load): an object loaded with dlopen has no claim on the
// static TLS area, and a block of this size would not find room there.
thread_local ThreadErrors t_errors;

inline ThreadErrors &errors() { return t_errors; }

// Texts that did not fit a record's inline space, and the default text of an
// error made current again from a handle (touched only on those paths).
thread_local std::string t_spill;
thread_local std::string t_owned_catalog;
thread_local std::string t_owned_deftext;

// What the reading calls formatted, for the error of serial `serial`.
struct Formatted {
    unsigned long serial = ~0ul;
    std::string text;
    std::vector<std::string> inserts;
};
thread_local Formatted t_formatted;

struct Conv {
    int index;      // 1-based insert number
    char type;      // 's', 'd', 'x', 'u'
    size_t begin;   // position of '%'
    size_t end;     // one past the conversion character
};

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

// Fills `slot` with the insert types of `deftext`.
__attribute__((noinline)) void parse_types(TypeSlot &slot, const char *deftext) {
    slot.deftext = deftext;
    slot.count = 0;
    std::memset(slot.types, 'd', sizeof slot.types);
    for (const Conv &c : conversions(deftext)) {
        if (c.index > kMaxInserts) continue;
        slot.types[c.index - 1] = c.type;
        slot.count = std::max(slot.count, c.index);
    }
}

// The insert types of `deftext`, parsed once per text and thread.
inline const TypeSlot &types_of(ThreadErrors &te, const char *deftext) {
    TypeSlot &slot = te.slots[(reinterpret_cast<uintptr_t>(deftext) >> 3) % kTypeSlots];
    if (slot.deftext != deftext) parse_types(slot, deftext);
    return slot;
}

const char *texts_of(const Record &r) { return r.spilled ? t_spill.data() : r.texts; }

// Moves the record's texts to the spill string and appends `s` there.
__attribute__((noinline)) void spill_text(Record &r, const char *s, size_t n) {
    if (!r.spilled) t_spill.assign(r.texts, r.used);
    r.spilled = true;
    t_spill.append(s, n);
}

// Appends `s` with its NUL to the record's texts; returns where it starts.
uint32_t keep_text(Record &r, const char *s) {
    const uint32_t at = r.used;
    const size_t n = std::strlen(s) + 1;
    if (!r.spilled && n <= sizeof r.texts - at)
        std::memcpy(r.texts + at, s, n);
    else
        spill_text(r, s, n);
    r.used = at + static_cast<uint32_t>(n);
    return at;
}

// Starts a record for a new current error.
Record &begin_record(ThreadErrors &te, int status, int reserved, const char *catalog, int set, int msgno,
                     const char *deftext) {
    Record &r = te.current;
    r.status = status;
    r.reserved = reserved;
    r.set = set;
    r.msgno = msgno;
    r.deftext = deftext;
    r.catalog = catalog ? catalog : "";
    r.count = 0;
    r.used = 0;
    r.spilled = false;
    te.pending = true;
    ++te.serial;
    return r;
}

}  // namespace

// A handle: a copy of an error that owns its default text and its texts.
struct cu_error {
    Record rec;
    std::string catalog;
    std::string deftext;
    std::string texts;
};

namespace {

std::string insert_text(const Record &r, const char *texts, int i) {
    char buf[32];
    switch (r.types[i]) {
    case 's': return texts + r.text_at[i];
    case 'x': std::snprintf(buf, sizeof buf, "%x", static_cast<unsigned>(r.raw[i])); break;
    case 'u': std::snprintf(buf, sizeof buf, "%u", static_cast<unsigned>(r.raw[i])); break;
    default: std::snprintf(buf, sizeof buf, "%d", static_cast<int>(r.raw[i])); break;
    }
    return buf;
}

// The current error's message and inserts, formatted on first read.
const Formatted &formatted() {
    Formatted &f = t_formatted;
    const ThreadErrors &te = t_errors;
    if (f.serial == te.serial) return f;
    const Record &r = te.current;
    const char *texts = texts_of(r);
    f.inserts.clear();
    for (int i = 0; i < r.count; ++i) f.inserts.push_back(insert_text(r, texts, i));
    std::string def = r.deftext;
    std::string out;
    size_t pos = 0;
    for (const Conv &c : conversions(r.deftext)) {
        out.append(def, pos, c.begin - pos);
        if (c.index >= 1 && c.index <= r.count) out += f.inserts[c.index - 1];
        pos = c.end;
    }
    out.append(def, pos, std::string::npos);
    // "%%" stands for one percent sign.
    for (size_t i = 0; (i = out.find("%%", i)) != std::string::npos; ++i) out.erase(i, 1);
    f.text = std::move(out);
    f.serial = te.serial;
    return f;
}

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

}  // namespace

extern "C" int cu_set_error_1(int status, int reserved, const char *catalog, int set, int msgno,
                              const char *deftext, ...) {
    if (deftext == nullptr) deftext = "";
    ThreadErrors &te = errors();
    const TypeSlot &slot = types_of(te, deftext);
    Record &r = begin_record(te, status, reserved, catalog, set, msgno, deftext);
    r.count = slot.count;
    std::memcpy(r.types, slot.types, sizeof r.types);
    va_list ap;
    va_start(ap, deftext);
    for (int i = 0; i < slot.count; ++i) {
        const char type = slot.types[i];
        if (type == 's') {  // the common insert first
            const char *s = va_arg(ap, const char *);
            r.text_at[i] = keep_text(r, s ? s : "(null)");
            r.raw[i] = 0;
        } else if (type == 'x') {  // pointer-sized on purpose: callers pass the offending value itself
            r.raw[i] = va_arg(ap, unsigned long long);
        } else if (type == 'u') {
            r.raw[i] = va_arg(ap, unsigned);
        } else {
            r.raw[i] = static_cast<unsigned long long>(static_cast<long long>(va_arg(ap, int)));
        }
    }
    va_end(ap);
    ++te.count;
    return status;
}

extern "C" int cu_get_error_1(cu_error_t **handle) {
    if (!handle) return 4;
    const ThreadErrors &te = t_errors;
    if (!te.pending) return 0;
    cu_error *copy = new (std::nothrow) cu_error;
    if (!copy) return 6;
    copy->rec = te.current;
    copy->catalog = te.current.catalog;
    copy->deftext = te.current.deftext;
    copy->texts.assign(texts_of(te.current), te.current.used);
    std::lock_guard<std::mutex> lock(g_handle_mutex);
    g_handles->insert(copy);
    *handle = copy;
    return 0;
}

extern "C" int cu_pset_error_1(const cu_error_t *handle) {
    if (!handle) return 4;
    const Record &from = handle->rec;
    t_owned_catalog = handle->catalog;
    t_owned_deftext = handle->deftext;
    Record &r = begin_record(t_errors, from.status, from.reserved, t_owned_catalog.c_str(), from.set, from.msgno,
                             t_owned_deftext.c_str());
    r.count = from.count;
    std::memcpy(r.types, from.types, sizeof r.types);
    std::memcpy(r.raw, from.raw, sizeof r.raw);
    for (int i = 0; i < from.count; ++i)
        if (from.types[i] == 's') r.text_at[i] = keep_text(r, handle->texts.c_str() + from.text_at[i]);
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
    if (tz != nullptr) return gettimeofday(tv, static_cast<struct timezone *>(tz)) == 0 ? 0 : errno;
    // The coarse clock, read without the time-stamp counter, which is slow
    // in a virtual machine (the library reads the clock once per map file
    // line).  It lags the precise clock by less than one tick, so its second
    // is the precise one's unless it is within a tick of the next second;
    // there the precise clock is read.
    static const long tick_ns = [] {
        struct timespec res;
        return clock_getres(CLOCK_REALTIME_COARSE, &res) == 0 && res.tv_sec == 0 ? res.tv_nsec : 1'000'000'000L;
    }();
    struct timespec ts;
    if (clock_gettime(CLOCK_REALTIME_COARSE, &ts) != 0 || ts.tv_nsec >= 1'000'000'000L - tick_ns)
        return gettimeofday(tv, nullptr) == 0 ? 0 : errno;
    tv->tv_sec = ts.tv_sec;
    tv->tv_usec = static_cast<suseconds_t>(ts.tv_nsec / 1000);
    return 0;
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
extern "C" int cux_error_pending(void) { return t_errors.pending ? 1 : 0; }
extern "C" void cux_clear_error(void) {
    ThreadErrors &te = t_errors;
    te.pending = false;
    te.current = Record{};
    te.current.deftext = "";
    ++te.serial;
}
extern "C" unsigned long cux_error_count(void) { return t_errors.count; }
extern "C" int cux_error_status(void) { return t_errors.pending ? t_errors.current.status : 0; }
extern "C" int cux_error_reserved(void) { return t_errors.current.reserved; }
extern "C" const char *cux_error_catalog(void) {
    const char *c = t_errors.current.catalog;
    return c ? c : "";
}
extern "C" int cux_error_set(void) { return t_errors.current.set; }
extern "C" int cux_error_msgno(void) { return t_errors.pending ? t_errors.current.msgno : 0; }
extern "C" const char *cux_error_deftext(void) {
    const char *d = t_errors.current.deftext;
    return d ? d : "";
}
extern "C" const char *cux_error_text(void) { return formatted().text.c_str(); }
extern "C" int cux_error_insert_count(void) { return t_errors.current.count; }
extern "C" const char *cux_error_insert(int i) {
    const Formatted &f = formatted();
    if (i < 1 || i > static_cast<int>(f.inserts.size())) return nullptr;
    return f.inserts[i - 1].c_str();
}
extern "C" unsigned long long cux_error_insert_raw(int i) {
    const Record &r = t_errors.current;
    if (i < 1 || i > r.count) return 0;
    return r.raw[i - 1];
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
