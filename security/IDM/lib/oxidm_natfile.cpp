// Identity mapping files of the native mapping service.
//
// Owns three things, none of them guarded by a lock of its own:
//   - the map file set of a translator (created here on first use, kept in
//     the translator record, used only under that record's mutex);
//   - the entry list a reading pass builds (a local of the pass until it is
//     handed to the caller);
//   - the open file of a pass: its descriptor, its stream and the shared
//     file lock of libox_mss, held only while that one file is parsed.
// The caller (the mapping walk) holds the translator's mutex for the whole
// pass, so everything here runs on one thread at a time per translator.
//
// Cancellation: each of the three holds below is an RAII object whose
// destructor is the named clean-up handler.  glibc cancels a C++ thread with
// a forced unwind, so a pass cancelled while waiting for a file lock or
// while reading a file releases the lock, closes the stream and frees the
// entries parsed so far; the set stays with its translator.
//
// The line check is a pure function (idm::mapfile::judge_line and its parts)
// that the file walk, the fuzzer and the checker tool share; the walk owns
// the I/O, the locking and the trace points.
#include <cerrno>

#include "oxidm_natfile.h"

#include <malloc.h>
#include <stdio_ext.h>
#include <sys/stat.h>

#include <climits>

#include "oxidm_diag.h"
#include "oxidm_holds.h"
#include "ox_mss.h"

using namespace idm;

namespace {

// ---------------------------------------------------------------------------
// Small helpers
// ---------------------------------------------------------------------------

constexpr bool is_blank(char c) { return c == ' ' || c == '\t'; }

size_t skip_blanks(std::string_view s, size_t i) {
    while (i < s.size() && is_blank(s[i])) ++i;
    return i;
}

bool only_blanks(std::string_view s) { return skip_blanks(s, 0) == s.size(); }

// The first space or tab in s[i, end), or end.  Identifiers run to a few
// dozen characters; two vector searches of the C library cost less there
// than a loop that tests every character three times.
size_t blank_in(std::string_view s, size_t i, size_t end) {
    for (char blank : {' ', '\t'})
        if (const void *p = std::memchr(s.data() + i, blank, end - i))
            end = static_cast<size_t>(static_cast<const char *>(p) - s.data());
    return end;
}

// Reports 2650-651 for an internal routine and records its Error/Diag trace
// point with the position and the low 32 bits of the value.
int32_t bad_param(Status status, const char *function, trace::tp::Id trace_id, int32_t position, uintptr_t value) {
    if (trace::error_on()) {
        uint32_t low = static_cast<uint32_t>(value);
        trace::record_data(trace_id, trace::i32(position), trace::u32(low));
    }
    return report_bad_internal_param(status, function, position, hex(value));
}

uintptr_t addr(const void *p) { return reinterpret_cast<uintptr_t>(p); }

// The result code, in the 2650-655 report of a failed open, of a map file
// path that names anything but a regular file; libox_mss uses the same.
constexpr int kNotRegularFile = kMssNotRegularFile;
// The code in the 2650-655 report of a file that kept changing while it was
// read (EAGAIN).
constexpr int kKeptChanging = 11;
// How many times a file caught being written is read before the pass fails.
constexpr int kReadAttempts = 3;

// What the reading pass learns of one file beyond the status.
struct FileOutcome {
    FileStamp start;          // the open file's size and time, before the parse
    bool held_back = false;   // a cut last line was not acted on
    bool overran = false;     // it gave more than its size at the start
};

// A file last changed in this second or the one before may still be being
// written: its unterminated last line is a cut line.
bool changed_lately(const FileStamp &stamp) {
    struct timeval now {};
    cu_gettimeofday_1(&now, nullptr);
    return stamp.size >= 0 && stamp.mtime.tv_sec >= now.tv_sec - 1;
}

// ---------------------------------------------------------------------------
// Holds; each destructor is one of the named cancellation clean-ups
// ---------------------------------------------------------------------------

// A map file set being built, and the entry list of a reading pass: each
// released unless handed over.
using SetHold = Hold<idm_mapfile_set, idm__thread_cleanup_cachef>;
using EntriesHold = Hold<idm_entry_list, idm__thread_cleanup_entries>;

// One open map file of a reading pass; unlocked and closed unless the pass
// released it itself.
class MapfileHold : Pinned {
  public:
    explicit MapfileHold(const char *path) {
        std::memset(&file_, 0, sizeof file_);
        file_.fd = -1;
        size_t n = std::strlen(path);
        if (n > IDM_MAPFILE_PATH_MAX) n = IDM_MAPFILE_PATH_MAX;
        std::memcpy(file_.path, path, n);
    }
    ~MapfileHold() {
        idm::forget_dead_frames();
        if (armed_) idm__thread_cleanup_mapfile(&file_);
        explicit_bzero(file_.path, sizeof file_.path);
        explicit_bzero(buffer_, sizeof buffer_);
    }
    idm_open_mapfile &file() { return file_; }
    void disarm() { armed_ = false; }
    // Makes the just opened stream read through this hold's buffer, which
    // is zeroed when the hold ends (after the stream is closed): the stdio
    // buffer that stdio would allocate holds the file's identities and is
    // freed by fclose without being cleared.
    void buffer_stream() { setvbuf(file_.stream, buffer_, _IOFBF, sizeof buffer_); }

