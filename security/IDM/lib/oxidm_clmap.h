// Cluster map: the node information file /var/ox/cfg/oxsec.nodeinfo, the
// two search trees that hold it, and the membership lookup behind the
// exported queries.
//
// State (all process-wide, set up by sec__idm_clmap_init, never torn down):
//   nametree, iptree  guarded by idmutex; read under a read share, changed
//                     only between a promotion and a demotion of idmutex (a
//                     reload detaches the old contents there and frees them
//                     after the demotion, when no other thread can see them)
//   lastmod           the file's modification time (whole seconds) at the
//                     last load attempt; read and written whole (atomically)
//                     by threads that hold only a read share
//   idmutex           the reader-writer lock (oxsec_lock); the only lock of
//                     this module, independent of the mapping locks
//   loadedmod         (in the .cpp) the time whose load has ended; with
//                     lastmod it tells a query that a load of its file's time
//                     is still running.  Such a query gives up its share and
//                     waits (a condition variable broadcast whenever a load
//                     ends, cancelled loads included) instead of answering
//                     from trees that load has not built yet
//
// Files in motion.  A path that stats as anything but a regular file (a
// FIFO, a device, a directory, a socket, a symbolic link to one of them or
// to nothing) is reported with 2650-693 at every query and never opened; the
// open itself does not block, and the descriptor is checked again.  The file
// is read to its end.  Its size and modification time are compared before
// and after the read: a file that moved is read again, three times at most,
// and then the load fails with 2650-694 and the next query loads again.  A
// file last changed in the current or the previous second whose last line
// has no line feed may be cut short: the load keeps the previous trees and
// the next query loads again.  A writer that stops at a line feed for longer
// than a load, or anywhere for more than a second, can still be caught with
// a shorter file (its last records missing or incomplete, or a cut last
// line); only a writer that replaces the file by rename is safe from that.
//
// The judgement of the text is split from the file walk: parse() and
// scan_value() are pure functions of a text (no trees, no reports, no
// trace), called by the loader and usable by a fuzzer or a checker tool.
#ifndef OXIDM_CLMAP_H
#define OXIDM_CLMAP_H

#include <cstddef>
#include <cstdint>
#include <string_view>

#include "oxidm_holds.h"
#include "oxidm_tracepoints.h"
#include "oxsec_lock.h"
#include "oxsec_rstree.h"

// One tree entry: a host name (nametree) or address text (iptree) and a copy
// of its record's cluster names in file order.  Every stored record has a
// count of at least 1; only a lookup's probe has count 0 and no array.  A
// record made by idm__getnode is one heap block holding the key, the array
// and the names after the fields (so the key shares the record's first
// cache line); a probe is the caller's and points at the caller's key.
struct idm_clnode {
    char *key;        // the tree key, exactly as written in the file
    char **clusters;  // array of `count` strings, or null
    int32_t count;
};

// The cluster trees' lock: a read share for every query, the write hold
// while a load rebuilds the trees.
extern "C" sec_rwlock idmutex;

namespace idm::clmap {

inline constexpr char kNodeInfoPath[] = "/var/ox/cfg/oxsec.nodeinfo";
inline constexpr int32_t kNotFound = 1;  // host not listed: no failure, nothing reported

// Storing records may make at most this many bytes of tree records per byte
// of text (plus a fixed allowance): each record gets its own copy of its
// host's cluster list, so a hostile file listing many names and many
// clusters in one record would otherwise ask for memory and time growing with
// their product.  Real files stay far below it.  A tree record of a key
// costs sizeof(idm_clnode), the key with its NUL, and its cluster list (a
// pointer and the name with its NUL per cluster).
inline constexpr size_t kRecordBytesPerTextByte = 64;
inline constexpr size_t kRecordBytesAllowance = size_t{16} << 20;

// The calling query's hold of idmutex.  A read share from construction; the
// write hold between promote() and demote(); nothing while either of them
// waits, since both give up the previous hold first.  The destructor
// releases whatever is held at that moment, so a query cancelled anywhere
// (in a lock wait, in open or read) leaves idmutex consistent.
class OXIDM_SCOPED_CAPABILITY MapHold : idm::Pinned {
  public:
    explicit MapHold(sec_rwlock *lock) OXIDM_ACQUIRE_SHARED(*lock);
    ~MapHold() OXIDM_RELEASE_GENERIC();
    // The hold is always of idmutex; the two changes of mode are told to the
    // analysis in its name.
    void promote() OXIDM_RELEASE_SHARED(idmutex) OXIDM_ACQUIRE(idmutex);
    void demote() OXIDM_RELEASE(idmutex) OXIDM_ACQUIRE_SHARED(idmutex);
    // Gives up the read share until the load that claimed time `t` has
    // ended (or another claim replaced it), then takes a share again.
    void wait_for_load(int64_t t);

