// Identity mapping files: the map file set (which files, and what the change
// test remembers about each), the line format and its parser, and the
// reading pass that rebuilds a mechanism's entry list when a file changed.
//
// Files in motion.  Only a regular file is read: a path that names a FIFO, a
// device, a directory, a socket, or a symbolic link to one of them or to
// nothing fails the pass (2650-655, status 23, result code 22), and the
// descriptor libox_mss hands over is checked again, so that no platform
// library can make a pass block or read for ever.  A read error fails the
// pass too; it is never taken for the end of the file, whose remaining lines
// (denials among them) would be lost.  A file caught being written is never
// acted on half-written:
//   - while a file's modification time is in the current or the previous
//     second, an unterminated last line is held back (it may be cut short);
//   - the file's size and modification time (fstat) are compared before and
//     after it is parsed; a file that moved is parsed again, three times at
//     most, and then the pass fails closed (2650-655, result code 11);
//   - a file whose last line was held back, or that failed in any way (not
//     only these), is read again at the next request: its read time is set
//     to its modification time, which the change test takes for a parse in
//     the second of the change.  A failure stands until the file is fixed; it
//     never turns into "no line matched" at the next request.
// What this cannot catch: a writer that rewrites a file in place and pauses
// exactly at a line feed for longer than the parse leaves a shorter, valid
// file, and one that pauses for more than a second leaves a cut last line
// that looks settled.  Within one file a prefix can grant only what the whole file grants,
// or less (the first match wins), but across files it can grant more: a
// local file cut short loses denials that would have stopped a broad rule of
// the global file.  Only a writer that replaces a file by rename, or holds
// the write lock that readers take (an open-file-description lock), is safe
// from that.  Files last changed earlier are read exactly as they stand.
//
// Nothing here takes a mutex.  A set, the list being built and the open
// files of a pass are used by one thread at a time: the caller holds the
// owning translator's mutex for the whole pass.  The only lock taken here is
// the shared file lock of libox_mss, held while one file is parsed and
// released by idm__thread_cleanup_mapfile if the thread is cancelled.
#ifndef OXIDM_NATFILE_H
#define OXIDM_NATFILE_H

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <string_view>

#include "oxidm.h"

// Per-file state bits of a map file set.
inline constexpr uint32_t MF_PRESENT = 0x1u;         // existed at the last test
inline constexpr uint32_t MF_IN_USE = 0x2u;          // selected: its entries belong in the list
inline constexpr uint32_t MF_REMOVED = 0x4u;         // found missing at the latest test only
inline constexpr uint32_t MF_REREAD = 0x80000000u;   // must be parsed at this pass

// Tag of a set: the mark in the upper 24 bits, the layout version below.
inline constexpr uint32_t IDM_MAPFILE_SET_MARK = 0x1dcde5u;
inline constexpr uint32_t IDM_MAPFILE_SET_VERSION = 1u;
inline constexpr uint32_t IDM_MAPFILE_SET_TAG = (IDM_MAPFILE_SET_MARK << 8) | IDM_MAPFILE_SET_VERSION;
inline constexpr int32_t IDM_MAPFILE_COUNT = 3;
inline constexpr size_t IDM_MAPFILE_PATH_MAX = 4096;