  private:
    idm_open_mapfile file_;
    bool armed_ = true;
    char buffer_[4096];
};

// The descriptor inside idm__ready_mapfile until it is handed to the caller:
// closed (and unlocked once locked) on every other way out, including a
// cancellation during the lock wait.
class DescriptorHold : Pinned {
  public:
    DescriptorHold() = default;
    ~DescriptorHold() { idm::forget_dead_frames(); close(); }
    void own(int32_t fd) { fd_ = fd; }
    void locked() { locked_ = true; }
    // Runs to its end once begun: the number is given up before the close,
    // so that it is never closed twice.
    void close() {
        if (fd_ < 0) return;
        idm::NoCancel no_cancel;
        int32_t fd = fd_;
        fd_ = -1;
        if (locked_) sec__unlock_file(fd, "idm__ready_mapfile");
        locked_ = false;
        sec__close_file(&fd);
    }
    void release() { fd_ = -1; }

  private:
    int32_t fd_ = -1;
    bool locked_ = false;
};

// A heap copy of an identifier, zeroed and freed unless it is stored in an
// entry.
using SecretCopy = Hold<char, free_secret>;
char *secret_copy(std::string_view s) {
    auto *p = static_cast<char *>(xmalloc(s.size() + 1));
    if (p == nullptr) return nullptr;
    std::memcpy(p, s.data(), s.size());
    p[s.size()] = '\0';
    return p;
}

// ---------------------------------------------------------------------------
// Candidate files
// ---------------------------------------------------------------------------

// The allocation sites of a set, recorded by trace point kMapfileNamesNoMemory
// so that a trace tells which of the set's blocks could not be had.
enum SetSite : int {
    kSiteSet = 367,
    kSiteNames = 388,
    kSiteLocalPath = 420,
    kSiteGlobalPath = 434,
    kSiteFallbackPath = 448,
    kSiteFlags = 475,
    kSiteMtimes = 488,
    kSiteReadTimes = 501,
};

struct Candidate {
    const char *path;  // directory + file name
    SetSite site;      // allocation site of its copy
};
constexpr Candidate kCandidates[IDM_MAPFILE_COUNT] = {
    {"/var/ox/cfg/oxsec_map.local", kSiteLocalPath},
    {"/var/ox/cfg/oxsec_map.global", kSiteGlobalPath},
    {"/opt/helvo/cfg/oxsec_map.global", kSiteFallbackPath},
};

// Trims the block under a finished entry list to the smallest multiple of 10
// entries not below its count.  A failed trim keeps the larger block.
void reserve_exactly(idm_entry_list &list) {
    if (list.entries == nullptr || list.count < 1) return;
    const size_t bytes = (static_cast<size_t>(list.count) + 9) / 10 * 10 * sizeof(idm_mapfile_entry);
    if (malloc_usable_size(list.entries) < bytes + 10 * sizeof(idm_mapfile_entry)) return;
    if (void *p = xrealloc(list.entries, bytes)) list.entries = static_cast<idm_mapfile_entry *>(p);
}

const char *name_of(const idm_mapfile_set *set, int32_t i) {
    return set->names != nullptr ? set->names[i] : nullptr;
}

}  // namespace

// ---------------------------------------------------------------------------
// The line check
// ---------------------------------------------------------------------------

namespace idm::mapfile {

bool selects(std::string_view mechanism, std::string_view line) noexcept {
    size_t start = skip_blanks(line, 0);
    size_t colon = line.find(':', start);
    if (colon == std::string_view::npos) return false;
    return line.substr(start, colon - start) == mechanism;
}

LineVerdict judge_rule(std::string_view line) noexcept {
    constexpr LineVerdict kInvalid{LineKind::kInvalid, {}, {}};
    size_t colon = line.find(':');
    if (colon == std::string_view::npos) return kInvalid;
    size_t start = skip_blanks(line, colon + 1);
    if (start == line.size()) return kInvalid;  // nothing but blanks after the colon
    std::string_view rule = line.substr(start);

    if (rule[0] == '!') {
        // Denial: no '=' anywhere after the colon (only blanks stand between
        // the colon and the rule), and an identifier after the '!'.
        if (rule.find('=') != std::string_view::npos) return kInvalid;
        size_t id = skip_blanks(rule, 1);
        if (id == rule.size()) return kInvalid;
        return {LineKind::kDenial, rule.substr(id, blank_in(rule, id, rule.size()) - id), {}};  // no '=' in it
    }

    // Affirmative: network identifier, anything without '=', '=', blanks,
    // local identifier.
    size_t eq = rule.find('=');
    if (eq == std::string_view::npos || eq == 0 || eq + 1 == rule.size()) return kInvalid;
    size_t local = skip_blanks(rule, eq + 1);
    if (local == rule.size()) return kInvalid;
    // The network identifier ends at a blank before the first '=', or there.
    return {LineKind::kAffirmative, rule.substr(0, blank_in(rule, 0, eq)),
            rule.substr(local, blank_in(rule, local, rule.size()) - local)};
}

namespace {
// Line feed removal and comment cut: the line left to judge, or nothing when
// it is empty or blank.
bool prepare(std::string_view piece, std::string_view *line) {
    size_t lf = piece.find('\n');
    if (lf != std::string_view::npos) piece = piece.substr(0, lf);
    size_t hash = piece.find('#');
    if (hash != std::string_view::npos) piece = piece.substr(0, hash);
    *line = piece;
    return !only_blanks(piece);
}
}  // namespace

LineVerdict judge_line(std::string_view mechanism, std::string_view piece) noexcept {
    std::string_view line;
    if (!prepare(piece, &line) || !selects(mechanism, line)) return {LineKind::kSkipped, {}, {}};
    return judge_rule(line);
}

}  // namespace idm::mapfile