  private:
    enum Mode { kNone, kRead, kWrite };
    sec_rwlock *lock_;
    Mode mode_ = kNone;
};

// ---- pure judgement of the text ----

enum class Keyword { kNone, kNode, kName, kAddress, kCluster };
enum Attr : int { kNames = 0, kAddresses = 1, kClusters = 2 };

// The keyword a statement begins with: its own length of text compared
// without regard to case (cu_8bit_strncasecmp_posix_1), in the order NODE,
// NAME, ADDRESS, CLUSTER.  Only that prefix counts ("Nodes" is NODE).
Keyword keyword_of(std::string_view statement);

// One value of a value list, cut from the start of `text`.  Blanks (0x20)
// are skipped first; the value runs from its first to its last non-space
// character before `terminator` (whitespace inside it, such as a tab, is
// kept).  An LF (or the end of `text`) before a blank terminator ends the
// line: status 21.  Otherwise status 0, `consumed` is the terminator's
// offset and `length` 0 when there was no value.
struct ValueScan {
    int32_t status;
    size_t consumed;
    size_t begin;
    size_t length;
};
ValueScan scan_value(std::string_view text, char terminator);

// Receives the parse's results.  value(): one non-empty value of the open
// record's attribute, in file order.  record(): the open record is complete
// (at the next NODE or at the end).  A non-zero status from either stops
// the parse with that status.  No virtual calls: two routines and a context.
struct ParseSink {
    void *context;
    int32_t (*value)(void *context, Attr attr, std::string_view value);
    int32_t (*record)(void *context);
    // Optional: the blank-separated part of a value list met its line's end
    // (once per attribute line, before its last value).
    void (*list_end)(void *context) = nullptr;
};

// Outcome of a parse.  status 0: every record was handed over.  status 21:
// invalid text; `point` is the Error trace point that names the fault,
// `offset` where the statement begins and `line` its line (from 1).  Any
// other status came from the sink (point 0).
struct ParseResult {
    int32_t status;
    idm::trace::tp::Id point;
    size_t offset;
    size_t line;
};

// Parses node information text (the loader appends an LF; a text without a
// final LF is judged as if it had one).  Never allocates, reports or traces.
ParseResult parse(std::string_view text, const ParseSink &sink);

// A value of `length` bytes at `begin` as a zero-filled heap string, or
// nullptr after reporting 2650-654 for idm__extract_attr_value.
char *copy_value(const char *begin, size_t length);

// Wakes the queries waiting for the outcome of a load (called when a load
// ends in any way, cancellation included).
void announce_load_outcome();

}  // namespace idm::clmap

// ---- the loader (the caller holds `hold` as a read share; so on return) ----

// Looks `host` up after reloading the file when its time changed.  0: found,
// *clusters/*count are the stored record's (owned by the tree, valid while
// the read share is held).  1: not found (also a null or empty host, a
// missing or empty file, an empty tree; nothing reported).  6 memory, 21
// file access or syntax, 23 tree insertion (each reported where detected).
int32_t sec__get_cluster_names(idm::clmap::MapHold &hold, const char *host, char ***clusters, int32_t *count)
    OXIDM_REQUIRES_SHARED(idmutex);
// The reload rule.  0: the trees are as current as this load could make
// them; 6, 21, 23 as above.
int32_t idm__read_clmap_file(idm::clmap::MapHold &hold)
    OXIDM_REQUIRES_SHARED(idmutex);
// Parses `text` (`size` bytes, ending with an LF) and rebuilds both trees
// under the write hold.  Any failure leaves both trees empty.
int32_t idm__construct_clcfg(idm::clmap::MapHold &hold, const char *text, size_t size)
    OXIDM_REQUIRES_SHARED(idmutex);

extern "C" {

extern rst_tree nametree OXIDM_GUARDED_BY(idmutex);  // keyed by host name
extern rst_tree iptree OXIDM_GUARDED_BY(idmutex);    // keyed by address text
extern int64_t lastmod;                              // atomically accessed

// Extracts one value as scan_value() cuts it.  0: *attr_value is the
// value's heap copy (free), or null when there was none; *consumed is the
// terminator's offset.  21: the line ended before the blank terminator
// (*consumed is the LF's offset; 2650-690 reported).  6: no memory
// (2650-654 reported).
int32_t idm__extract_attr_value(const char *text, int32_t *consumed, char **attr_value, char terminator);
// 0: *node is a new record with a copy of key and, for count > 0, an array
// of count entries copying each non-null entry of clusters (a null entry
// stays null), all in one block.  6: no memory (2650-654 reported with the
// block's size, *node null, nothing left allocated).
int32_t idm__getnode(const char *key, char **clusters, int32_t count, idm_clnode **node);
// Frees each non-null entry of the first count entries and nulls it.
void idm__free_arrays(char **array, int32_t count);
// strcmp of the two records' keys.
int idm__rtree_compare_routine(const void *probe, const void *stored);
// Frees a record made by idm__getnode (its one block: key, cluster strings
// and array with it); null is ignored.
void idm__rtree_cleanup_routine(void *node);

}  // extern "C"

#endif