extern "C" {

// The candidate map files of one translator and the change test's memory of
// each, indexed 0 local, 1 global in /var/ox/cfg, 2 global in /opt/helvo/cfg.
// Owns its path texts and its four arrays (each of `count` elements).
struct idm_mapfile_set {
    uint32_t tag;          // IDM_MAPFILE_SET_TAG
    int32_t count;         // always 3
    char **names;          // full paths
    uint32_t *flags;       // MF_* bits
    uint32_t *mtimes;      // modification time last seen (s); 0 while missing
    uint32_t *read_times;  // low 32 bits of the clock at the last good parse
};

// An entry list under construction: what idm__thread_cleanup_entries frees.
struct idm_entry_list {
    idm_mapfile_entry *entries;
    int32_t count;
};

// One file of a reading pass while it is open: what
// idm__thread_cleanup_mapfile releases.  `fd` is -1 while nothing is open.
struct idm_open_mapfile {
    char path[IDM_MAPFILE_PATH_MAX + 1];
    FILE *stream;
    int32_t fd;
};

// ---- map file set ----

// Creates a set naming the three files, all state 0, and stores it at
// *set_out.  Returns 0; 23 when set_out is null (2650-651); 6 when memory
// runs out (2650-654).  On failure *set_out is untouched and nothing leaks.
int32_t idm__native_get_mapfile_names(idm_mapfile_set **set_out);
// Releases a set (path texts zeroed first).  Does nothing for null or for a
// record without the set's mark; any layout version is accepted.
void idm__native_release_cachef(idm_mapfile_set *set);

// ---- one file ----

// Opens `path` read-only under a shared lock and opens a read stream on it.
// Returns 0 with *fd and *stream set (the caller unlocks with
// sec__unlock_file and closes the stream); 37 the file does not exist
// (nothing reported); 36 access denied (2650-653) or no memory (2650-654);
// 30 lock not had in time (2650-656); 23 bad argument (2650-651), other
// failure (2650-655) or no stream (2650-657).  On failure nothing stays
// open or locked and *fd, *stream are untouched.
int32_t idm__ready_mapfile(const char *path, int32_t *fd, FILE **stream);
// Reads `stream` to its end and appends an entry for every valid line of
// `mechanism` to (*count, *entries).  Returns 0; 23 bad argument
// (2650-651); the status of idm__read_mapfile_entries when a line could not
// be stored (the entries appended so far stay in the list).
int32_t idm__parse_mapfile(const char *mechanism, const char *path, FILE *stream, int32_t *count,
                           idm_mapfile_entry **entries);
// 0 when `line` is selected by `mechanism` (exact selector before the first
// colon), 1 otherwise (also for a null argument).
int32_t idm__test_entry_mech(const char *mechanism, const char *line);
// Parses one selected line and appends its entry.  Returns 0 (also when the
// line is invalid and ignored); 23 bad argument (2650-651) or an identifier
// copy failed (2650-658); 6 the array could not grow (2650-658).
int32_t idm__read_mapfile_entries(const char *line, int32_t *count, idm_mapfile_entry **entries);
// Grows the array by ten zeroed slots when `count` is a multiple of 10.
// Returns 0; 6 when it cannot grow (2650-658; the array is unchanged);
// 23 bad argument (2650-651).
int32_t idm__alloc_entries(int32_t count, idm_mapfile_entry **entries);
// Zeroes and frees every identifier, then frees the array.  Does nothing
// for count < 1 or a null array.
void idm__native_release_entry_list(int32_t count, idm_mapfile_entry *entries);

// ---- change detection and reading pass ----

// Tests the files of *set (creating the set first when *set is null) and,
// when one changed, parses every selected file into a new list.
// Returns 0: the list at (*count, *entries) was released and replaced by the
// new one (the caller owns it and releases it with
// idm__native_release_entry_list); 1: nothing changed, nothing touched;
// otherwise the error status (6, 23, 30, 36, 37), nothing touched.
int32_t idm__native_read_mapfiles(const char *mechanism, idm_mapfile_set **set, int32_t *count,
                                  idm_mapfile_entry **entries);
// 0 when at least one file changed, 1 when none did or the test could not be
// completed (null set: 2650-651 with status 4; layout version not 1:
// 2650-655).
int32_t idm__native_test_mapfiles(idm_mapfile_set *set);
// Tests file `index`, superseded by file `superseder` (-1: none).  0 when it
// changed in a way that needs a pass; 1 when not, or not selected; any other
// value is the failure of sec__time_file (the state is untouched).
int32_t idm__native_test_mapfiles_v1(idm_mapfile_set *set, int32_t index, int32_t superseder);

// Cancellation clean-ups; each may also be called directly.
void idm__thread_cleanup_mapfile(void *open_mapfile);  // idm_open_mapfile *
void idm__thread_cleanup_entries(void *list);          // idm_entry_list *
void idm__thread_cleanup_cachef(void *set);            // idm_mapfile_set *
}

namespace idm::mapfile {

// What one line of a map file says.  The views point into the judged text.
enum class LineKind : uint8_t {
    kSkipped,      // empty, blank, comment only, or another mechanism's line
    kInvalid,      // the mechanism's line, but fits neither rule form
    kAffirmative,  // network_id maps to local_id
    kDenial,       // network_id must not be mapped
};
struct LineVerdict {
    LineKind kind;
    std::string_view network_id;
    std::string_view local_id;  // empty for a denial
};

// The mechanism selector: after leading blanks, the text up to the first
// colon equals `mechanism` exactly (same length, case significant).
bool selects(std::string_view mechanism, std::string_view line) noexcept;
// The rule of a line already selected (comment cut, no line feed): a denial
// ("!" and a network identifier, no "=" anywhere) or an affirmative mapping
// (a network identifier, "=", a local identifier); kInvalid when it fits
// neither form.
LineVerdict judge_rule(std::string_view line) noexcept;
// The whole check of one piece as read from a file (at most one line feed,
// at its end): line feed removal, comment cut, blank test, selector, rule.
// Every character counts, NUL included; the file reader hands over a piece
// up to its first NUL, as the C-string interface of the parser sees it.
LineVerdict judge_line(std::string_view mechanism, std::string_view piece) noexcept;

}  // namespace idm::mapfile

#endif