extern "C" {

// ---------------------------------------------------------------------------
// Map file set
// ---------------------------------------------------------------------------

int32_t idm__native_get_mapfile_names(idm_mapfile_set **set_out) {
    static constexpr const char kName[] = "idm__native_get_mapfile_names";
    static constexpr trace::ApiIds kIds{tp::kMapfileNamesEntry, tp::kMapfileNamesEntryData, tp::kMapfileNamesExit,
                                        tp::kMapfileNamesExit};
    idm_mapfile_set *const current = set_out != nullptr ? *set_out : nullptr;
    const trace::Api api(kIds, trace::ptr(set_out), trace::ptr(current));
    // The exit is a bare id at levels 1 and 8, then at level 8 each file of
    // the stored set.
    auto leave = [&api](int32_t status, const idm_mapfile_set *stored) {
        api.leave(status);
        if (stored != nullptr && trace::level(trace::kApi) == 8)
            for (int32_t i = 0; i < stored->count; ++i)
                trace::record_data(tp::kMapfileNamesFile, trace::i32(i), trace::text(name_of(stored, i), "[null]"));
        return status;
    };

    if (set_out == nullptr) return leave(bad_param(kInternal, kName, tp::kMapfileNamesBadArg, 1, 0), nullptr);

    auto no_memory = [&](int site, size_t bytes) {
        if (trace::error_on()) {
            int32_t b = static_cast<int32_t>(bytes);
            trace::record_data(tp::kMapfileNamesNoMemory, trace::i32(site), trace::i32(b));
        }
        return leave(report_no_memory(kName, bytes), nullptr);
    };

    SetHold building;
    auto *set = static_cast<idm_mapfile_set *>(xmalloc(sizeof(idm_mapfile_set)));
    if (set == nullptr) return no_memory(kSiteSet, sizeof(idm_mapfile_set));
    *set = idm_mapfile_set{IDM_MAPFILE_SET_TAG, IDM_MAPFILE_COUNT, nullptr, nullptr, nullptr, nullptr};
    building.hold(set);

    set->names = static_cast<char **>(xcalloc(IDM_MAPFILE_COUNT, sizeof(char *)));
    if (set->names == nullptr) return no_memory(kSiteNames, IDM_MAPFILE_COUNT * sizeof(char *));
    for (int32_t i = 0; i < IDM_MAPFILE_COUNT; ++i) {
        set->names[i] = xstrdup(kCandidates[i].path);
        if (set->names[i] == nullptr) return no_memory(kCandidates[i].site, std::strlen(kCandidates[i].path) + 1);
    }
    struct PerFile {
        uint32_t *idm_mapfile_set::*field;
        SetSite site;
    };
    static constexpr PerFile kArrays[] = {{&idm_mapfile_set::flags, kSiteFlags},
                                          {&idm_mapfile_set::mtimes, kSiteMtimes},
                                          {&idm_mapfile_set::read_times, kSiteReadTimes}};
    for (const PerFile &a : kArrays) {
        set->*a.field = static_cast<uint32_t *>(xcalloc(IDM_MAPFILE_COUNT, sizeof(uint32_t)));
        if (set->*a.field == nullptr) return no_memory(a.site, IDM_MAPFILE_COUNT * sizeof(uint32_t));
    }

    *set_out = building.release();
    return leave(0, *set_out);
}

void idm__native_release_cachef(idm_mapfile_set *set) {
    if (set == nullptr || (set->tag >> 8) != IDM_MAPFILE_SET_MARK) return;
    size_t count = set->count > 0 ? static_cast<size_t>(set->count) : 0;
    if (set->names != nullptr) {
        for (size_t i = 0; i < count; ++i) free_secret(set->names[i]);
        free_zeroed(set->names, count * sizeof(char *));
    }
    free_zeroed(set->flags, count * sizeof(uint32_t));
    free_zeroed(set->mtimes, count * sizeof(uint32_t));
    free_zeroed(set->read_times, count * sizeof(uint32_t));
    std::free(set);
}

void idm__thread_cleanup_cachef(void *set) {
    if (set != nullptr) idm__native_release_cachef(static_cast<idm_mapfile_set *>(set));
}

// ---------------------------------------------------------------------------
// One file: opening, reading, one line, the entry array
// ---------------------------------------------------------------------------

int32_t idm__ready_mapfile(const char *path, int32_t *fd, FILE **stream) {
    static constexpr trace::ApiIds kIds{tp::kReadyEntry, tp::kReadyEntryData, tp::kReadyExit, tp::kReadyExitData};
    static constexpr const char kName[] = "idm__ready_mapfile";
    trace::Api api(kIds, trace::text(path, "[null]"), trace::ptr(fd), trace::ptr(stream));
    int32_t d = -1;
    FILE *s = nullptr;
    auto leave = [&](int32_t status) {
        return api.leave(status, trace::text(path, "[null]"), trace::i32(d), trace::ptr(s));
    };
    auto bad = [&](int32_t position, uintptr_t value) {
        if (trace::error_on()) trace::record_data(tp::kReadyBadArg, trace::i32(position));
        return leave(report_bad_internal_param(kInternal, kName, position, hex(value)));
    };
    if (path == nullptr || path[0] == '\0') return bad(1, addr(path));
    if (fd == nullptr) return bad(2, 0);
    if (stream == nullptr) return bad(3, 0);

    // The descriptor is created and given to its hold with cancellation
    // off, so that it cannot be left open by a cancellation acted on as the
    // open returns.
    DescriptorHold hold;
    int r;
    {
        idm::NoCancel no_cancel;
        r = sec__open_file(path, 0, &d);
        if (r == 0) hold.own(d);
    }
    // Whatever the platform library checked, nothing but a regular file is
    // read: a FIFO or a device handed over here would block or never end.
    if (r == 0 && !stamp_of(d).regular) {
        hold.close();
        r = kNotRegularFile;
    }
    if (trace::diag_on()) trace::record_data(tp::kReadyOpened, trace::text(path), trace::i32(r), trace::i32(d));
    switch (r) {
    case kMssOk: break;
    case kMssAccessDenied: d = -1; return leave(report(kMapfileInaccessible, kMsg653, kName, path));
    case kMssMissing: d = -1; return leave(kMapfileMissing);
    case kMssNoMemory: d = -1; return leave(report(kMapfileInaccessible, kMsg654, kName, 0));
    default: d = -1; return leave(report(kInternal, kMsg655, "idm__open_mapfile", r, kName));
    }

    r = sec__readlock_file(d, kName);
    if (trace::diag_on()) trace::record_data(tp::kReadyLocked, trace::text(path), trace::i32(r));
    if (r != 0) {
        hold.close();
        d = -1;
        if (r == kMssLockTimeout) return leave(report(kMapfileLocked, kMsg656, "idm__readlock_mapfile", path));
        return leave(report(kInternal, kMsg655, "idm__readlock_mapfile", r, kName));
    }
    hold.locked();

    s = fdopen(d, "r");
    if (s == nullptr) {
        int e = errno;
        char number[16];
        std::snprintf(number, sizeof number, "%d", d);
        hold.close();
        if (trace::diag_on()) trace::record_data(tp::kReadyNoStream, trace::text(path), trace::i32(e), trace::ptr(s));
        d = -1;
        return leave(report(kInternal, kMsg657, path, number, e));
    }
    if (trace::diag_on()) trace::record_id(tp::kReadyStream);
    // The stream is this thread's alone: no stdio locking per line.
    __fsetlocking(s, FSETLOCKING_BYCALLER);
    hold.release();
    *fd = d;
    *stream = s;
    return leave(0);
}

}  // extern "C"

namespace {

// True when nothing follows in `stream` (or it cannot be read further).
bool at_end(FILE *stream) {
    int c = getc_unlocked(stream);
    if (c == EOF) return true;
    ungetc(c, stream);
    return false;
}

// idm__parse_mapfile.  For the reading pass (`outcome` not null) a file that
// may still be being written keeps its unterminated last line back, since
// it may be cut short, and the outcome says so; a direct call reads the
// stream whole as it stands.
int32_t parse_mapfile(const char *mechanism, const char *path, FILE *stream, int32_t *count,
                      idm_mapfile_entry **entries, FileOutcome *outcome) {
    static constexpr trace::ApiIds kIds{tp::kParseEntry, tp::kParseEntryData, tp::kParseExit, tp::kParseExitData};
    static constexpr const char kName[] = "idm__parse_mapfile";
    int32_t count_now = count != nullptr ? *count : 0;
    trace::Api api(kIds, trace::ptr(stream), trace::ptr(count), trace::i32(count_now), trace::ptr(entries));
    auto leave = [&](int32_t status) {
        count_now = count != nullptr ? *count : 0;
        return api.leave(status, trace::i32(count_now), trace::ptr(entries));
    };
    if (mechanism == nullptr || mechanism[0] == '\0') return leave(bad_param(kInternal, kName, tp::kParseBadArg, 1, addr(mechanism)));
    if (path == nullptr || path[0] == '\0') return leave(bad_param(kInternal, kName, tp::kParseBadArg, 2, addr(path)));
    if (stream == nullptr) return leave(bad_param(kInternal, kName, tp::kParseBadArg, 3, 0));
    if (count == nullptr) return leave(bad_param(kInternal, kName, tp::kParseBadArg, 4, 0));
    if (entries == nullptr) return leave(bad_param(kInternal, kName, tp::kParseBadArg, 5, 0));

    if (trace::diag_on()) trace::record_data(tp::kParseFile, trace::text(path), trace::text(mechanism));
    const std::string_view selector(mechanism);
    const FileStamp start = outcome != nullptr ? outcome->start : FileStamp{};
    const bool hold_cut_line = outcome != nullptr && changed_lately(start);
    // Every piece takes at least one byte: more pieces than the file had
    // bytes at the start means it grew, or never ends (a kernel file that
    // reports no size); the pass stops there and judges by the stamps.
    const int64_t piece_limit = start.size >= 0 ? static_cast<int64_t>(start.size) : INT64_MAX;
    int64_t pieces = 0;
    int32_t status = 0;
    int read_error = 0;
    char piece[1024];
    for (;;) {
        errno = 0;
        if (std::fgets(piece, sizeof piece, stream) == nullptr) {
            if (std::ferror(stream)) read_error = errno != 0 ? errno : EIO;
            break;
        }
        if (++pieces > piece_limit) {
            outcome->overran = true;
            break;
        }
        if (trace::diag_on()) trace::record_data(tp::kParseLine, trace::text(piece));
        // The piece as a C string: whatever follows a NUL byte is not seen.
        size_t n = std::strlen(piece);
        if (n > 0 && piece[n - 1] == '\n') {
            piece[--n] = '\0';
        } else if (hold_cut_line && at_end(stream)) {
            if (std::ferror(stream)) {
                read_error = errno != 0 ? errno : EIO;
            } else {
                outcome->held_back = true;
            }
            break;
        }
        if (n == 0) {
            if (trace::diag_on()) trace::record_id(tp::kParseEmptyLine);
            continue;
        }
        if (char *hash = static_cast<char *>(std::memchr(piece, '#', n))) {
            *hash = '\0';
            n = static_cast<size_t>(hash - piece);
        }
        // The selector test of idm__test_entry_mech, on the length known here.
        const std::string_view line(piece, n);
        if (only_blanks(line) || !mapfile::selects(selector, line)) {
            if (trace::diag_on()) trace::record_id(tp::kParseSkippedLine);
            continue;
        }
        status = idm__read_mapfile_entries(piece, count, entries);
        if (status != 0) break;
    }
    explicit_bzero(piece, sizeof piece);  // the last line read
    // A read error is no end of file: the file's remaining lines, denials
    // among them, were never seen, so the whole pass fails.
    if (status == 0 && read_error != 0) status = report(kInternal, kMsg655, "fgets", read_error, kName);
    if (trace::diag_on()) trace::record_id(tp::kParseEnd);
    return leave(status);
}

}  // namespace

extern "C" {

int32_t idm__parse_mapfile(const char *mechanism, const char *path, FILE *stream, int32_t *count,
                           idm_mapfile_entry **entries) {
    return parse_mapfile(mechanism, path, stream, count, entries, nullptr);
}

int32_t idm__test_entry_mech(const char *mechanism, const char *line) {
    if (mechanism == nullptr || line == nullptr) return 1;
    return mapfile::selects(mechanism, line) ? 0 : 1;
}

int32_t idm__read_mapfile_entries(const char *line, int32_t *count, idm_mapfile_entry **entries) {
    static constexpr trace::ApiIds kIds{tp::kEntriesEntry, tp::kEntriesEntryData, tp::kEntriesExit, tp::kEntriesExitData};
    static constexpr const char kName[] = "idm__read_mapfile_entries";
    int32_t count_now = count != nullptr ? *count : 0;
    trace::Api api(kIds, trace::text(line, "<null string>"), trace::i32(count_now), trace::ptr(entries));
    auto leave = [&](int32_t status) { return api.leave(status, trace::ptr(entries)); };
    if (line == nullptr || line[0] == '\0') return leave(bad_param(kInternal, kName, tp::kEntriesBadArg, 1, addr(line)));
    if (count == nullptr) return leave(bad_param(kInternal, kName, tp::kEntriesBadArg, 2, 0));
    if (*count < 0) return leave(bad_param(kInternal, kName, tp::kEntriesBadArg, 2, static_cast<uint32_t>(*count)));
    if (entries == nullptr || (*count == 0 && *entries != nullptr))
        return leave(bad_param(kInternal, kName, tp::kEntriesBadArg, 3, addr(entries)));

    mapfile::LineVerdict v = mapfile::judge_rule(line);
    if (v.kind != mapfile::LineKind::kAffirmative && v.kind != mapfile::LineKind::kDenial) {
        if (trace::diag_on()) trace::record_id(tp::kEntriesInvalidLine);
        return leave(0);
    }
    const bool denial = v.kind == mapfile::LineKind::kDenial;

    auto no_memory = [&](trace::tp::Id trace_id, size_t bytes) {
        int32_t b = static_cast<int32_t>(bytes);
        if (trace::error_on()) trace::record_data(trace_id, trace::i32(b));
        return leave(report(kInternal, kMsg658, kName, b));
    };
    SecretCopy network(secret_copy(v.network_id));
    if (network.get() == nullptr) return no_memory(tp::kEntriesNoNetworkCopy, v.network_id.size() + 1);
    SecretCopy local(denial ? nullptr : secret_copy(v.local_id));
    if (!denial && local.get() == nullptr) return no_memory(tp::kEntriesNoLocalCopy, v.local_id.size() + 1);

    if (int32_t status = idm__alloc_entries(*count, entries); status != 0) return leave(status);

    struct timeval now {};
    cu_gettimeofday_1(&now, nullptr);
    idm_mapfile_entry &e = (*entries)[*count];
    e.read_time = static_cast<int64_t>(now.tv_sec);
    e.kind = denial ? IDM_ENTRY_DENIAL : IDM_ENTRY_AFFIRMATIVE;
    e.network_id = network.release();
    e.local_id = local.release();
    ++*count;
    if (trace::diag_on())
        trace::record_data(tp::kEntriesNewEntry, trace::i64(e.read_time),
                           trace::text(denial ? "Denial of mapping" : "Affirmative mapping"),
                           trace::text(e.network_id), trace::text(e.local_id, ""));
    return leave(0);
}

int32_t idm__alloc_entries(int32_t count, idm_mapfile_entry **entries) {
    if (count < 0) return bad_param(kInternal, "idm__alloc_entries", tp::kEntriesBadArg, 1, static_cast<uint32_t>(count));
    if (entries == nullptr) return bad_param(kInternal, "idm__alloc_entries", tp::kEntriesBadArg, 2, 0);
    if (count % 10 != 0) return 0;
    // The list grows by ten slots: every tenth entry is one enlargement,
    // with its own failure point and the size of count + 10 entries.  The
    // block underneath grows geometrically, so that a long file costs linear
    // copying whatever the allocator does with a block followed by the
    // identifier copies; reserve_exactly() trims it when the list is handed
    // over.
    const size_t bytes = (static_cast<size_t>(count) + 10) * sizeof(idm_mapfile_entry);
    int32_t bytes32 = static_cast<int32_t>(bytes);
    if (trace::diag_on()) trace::record_data(tp::kEntriesGrow, trace::i32(count), trace::i32(bytes32));
    idm_mapfile_entry *array = *entries;
    bool grown = false;
    if (array != nullptr && malloc_usable_size(array) >= bytes) {
#ifdef OXIDM_FAULT_INJECTION
        grown = !fault_alloc_fires();  // the enlargement as a failure point of its own
#else
        grown = true;
#endif
    } else if (count <= INT32_MAX - 10) {
        size_t reserve = (static_cast<size_t>(count) + count / 2 + 9) / 10 * 10;
        if (reserve < static_cast<size_t>(count) + 10) reserve = static_cast<size_t>(count) + 10;
        void *p = xrealloc(array, reserve * sizeof(idm_mapfile_entry));
        if (p != nullptr) {
            array = static_cast<idm_mapfile_entry *>(p);
            grown = true;
        }
    }
    if (!grown) {
        if (trace::error_on()) trace::record_data(tp::kEntriesGrowFailed, trace::i32(bytes32));
        report(kInternal, kMsg658, "idm_alloc_entries", bytes32);
        return kNoMemory;
    }
    std::memset(array + count, 0, 10 * sizeof(idm_mapfile_entry));
    *entries = array;
    return 0;
}

void idm__native_release_entry_list(int32_t count, idm_mapfile_entry *entries) {
    if (count < 1 || entries == nullptr) return;
    for (int32_t i = 0; i < count; ++i) {
        free_secret(entries[i].network_id);
        free_secret(entries[i].local_id);
    }
    std::free(entries);
}

void idm__thread_cleanup_entries(void *list) {
    auto *l = static_cast<idm_entry_list *>(list);
    if (l == nullptr || l->entries == nullptr) return;
    for (int32_t i = 0; i < l->count; ++i) {
        free_secret(l->entries[i].network_id);
        free_secret(l->entries[i].local_id);
    }
    std::free(l->entries);
    l->entries = nullptr;
    l->count = 0;
}

void idm__thread_cleanup_mapfile(void *open_mapfile) {
    auto *f = static_cast<idm_open_mapfile *>(open_mapfile);
    if (f == nullptr || f->fd == -1) return;
    if (trace::diag_on()) {
        f->path[IDM_MAPFILE_PATH_MAX] = '\0';
        trace::record_data(tp::kMapfileReleased, trace::text(f->path), trace::i32(f->fd), trace::ptr(f->stream));
    }
    sec__unlock_file(f->fd, "idm__thread_cleanup_mapfile");
    if (f->stream != nullptr) {
        std::fclose(f->stream);
    } else {
        int fd = f->fd;
        sec__close_file(&fd);
    }
    explicit_bzero(f, sizeof *f);
    f->fd = -1;
}

// ---------------------------------------------------------------------------
// Change detection
// ---------------------------------------------------------------------------

int32_t idm__native_test_mapfiles_v1(idm_mapfile_set *set, int32_t index, int32_t superseder) {
    static constexpr const char kName[] = "idm__native_test_mapfiles_v1";
    static constexpr trace::ApiIds kIds{tp::kTestFileEntry, tp::kTestFileEntry, tp::kTestFileExit, tp::kTestFileExitData};
    const trace::Api api(kIds);
    auto leave = [&api](int32_t result) { return api.leave(result); };
    if (set == nullptr || set->names == nullptr || set->flags == nullptr || set->mtimes == nullptr ||
        set->read_times == nullptr)
        return leave(report_bad_internal_param(kInternal, kName, 1, hex(set)));
    if (index < 0 || index >= set->count)
        return leave(report_bad_internal_param(kInternal, kName, 2, hex(static_cast<uint32_t>(index))));
    if (superseder < -1 || superseder >= set->count || superseder == index)
        return leave(report_bad_internal_param(kInternal, kName, 3, hex(static_cast<uint32_t>(superseder))));

    const char *path = set->names[index];
    uint32_t m = 0;
    int r = sec__time_file(path, &m);
    if (r != kMssOk && r != kMssMissing) return r;  // no exit record on a failed query

    uint32_t &flags = set->flags[index];
    uint32_t &mtime = set->mtimes[index];
    uint32_t &read_time = set->read_times[index];
    const bool diag = trace::diag_on();
    auto note = [&](trace::tp::Id id) {
        if (diag) trace::record_data(id, trace::text(path, "[null]"));
    };
    auto note_superseded = [&]() {
        if (diag) trace::record_data(tp::kTestFileSuperseded, trace::text(path, "[null]"), trace::text(set->names[superseder], "[null]"));
    };
    const bool superseded = superseder >= 0 && (set->flags[superseder] & MF_PRESENT) != 0;

    if (r == kMssMissing) {
        if ((flags & MF_PRESENT) == 0) {  // still absent
            flags &= ~MF_REMOVED;
            note(tp::kTestFileUnchanged);
            return leave(1);
        }
        flags &= ~(MF_PRESENT | MF_IN_USE | MF_REREAD);  // removed
        flags |= MF_REMOVED;
        mtime = 0;
        read_time = 0;
        note(tp::kTestFileRemoved);
        return leave(0);
    }

    if ((flags & MF_PRESENT) == 0) {  // appeared
        mtime = m;
        note(tp::kTestFileAppeared);
        if (superseded) {
            flags = MF_PRESENT;
            note_superseded();
            return leave(1);
        }
        flags = MF_PRESENT | MF_IN_USE | MF_REREAD;
        note(tp::kTestFileAppearedInUse);
        return leave(0);
    }

    note(tp::kTestFileStillPresent);  // still present
    if (superseded) {
        const bool unchanged_unread = m == mtime && mtime != read_time;
        flags = MF_PRESENT;
        mtime = m;
        note_superseded();
        if (unchanged_unread) note(tp::kTestFileUnchanged);
        return leave(1);
    }

    flags = MF_PRESENT | MF_IN_USE;
    note(tp::kTestFileSelected);
    bool changed = true;
    if (m != mtime) {
        mtime = m;
        flags |= MF_REREAD;
        note(tp::kTestFileTimeChanged);
    } else if (mtime == read_time) {
        // Parsed in the very second of the last change: a rewrite later in
        // that second would not show, so read again.
        flags |= MF_REREAD;
        note(tp::kTestFileSameSecond);
    } else {
        changed = false;
        note(tp::kTestFileUnchanged);
    }
    if (superseder >= 0 && (set->flags[superseder] & MF_REMOVED) != 0) {
        flags |= MF_REREAD;
        note(tp::kTestFileUnsuperseded);
        return leave(0);
    }
    return leave(changed ? 0 : 1);
}

int32_t idm__native_test_mapfiles(idm_mapfile_set *set) {
    static constexpr const char kName[] = "idm__native_test_mapfiles";
    static constexpr trace::ApiIds kIds{tp::kTestFilesEntry, tp::kTestFilesEntry, tp::kTestFilesExit, tp::kTestFilesExitData};
    const trace::Api api(kIds);
    auto leave = [&api](int32_t result) { return api.leave(result); };
    auto deselect_all = [set]() {
        if (set->flags == nullptr) return;
        for (int32_t i = 0; i < set->count; ++i) set->flags[i] &= ~(MF_IN_USE | MF_REREAD);
    };

    if (set == nullptr) {
        bad_param(kBadParameter, kName, tp::kTestFilesBadArg, 1, 0);
        return leave(1);
    }
    if (uint32_t version = set->tag & 0xffu; version != IDM_MAPFILE_SET_VERSION) {
        if (trace::error_on()) trace::record_data(tp::kTestFilesBadVersion, trace::u32(version));
        report(kInternal, kMsg655, kName, 23, "[ignored]");
        deselect_all();
        return leave(1);
    }

    // File 2 is tested last: it reads the state the test of file 1 just left.
    static constexpr int32_t kSuperseder[IDM_MAPFILE_COUNT] = {-1, -1, 1};
    bool any_changed = false;
    for (int32_t i = 0; i < IDM_MAPFILE_COUNT; ++i) {
        int32_t r = idm__native_test_mapfiles_v1(set, i, kSuperseder[i]);
        if (r == 0) {
            any_changed = true;
        } else if (r != 1) {
            deselect_all();
            return leave(any_changed ? 0 : 1);
        }
    }
    if (trace::diag_on()) {
        for (int32_t i = 0; i < IDM_MAPFILE_COUNT; ++i) {
            uint32_t f = set->flags[i];
            int32_t present = (f & MF_PRESENT) != 0, in_use = (f & MF_IN_USE) != 0;
            int32_t removed = (f & MF_REMOVED) != 0, reread = (f & MF_REREAD) != 0;
            trace::record_data(tp::kTestFilesState, trace::i32(i), trace::text(name_of(set, i), "[null]"), trace::i32(present),
                               trace::i32(in_use), trace::i32(removed), trace::i32(reread), trace::u32(set->mtimes[i]),
                               trace::u32(set->read_times[i]));
        }
    }
    return leave(any_changed ? 0 : 1);
}

// ---------------------------------------------------------------------------
// Reading pass
// ---------------------------------------------------------------------------

}  // extern "C"

namespace {

// Drops the entries from index `from` on (zeroed and freed), leaving the
// slots zeroed for the list to grow into again; an emptied list has no
// array, as a list of no entries must.
void truncate_list(idm_entry_list &list, int32_t from) {
    if (list.entries == nullptr || list.count <= from) return;
    if (from == 0) {
        idm__thread_cleanup_entries(&list);
        return;
    }
    for (int32_t k = from; k < list.count; ++k) {
        free_secret(list.entries[k].network_id);
        free_secret(list.entries[k].local_id);
        list.entries[k] = idm_mapfile_entry{};
    }
    list.count = from;
}

// Opens, parses and closes one file of a reading pass, appending its entries
// to `list`.  A file whose size or modification time moved while it was
// parsed was caught being written: its entries are dropped and it is read
// again, a few times, before the pass fails closed with 2650-655.
int32_t read_one_file(const char *mechanism, const char *path, idm_entry_list &list, FileOutcome &outcome) {
    static constexpr const char kName[] = "idm__native_read_mapfiles";
    for (int attempt = 1;; ++attempt) {
        const int32_t first_entry = list.count;
        MapfileHold hold(path);
        idm_open_mapfile &open = hold.file();
        outcome = FileOutcome{};
        int32_t status = idm__ready_mapfile(open.path, &open.fd, &open.stream);
        if (status != 0) return status;
        hold.buffer_stream();
        if (trace::diag_on()) trace::record_data(tp::kReadMapfilesParsing, trace::text(open.path));
        outcome.start = stamp_of(open.fd);
        status = parse_mapfile(mechanism, open.path, open.stream, &list.count, &list.entries, &outcome);
        const bool steady = stamp_of(open.fd) == outcome.start;
        {
            idm::NoCancel no_cancel;
            sec__unlock_file(open.fd, kName);
            FILE *stream = open.stream;
            open.stream = nullptr;
            open.fd = -1;
            std::fclose(stream);
        }
        hold.disarm();
        if (status == 0 && outcome.overran && steady) {
            // More text than its unchanged size: no file a writer keeps.
            truncate_list(list, first_entry);
            return report(kInternal, kMsg655, "idm__parse_mapfile", kNotRegularFile, kName);
        }
        if (status != 0 || steady) return status;
        truncate_list(list, first_entry);
        if (attempt == kReadAttempts) return report(kInternal, kMsg655, "idm__parse_mapfile", kKeptChanging, kName);
    }
}

}  // namespace

extern "C" {

int32_t idm__native_read_mapfiles(const char *mechanism, idm_mapfile_set **set, int32_t *count,
                                  idm_mapfile_entry **entries) {
    static constexpr const char kName[] = "idm__native_read_mapfiles";
    static constexpr trace::ApiIds kIds{tp::kReadMapfilesEntry, tp::kReadMapfilesEntry, tp::kReadMapfilesExit,
                                        tp::kReadMapfilesExitData};
    const trace::Api api(kIds);
    auto leave = [&](int32_t status) {
        idm_mapfile_set *const s = set != nullptr ? *set : nullptr;
        const int32_t c = count != nullptr ? *count : 0;
        return api.leave(status, trace::ptr(set), trace::ptr(s), trace::ptr(count), trace::i32(c), trace::ptr(entries));
    };

    idm_entry_list list{nullptr, 0};  // the list this pass builds, freed unless handed over
    EntriesHold building(&list);

    if (mechanism == nullptr || mechanism[0] == '\0') return leave(bad_param(kInternal, kName, tp::kReadMapfilesBadArg, 1, addr(mechanism)));
    if (set == nullptr) return leave(bad_param(kInternal, kName, tp::kReadMapfilesBadArg, 2, 0));
    if (count == nullptr) return leave(bad_param(kInternal, kName, tp::kReadMapfilesBadArg, 3, 0));
    if (entries == nullptr) return leave(bad_param(kInternal, kName, tp::kReadMapfilesBadArg, 4, 0));
    if (trace::level(trace::kApi) == 8 || trace::diag_on())
        trace::record_data(tp::kReadMapfilesArgs, trace::text(mechanism), trace::ptr(set), trace::ptr(*set), trace::ptr(count),
                           trace::i32(*count), trace::ptr(entries), trace::ptr(*entries));

    if (*set == nullptr)
        if (int32_t status = idm__native_get_mapfile_names(set); status != 0) return leave(status);
    idm_mapfile_set *files = *set;
    if (int32_t r = idm__native_test_mapfiles(files); r != 0) return leave(r);

    for (int32_t i = 0; i < files->count; ++i) {
        if ((files->flags[i] & MF_IN_USE) == 0) continue;
        FileOutcome outcome;
        int32_t status = read_one_file(mechanism, files->names[i], list, outcome);
        // A file that could not be read, or whose cut last line was held
        // back, is read again at the next request: its read time is set to
        // its modification time, which the change test takes for a parse in
        // the second of the change.  So a failure stands, reported at every
        // request, until the file is fixed; it never turns into "no match".
        if (status != 0) {
            files->read_times[i] = files->mtimes[i];
            return leave(status);  // the hold of the list frees it
        }
        struct timeval now {};
        cu_gettimeofday_1(&now, nullptr);
        files->read_times[i] = outcome.held_back ? files->mtimes[i] : static_cast<uint32_t>(now.tv_sec);
        files->flags[i] &= ~MF_REREAD;
    }

    reserve_exactly(list);
    idm__native_release_entry_list(*count, *entries);
    *count = list.count;
    *entries = list.entries;
    building.release();
    return leave(0);
}

}  // extern "C"
