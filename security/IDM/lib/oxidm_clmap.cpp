// Cluster map: the node information file, its two search trees, and the
// exported membership queries (see oxidm_clmap.h for the state and its
// guards).
//
// A query holds idmutex as a read share from before its lookup until it has
// read the returned cluster names.  The load step runs under that share:
// stat, the comparison with lastmod, open, read and the working lists happen
// with the read share; every change of the trees happens between a
// promotion and a demotion, with thread cancellation disabled so that a
// rebuild is never left half done; the old contents are detached there and
// released after the demotion (OldTrees).  Since promotion gives up the
// read share before it waits, another thread may reload in between; each
// reload rebuilds both trees from scratch, so the last one wins.
//
// The file is read whole with one read() into a buffer of its size + 1, an
// LF is appended, and parse() judges the text in place.  The working lists
// hold views into that text; a value is copied only into the tree records
// that hold it, each record one heap block.
#include "oxidm_clmap.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <memory>

#include "oxidm_diag.h"
#include "oxidm_holds.h"
#include "oxidm_state.h"

using namespace idm;

extern "C" {
rst_tree nametree;
rst_tree iptree;
int64_t lastmod;
sec_rwlock idmutex;
}

namespace idm::clmap {
namespace {

constexpr trace::ApiIds kNamesIds{tp::kNamesEntry, tp::kNamesEntryData, tp::kNamesExit, tp::kNamesExitData};
constexpr trace::ApiIds kActiveIds{tp::kActiveEntry, tp::kActiveEntryData, tp::kActiveExit, tp::kActiveExitData};
constexpr trace::ApiIds kAnyIds{tp::kAnyEntry, tp::kAnyEntryData, tp::kAnyExit, tp::kAnyExitData};
constexpr const char kNullHost[] = "<null string>";
constexpr const char kNullValue[] = "[null!]";

constexpr int32_t kListStep = 32;  // working lists start with and grow by 32 entries

// lastmod after a load that was abandoned by cancellation: no file has this
// time, so the next query loads again.
constexpr int64_t kForceReload = INT64_MIN;

int64_t load_lastmod() { return __atomic_load_n(&lastmod, __ATOMIC_ACQUIRE); }
void store_lastmod(int64_t t) { __atomic_store_n(&lastmod, t, __ATOMIC_RELEASE); }

// The time whose load has ended (whatever its outcome).  lastmod is claimed
// by a load before it reads the file; a query that finds its file's time
// claimed but not yet loaded waits for that load instead of answering from
// trees the load has not rebuilt.  Written under g_outcome_mutex, with a
// broadcast of g_outcome; read atomically without it.
int64_t loadedmod = 0;
idm_mutex_t g_outcome_mutex = PTHREAD_MUTEX_INITIALIZER;
pthread_cond_t g_outcome = PTHREAD_COND_INITIALIZER;

int64_t load_loadedmod() { return __atomic_load_n(&loadedmod, __ATOMIC_ACQUIRE); }

// The load that claimed `t` has ended.  A later claim (another time, or a
// forced reload) keeps its waiters waiting for its own outcome.
void finish_load(int64_t t) {
    MutexHold lock(&g_outcome_mutex);
    if (load_lastmod() == t) __atomic_store_n(&loadedmod, t, __ATOMIC_RELEASE);
    pthread_cond_broadcast(&g_outcome);
}

// How many times a node file caught being written is read before the load
// fails.
constexpr int kReadAttempts = 3;

// The isspace classification of the current locale, taken once per parse
// rather than by a library call per character.
class SpaceTable {
  public:
    SpaceTable() {
        for (int c = 0; c < 256; ++c) space_[c] = std::isspace(c) != 0;
    }
    bool operator()(char c) const { return space_[static_cast<unsigned char>(c)]; }

  private:
    bool space_[256];
};

// Trace point kNodeNoMemory: the allocation site and the bytes asked for.
enum AllocSite : int32_t { kSiteNames = 1, kSiteAddresses, kSiteClusters, kSiteGrowNames, kSiteGrowAddresses,
                           kSiteGrowClusters };

void trace_alloc_failure(int32_t site, size_t bytes) {
    if (!trace::error_on()) return;
    const int64_t asked = static_cast<int64_t>(bytes);
    trace::record_data(tp::kNodeNoMemory, trace::i32(site), trace::i64(asked));
}

// Empties both trees; the caller holds the write hold.
void clean_trees() OXIDM_REQUIRES(idmutex) {
    if (nametree.rst_node_cnt != 0) sec__rst_clean(&nametree);
    if (iptree.rst_node_cnt != 0) sec__rst_clean(&iptree);
}

// The trees' previous contents, taken out of nametree and iptree under the
// write hold (which leaves both empty, exactly as a clean would) and
// released through sec__rst_clean after the write hold has ended, when no
// other thread can reach them any more.  Readers wait only for the rebuild,
// and the old records are freed after the new ones were allocated: a clean
// frees records in tree order, scattered over the heap, and new records
// taken straight from those freed pieces would be scattered likewise,
// making every later walk of the trees slower (a steady stream of 100,000-
// host reloads ran more than twice as long that way).
class OldTrees : Pinned {
  public:
    OldTrees() = default;
    ~OldTrees() { release(); }

    void take() OXIDM_REQUIRES(idmutex) {
        move(nametree, names_);
        move(iptree, addresses_);
    }
    void release() {
        if (names_.rst_node_cnt != 0) sec__rst_clean(&names_);
        if (addresses_.rst_node_cnt != 0) sec__rst_clean(&addresses_);
    }

  private:
    static void move(rst_tree &from, rst_tree &to) {
        if (to.rst_node_cnt != 0) sec__rst_clean(&to);
        to = from;
        from.rst_root = nullptr;
        from.rst_node_cnt = 0;
    }
    rst_tree names_{};
    rst_tree addresses_{};
};

// Opens the node information file with cancellation off, so that the new
// descriptor always reaches its hold.
int open_uncancelled(const char *path) {
    NoCancel no_cancel;
    return ::open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
}

// The descriptor of the file being read; closed at the end of the scope.
class FileHold : Pinned {
  public:
    explicit FileHold(int fd) : fd_(fd) {}
    ~FileHold() { idm::forget_dead_frames(); close(); }
    int fd() const { return fd_; }
    // The number is given up before the call: a second close of it could
    // close a descriptor another thread has opened since.
    void close() {
        if (fd_ < 0) return;
        idm::NoCancel no_cancel;
        const int fd = fd_;
        fd_ = -1;
        ::close(fd);
    }

  private:
    int fd_;
};

// A load's claim of a file time, stored in lastmod before the file is read.
// It ends in one of two ways, and either wakes the queries waiting for it:
// finished (the trees are as this load leaves them; the time is not loaded
// again) or retried (lastmod no longer names a time, so the next query loads
// the file again).  A cancelled load is retried.
class LoadClaim : Pinned {
  public:
    explicit LoadClaim(int64_t t) : time_(t) { store_lastmod(t); }
    ~LoadClaim() {
        if (open_) retry();
    }
    int32_t finish(int32_t status) {
        open_ = false;
        finish_load(time_);
        return status;
    }
    int32_t retry(int32_t status = 0) {
        open_ = false;
        store_lastmod(kForceReload);
        announce_load_outcome();
        return status;
    }

  private:
    int64_t time_;
    bool open_ = true;
};

// ---- the pure parser ----

struct KeywordEntry {
    std::string_view text;
    Keyword keyword;
};
constexpr KeywordEntry kKeywords[] = {
    {"NODE", Keyword::kNode}, {"NAME", Keyword::kName}, {"ADDRESS", Keyword::kAddress}, {"CLUSTER", Keyword::kCluster}};

struct AttrRule {
    Attr attr;
    size_t keyword_length;
    trace::tp::Id not_allowed_point;  // outside a record, or already given
    trace::tp::Id no_colon_point;
};
constexpr AttrRule kNameRule{kNames, 4, tp::kNameMisplaced, tp::kNameNoColon};
constexpr AttrRule kAddressRule{kAddresses, 7, tp::kAddressMisplaced, tp::kAddressNoColon};
constexpr AttrRule kClusterRule{kClusters, 7, tp::kClusterMisplaced, tp::kClusterNoColon};

// Walks a text; caches the end of the current line so that every search
// for ":" and LF stays within one pass over the line.
class Cursor {
  public:
    explicit Cursor(std::string_view text) : text_(text) {}

    // Offset of the LF that ends the line holding `pos` (or the text's size).
    size_t line_end(size_t pos) {
        if (pos >= line_end_ || pos < line_begin_) {
            const void *lf = std::memchr(text_.data() + pos, '\n', text_.size() - pos);
            line_begin_ = pos;
            line_end_ = lf != nullptr ? static_cast<size_t>(static_cast<const char *>(lf) - text_.data()) : text_.size();
        }
        return line_end_;
    }
    // Offset of the first ":" in [from, end of line), or npos.
    size_t colon(size_t from) {
        size_t end = line_end(from);
        const void *c = std::memchr(text_.data() + from, ':', end - from);
        return c != nullptr ? static_cast<size_t>(static_cast<const char *>(c) - text_.data()) : std::string_view::npos;
    }

  private:
    std::string_view text_;
    size_t line_begin_ = 0;
    size_t line_end_ = 0;
};

struct Record {
    bool open = false;
    int32_t count[3] = {0, 0, 0};  // values given per attribute
    size_t offset = 0;             // where its NODE statement begins
    size_t line = 0;
    bool complete() const { return count[kClusters] != 0 && (count[kNames] != 0 || count[kAddresses] != 0); }
};

}  // namespace

Keyword keyword_of(std::string_view statement) {
    for (const KeywordEntry &k : kKeywords)
        if (statement.size() >= k.text.size() &&
            cu_8bit_strncasecmp_posix_1(statement.data(), k.text.data(), k.text.size()) == 0)
            return k.keyword;
    return Keyword::kNone;
}

namespace {

ValueScan scan_value(std::string_view text, char terminator, const SpaceTable &is_space) {
    size_t i = 0;
    while (i < text.size() && text[i] == ' ') ++i;
    size_t first = std::string_view::npos;
    size_t last = 0;
    for (; i < text.size(); ++i) {
        const char c = text[i];
        if (c == terminator) break;
        if (c == '\n') return {21, i, 0, 0};
        if (!is_space(c)) {
            if (first == std::string_view::npos) first = i;
            last = i;
        }
    }
    // The end of the text stands for the LF the loader appends.
    if (i == text.size() && terminator != '\n') return {21, i, 0, 0};
    if (first == std::string_view::npos) return {0, i, 0, 0};
    return {0, i, first, last - first + 1};
}

}  // namespace

ValueScan scan_value(std::string_view text, char terminator) { return scan_value(text, terminator, SpaceTable()); }

ParseResult parse(std::string_view text, const ParseSink &sink) {
    const SpaceTable is_space;
    Cursor cursor(text);
    Record record;
    size_t pos = 0;
    size_t line = 1;
    auto invalid = [&](trace::tp::Id point, size_t offset, size_t at_line) { return ParseResult{21, point, offset, at_line}; };
    auto from_sink = [&](int32_t status, size_t offset) { return ParseResult{status, trace::tp::Id{}, offset, line}; };

    // Reads the value list after the ":" at `colon` into `rule.attr`; leaves
    // `pos` on the line's LF.
    auto read_values = [&](const AttrRule &rule, size_t colon) -> int32_t {
        int32_t n = 0;
        size_t p = colon;
        for (;;) {
            ++p;  // past the ":" or the blank that ended the previous value
            ValueScan v = scan_value(text.substr(p), ' ', is_space);
            if (v.status != 0) {
                if (sink.list_end != nullptr) sink.list_end(sink.context);
                break;
            }
            if (v.length != 0) {
                if (int32_t s = sink.value(sink.context, rule.attr, text.substr(p + v.begin, v.length))) return s;
                ++n;
            }
            p += v.consumed;
        }
        ValueScan last = scan_value(text.substr(p), '\n', is_space);
        if (last.length != 0) {
            if (int32_t s = sink.value(sink.context, rule.attr, text.substr(p + last.begin, last.length))) return s;
            ++n;
        }
        record.count[rule.attr] = n;
        pos = p + last.consumed;
        return 0;
    };

    while (pos < text.size()) {
        const char c = text[pos];
        if (is_space(c)) {
            if (c == '\n') ++line;
            ++pos;
            continue;
        }
        const size_t statement = pos;
        if (c == '#') {
            pos = cursor.line_end(pos) + 1;
            ++line;
            continue;
        }
        const Keyword keyword = keyword_of(text.substr(pos));
        const AttrRule *rule = nullptr;
        switch (keyword) {
        case Keyword::kNode: {
            if (record.open) {
                if (!record.complete()) return invalid(tp::kNodeRecordIncomplete, record.offset, record.line);
                if (int32_t s = sink.record(sink.context)) return from_sink(s, statement);
            }
            const size_t colon = cursor.colon(pos + 4);
            if (colon == std::string_view::npos) return invalid(tp::kNodeNoColon, statement, line);
            record = Record{};
            record.open = true;
            record.offset = statement;
            record.line = line;
            pos = colon + 1;
            continue;
        }
        case Keyword::kName: rule = &kNameRule; break;
        case Keyword::kAddress: rule = &kAddressRule; break;
        case Keyword::kCluster: rule = &kClusterRule; break;
        case Keyword::kNone: return invalid(tp::kNoKeyword, statement, line);
        }
        if (!record.open || record.count[rule->attr] != 0) return invalid(rule->not_allowed_point, statement, line);
        const size_t colon = cursor.colon(pos + rule->keyword_length);
        if (colon == std::string_view::npos) return invalid(rule->no_colon_point, statement, line);
        if (int32_t s = read_values(*rule, colon)) return from_sink(s, statement);
    }
    if (record.open) {
        if (!record.complete()) return invalid(tp::kNodeRecordIncomplete, record.offset, record.line);
        if (int32_t s = sink.record(sink.context)) return from_sink(s, text.size());
    }
    return {0, trace::tp::Id{}, text.size(), line};
}

// Every byte of the copy is written (the value, then its NUL), so there is
// nothing for calloc to clear.
char *copy_value(const char *begin, size_t length) {
    auto *copy = static_cast<char *>(xmalloc(length + 1));
    if (copy == nullptr) {
        report_no_memory("idm__extract_attr_value", length + 1);
        return nullptr;
    }
    std::memcpy(copy, begin, length);
    copy[length] = '\0';
    return copy;
}

namespace {

// ---- tree records ----

// The heap's geometry (glibc): a block of n bytes takes a chunk of n + 8
// bytes rounded up to 16, at least 32.
constexpr size_t heap_chunk(size_t n) { return n + 8 <= 32 ? 32 : (n + 8 + 15) & ~size_t{15}; }

// The order of both trees: the keys' bytes as unsigned char, as strcmp.
// Keys are short and differ early; a plain loop the search can inline costs
// less than the call.
inline int compare_keys(const void *probe, const void *stored) {
    const auto *a = reinterpret_cast<const unsigned char *>(static_cast<const idm_clnode *>(probe)->key);
    const auto *b = reinterpret_cast<const unsigned char *>(static_cast<const idm_clnode *>(stored)->key);
    while (*a == *b && *a != 0) {
        ++a;
        ++b;
    }
    return int{*a} - int{*b};
}

// A tree record is one heap block, so that the cleanup routine frees it
// with one call and a search finds the key in the line it reads the record
// from:
//   idm_clnode | key and NUL | padding | char *[count] | each name and NUL
// `name(i)` gives the i-th cluster name (a view whose data is null for an
// entry left null).  0, or 6 after reporting 2650-654 for idm__getnode with
// the block's size.
//
// `node_follows`: the record goes into a tree next, whose insertion
// allocates the tree node.  The block is then taken a tree node's chunk
// larger and shrunk in place, which leaves exactly that chunk free right
// behind the record, first in line for the node's allocation.  A search
// then finds each node beside its record (one page, often one pair of
// lines) whatever pieces earlier loads left in the heap; without this a
// reload builds its trees in the scattered pieces of the trees before, and
// searches in them took about a third longer.  With another allocator the shrink
// is merely a shrink.
template <class Name>
int32_t new_record(std::string_view key, int32_t count, Name name, idm_clnode **node, bool node_follows = false) {
    static constexpr size_t kAlign = alignof(char *);
    const size_t array_at = (sizeof(idm_clnode) + key.size() + 1 + kAlign - 1) & ~(kAlign - 1);
    size_t bytes = array_at + static_cast<size_t>(count) * sizeof(char *);
    bool overflow = false;
    for (int32_t i = 0; i < count; ++i) {
        const std::string_view c = name(i);
        if (c.data() != nullptr) overflow |= __builtin_add_overflow(bytes, c.size() + 1, &bytes);
    }
    const size_t asked = node_follows && !overflow ? heap_chunk(bytes) - 8 + heap_chunk(sizeof(rst_node)) : bytes;
    auto *block = overflow ? nullptr : static_cast<char *>(xmalloc(asked));
    if (block == nullptr) {
        *node = nullptr;
        return report_no_memory("idm__getnode", overflow ? SIZE_MAX : bytes);
    }
    if (asked != bytes)
        if (void *shrunk = std::realloc(block, bytes)) block = static_cast<char *>(shrunk);
    auto *n = reinterpret_cast<idm_clnode *>(block);
    n->key = block + sizeof(idm_clnode);
    std::memcpy(n->key, key.data(), key.size());
    n->key[key.size()] = '\0';
    n->clusters = nullptr;
    n->count = count;
    if (count > 0) {
        n->clusters = reinterpret_cast<char **>(block + array_at);
        char *to = block + array_at + static_cast<size_t>(count) * sizeof(char *);
        for (int32_t i = 0; i < count; ++i) {
            const std::string_view c = name(i);
            if (c.data() == nullptr) {
                n->clusters[i] = nullptr;
                continue;
            }
            n->clusters[i] = to;
            std::memcpy(to, c.data(), c.size());
            to[c.size()] = '\0';
            to += c.size() + 1;
        }
    }
    *node = n;
    return 0;
}

// ---- building the trees from the parse ----

// One working list of values (names, addresses or clusters): views into the
// text being parsed, each cut at its first NUL as a C string would be.
struct WorkList {
    std::string_view *values = nullptr;
    int32_t count = 0;
    int32_t capacity = 0;
};

// The parse's sink while loading: the three working lists and the record
// store.  Owns the lists; the destructor (also the cancellation clean-up)
// releases them.  The values stay in the text, which outlives the parse, and
// are copied once, into each tree record that holds them.
class Builder : Pinned {
  public:
    explicit Builder(size_t text_size)
        : record_budget_(text_size * kRecordBytesPerTextByte + kRecordBytesAllowance) {}
    ~Builder() { release(); }

    // 0, or 6 after reporting (2650-654 and trace point kNodeNoMemory).
    int32_t allocate_lists() {
        static constexpr int32_t kSites[3] = {kSiteNames, kSiteAddresses, kSiteClusters};
        for (int a = 0; a < 3; ++a) {
            lists_[a].values = static_cast<std::string_view *>(xmalloc(kListStep * sizeof(std::string_view)));
            if (lists_[a].values == nullptr) {
                report_no_memory("idm__construct_clcfg", kListStep * sizeof(std::string_view));
                trace_alloc_failure(kSites[a], kListStep * sizeof(std::string_view));
                return kNoMemory;
            }
            lists_[a].capacity = kListStep;
        }
        return 0;
    }

    void release() {
        for (WorkList &l : lists_) {
            std::free(l.values);
            l = WorkList{};
        }
    }

    ParseSink sink() { return {this, &Builder::on_value, &Builder::on_record, &Builder::on_list_end}; }

  private:
    // The value extraction reports the end of a blank-separated list as an
    // invalid entry; the parse takes it for the list's end, so a load that
    // succeeds leaves this report behind as the current error.
    static void on_list_end(void *) { report(kNodeFileInvalid, kMsg690); }
    static int32_t on_value(void *self, Attr attr, std::string_view value) {
        return static_cast<Builder *>(self)->add_value(attr, value);
    }
    static int32_t on_record(void *self) { return static_cast<Builder *>(self)->store_record(); }

    int32_t add_value(Attr attr, std::string_view value) {
        WorkList &l = lists_[attr];
        if (const void *nul = std::memchr(value.data(), '\0', value.size()))
            value = value.substr(0, static_cast<size_t>(static_cast<const char *>(nul) - value.data()));
        l.values[l.count++] = value;
        if (l.count == l.capacity) return grow(attr);
        return 0;
    }

    int32_t grow(Attr attr) {
        static constexpr int32_t kSites[3] = {kSiteGrowNames, kSiteGrowAddresses, kSiteGrowClusters};
        WorkList &l = lists_[attr];
        const size_t capacity = static_cast<size_t>(l.capacity) + kListStep;
        const size_t bytes = capacity * sizeof(std::string_view);
        auto *grown = static_cast<std::string_view *>(xrealloc(l.values, bytes));
        if (grown == nullptr) {
            report_no_memory("idm__construct_clcfg", bytes);
            trace_alloc_failure(kSites[attr], bytes);
            return kNoMemory;
        }
        l.values = grown;
        l.capacity = static_cast<int32_t>(capacity);
        return 0;
    }

    // The record's values for the diagnostic trace, each as a text of its
    // own (made only at that level; a copy that cannot be made fails the
    // load as the value's copy would).
    int32_t trace_record() const {
        trace::record_id(tp::kNodeRecordComplete);
        static constexpr trace::tp::Id kPoints[3] = {tp::kNodeRecordName, tp::kNodeRecordAddress, tp::kNodeRecordCluster};
        for (int a = 0; a < 3; ++a)
            for (int32_t i = 0; i < lists_[a].count; ++i) {
                const std::string_view v = lists_[a].values[i];
                char *copy = copy_value(v.data(), v.size());
                if (copy == nullptr) return kNoMemory;
                trace::record_data(kPoints[a], trace::i32(i), trace::text(copy));
                std::free(copy);
            }
        return 0;
    }

    // Makes the tree record of one key within the record budget.
    int32_t make_node(std::string_view key, size_t cluster_bytes, idm_clnode **node) {
        const WorkList &clusters = lists_[kClusters];
        const size_t need = sizeof(idm_clnode) + key.size() + 1 + cluster_bytes;
        if (need > record_budget_ - record_spent_) {
            *node = nullptr;
            return report_no_memory("idm__getnode", static_cast<size_t>(clusters.count) * sizeof(char *));
        }
        record_spent_ += need;
        return new_record(key, clusters.count, [&](int32_t i) { return clusters.values[i]; }, node, true);
    }

    // Stores one record per value of `attr` into `tree`; the first record
    // stored for a key wins.
    int32_t store_keys(Attr attr, rst_tree *tree, const char *label, size_t cluster_bytes) {
        const WorkList &keys = lists_[attr];
        for (int32_t i = 0; i < keys.count; ++i) {
            const std::string_view key = keys.values[i];
            idm_clnode *node = nullptr;
            if (make_node(key, cluster_bytes, &node) != 0) {
                if (trace::diag_on()) trace_no_record(label, key);
                return kNoMemory;
            }
            void *item = node;
            const int r = sec__rst_insert(tree, &item);
            if (r < 0) {
                idm__rtree_cleanup_routine(node);
                if (trace::error_on()) trace::record_data(tp::kTreeInsertFailed, trace::text(label));
                return report(kInternal, kMsg691);
            }
            if (r == 0) idm__rtree_cleanup_routine(node);
        }
        return 0;
    }

    // Trace point kNodeNoTreeRecord for a key: its text needs a copy of its
    // own, which is not reported when it cannot be made (the load is
    // failing already).
    static void trace_no_record(const char *label, std::string_view key) {
        char *copy = key.empty() ? nullptr : static_cast<char *>(xmalloc(key.size() + 1));
        if (copy != nullptr) {
            std::memcpy(copy, key.data(), key.size());
            copy[key.size()] = '\0';
        }
        trace::record_data(tp::kNodeNoTreeRecord, trace::text(label), trace::text(copy, kNullValue));
        std::free(copy);
    }

    int32_t store_record() {
        if (trace::diag_on())
            if (int32_t s = trace_record()) return s;
        const WorkList &clusters = lists_[kClusters];
        size_t cluster_bytes = static_cast<size_t>(clusters.count) * sizeof(char *);
        for (int32_t i = 0; i < clusters.count; ++i) cluster_bytes += clusters.values[i].size() + 1;
        if (int32_t s = store_keys(kNames, &nametree, "NAME", cluster_bytes)) return s;
        if (int32_t s = store_keys(kAddresses, &iptree, "ADDRESS", cluster_bytes)) return s;
        for (WorkList &l : lists_) l.count = 0;
        return 0;
    }

    WorkList lists_[3];
    size_t record_budget_;
    size_t record_spent_ = 0;
};

// Empties both trees under the write hold (file missing or empty).
void empty_trees(MapHold &hold) OXIDM_REQUIRES_SHARED(idmutex) {
    OldTrees old;
    hold.promote();
    {
        NoCancel no_cancel;
        old.take();
    }
    hold.demote();
}

bool is_address(const char *host) {
    // Every address text inet_pton takes begins with a hexadecimal digit or
    // ':'; a name that begins with anything else is told without it.
    const unsigned char c = static_cast<unsigned char>(host[0]);
    if (c != ':' && !std::isxdigit(c)) return false;
    unsigned char address[sizeof(struct in6_addr)];
    return inet_pton(AF_INET, host, address) == 1 || inet_pton(AF_INET6, host, address) != 0;
}

// The node file's text, read to its end, with an LF appended.
struct Text {
    std::unique_ptr<char, decltype(&std::free)> bytes{nullptr, &std::free};
    size_t size = 0;  // bytes read, without the appended LF
};

// Reads the open file to its end into `text`.  0; 6 after 2650-654; 21
// after 2650-694 (a read error).  `expected` (the size the descriptor
// reported) sizes the buffer; a file that grew since is read whole anyway.
int32_t read_whole(int fd, size_t expected, Text &text, bool &grew) {
    // A file that grows while it is read is read on, to this many bytes.
    const size_t limit = expected < SIZE_MAX / 4 ? expected * 2 + 65536 : expected;
    grew = false;
    size_t capacity = expected + 1;
    text.bytes.reset(static_cast<char *>(xmalloc(capacity)));
    if (text.bytes == nullptr) return report_no_memory("idm__read_clmap_file", capacity);
    text.size = 0;
    for (;;) {
        // With the buffer full, a small read tells the end of the file from
        // more text, so that a file of the expected size costs no growth.
        char more[4096];
        const bool full = text.size + 1 == capacity;
        char *to = full ? more : text.bytes.get() + text.size;
        const ssize_t got = ::read(fd, to, full ? sizeof more : capacity - 1 - text.size);
        if (got == 0) break;
        if (got < 0) {
            if (errno == EINTR) continue;
            return report(kNodeFileInvalid, kMsg694);
        }
        if (full) {
            // More than its size at the open: the file grew, or it never
            // ends (a kernel file that reports no size).  The caller judges
            // by the stamps.
            if (text.size >= limit) {
                grew = true;
                break;
            }
            const size_t bigger = std::max(capacity * 2, capacity + static_cast<size_t>(got));
            char *p = static_cast<char *>(xrealloc(text.bytes.get(), bigger));
            if (p == nullptr) return report_no_memory("idm__read_clmap_file", bigger);
            (void)text.bytes.release();
            text.bytes.reset(p);
            capacity = bigger;
            std::memcpy(p + text.size, more, static_cast<size_t>(got));
        }
        text.size += static_cast<size_t>(got);
    }
    text.bytes.get()[text.size] = '\n';
    return 0;
}

// A file last changed in this second or the one before may still be being
// written, and then an unterminated last line may be cut short.
bool cut_line(const Text &text, const FileStamp &stamp) {
    if (text.size == 0 || text.bytes.get()[text.size - 1] == '\n') return false;
    struct timeval now {};
    cu_gettimeofday_1(&now, nullptr);
    return stamp.mtime.tv_sec >= now.tv_sec - 1;
}

// The reload rule; see read_clmap_file and the module header.
int32_t load(MapHold &hold) OXIDM_REQUIRES_SHARED(idmutex) {
    struct stat st;
    for (;;) {
        if (::stat(kNodeInfoPath, &st) != 0) {
            if (errno != ENOENT) return report(kNodeFileInvalid, kMsg692);
            // A symbolic link to nothing is a file that cannot be read, not
            // a missing one.
            if (::lstat(kNodeInfoPath, &st) == 0) return report(kNodeFileInvalid, kMsg693);
            empty_trees(hold);
            return 0;
        }
        // Anything but a regular file (a FIFO, a device, a directory, a
        // socket) is a file that cannot be read, reported at every query
        // until it is replaced; it is never opened.
        if (!S_ISREG(st.st_mode)) return report(kNodeFileInvalid, kMsg693);
        if (st.st_size == 0) {
            empty_trees(hold);
            if (st.st_mtime != load_lastmod()) {
                store_lastmod(st.st_mtime);
                finish_load(st.st_mtime);
            }
            return 0;
        }
        if (st.st_mtime != load_lastmod()) break;
        if (load_loadedmod() == st.st_mtime) return 0;  // the trees are current
        // Another thread claimed this time and is still loading: wait for
        // its outcome without holding a share, then look again.
        hold.wait_for_load(st.st_mtime);
    }
    // Claimed before the file is opened: a failure to open or read it, or
    // an invalid text, is not loaded again until the time changes; a file
    // caught being written is.
    LoadClaim claim(st.st_mtime);
    Text text;
    for (int attempt = 1;; ++attempt) {
        FileHold file(open_uncancelled(kNodeInfoPath));
        if (file.fd() < 0) return claim.finish(report(kNodeFileInvalid, kMsg693));
        const FileStamp before = stamp_of(file.fd());
        // Replaced by something else since the stat: looked at again.
        if (!before.regular) return claim.retry(report(kNodeFileInvalid, kMsg693));
        bool grew = false;
        if (int32_t status = read_whole(file.fd(), static_cast<size_t>(before.size), text, grew); status != 0)
            return claim.finish(status);
        const FileStamp after = stamp_of(file.fd());
        const bool steady = after == before;
        file.close();
        if (steady && grew) return claim.retry(report(kNodeFileInvalid, kMsg694));
        if (steady) {
            // A cut last line is not acted on: the trees stay as they were.
            if (cut_line(text, after)) return claim.retry();
            break;
        }
        if (attempt == kReadAttempts) return claim.retry(report(kNodeFileInvalid, kMsg694));
    }
    return claim.finish(idm__construct_clcfg(hold, text.bytes.get(), text.size + 1));
}

}  // namespace

MapHold::MapHold(sec_rwlock *lock) OXIDM_NO_THREAD_SAFETY_ANALYSIS : lock_(lock) {
    sec__lock_read(lock_);
    mode_ = kRead;
}

MapHold::~MapHold() OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    idm::forget_dead_frames();
    if (mode_ == kRead) sec__unlock_read(lock_);
    else if (mode_ == kWrite) sec__unlock_write(lock_);
}

void MapHold::promote() OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    mode_ = kNone;  // the read share is given up before the wait
    sec__lock_promote(lock_);
    mode_ = kWrite;
}

void MapHold::wait_for_load(int64_t t) OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    mode_ = kNone;
    sec__unlock_read(lock_);
    {
        MutexHold lock(&g_outcome_mutex);
        // A cancellation in the wait re-takes the mutex and unwinds through
        // the hold, which releases it; nothing else is held here.
        while (load_lastmod() == t && load_loadedmod() != t) pthread_cond_wait(&g_outcome, &g_outcome_mutex);
    }
    sec__lock_read(lock_);
    mode_ = kRead;
}

void MapHold::demote() OXIDM_NO_THREAD_SAFETY_ANALYSIS {
    mode_ = kNone;  // the write hold is given up before the wait
    sec__lock_demote(lock_);
    mode_ = kRead;
}

void announce_load_outcome() {
    MutexHold lock(&g_outcome_mutex);
    pthread_cond_broadcast(&g_outcome);
}

}  // namespace idm::clmap

using idm::clmap::MapHold;

int32_t idm__construct_clcfg(MapHold &hold, const char *text, size_t size) {
    if (trace::diag_on()) {
        const int64_t length = static_cast<int64_t>(size);
        trace::record_data(tp::kNodeFileParsing, trace::ptr(text), trace::i64(length));
    }
    idm::clmap::OldTrees old;
    idm::clmap::Builder builder(size);
    int32_t status = builder.allocate_lists();
    hold.promote();
    {
        idm::NoCancel no_cancel;
        old.take();
        if (status == 0) {
            const idm::clmap::ParseSink sink = builder.sink();
            const idm::clmap::ParseResult r = idm::clmap::parse(std::string_view(text, size), sink);
            if (r.status == kNodeFileInvalid) {
                if (trace::error_on()) trace::record_id(r.point);
                report(kNodeFileInvalid, kMsg690);
            }
            status = r.status;
            if (status != 0) idm::clmap::clean_trees();
        }
        builder.release();
    }
    hold.demote();
    return status;
}

int32_t idm__read_clmap_file(MapHold &hold) {
    if (trace::level(trace::kApi) != 0) trace::record_id(tp::kNodeFileStart);
    const int32_t status = idm::clmap::load(hold);
    if (trace::level(trace::kApi) != 0) trace::record_data(tp::kNodeFileEnd, trace::i32(status));
    return status;
}

int32_t sec__get_cluster_names(MapHold &hold, const char *host, char ***clusters, int32_t *count) {
    trace::Api api(idm::clmap::kNamesIds, trace::text(host, idm::clmap::kNullHost));
    *clusters = nullptr;
    *count = 0;
    int32_t status = idm__read_clmap_file(hold);
    if (status != 0) return api.leave(status);
    if (host == nullptr) return api.leave(idm::clmap::kNotFound);
    // The probe is only compared (by its key): it lives on the stack.
    idm_clnode probe{const_cast<char *>(host), nullptr, 0};
    rst_tree *tree = idm::clmap::is_address(host) ? &iptree : &nametree;
    status = idm::clmap::kNotFound;
    // Both trees order by idm__rtree_compare_routine, whose body the search
    // takes inline.
    const auto *found = static_cast<const idm_clnode *>(
        rst_search(tree, &probe, [](const void *p, const void *stored) { return idm::clmap::compare_keys(p, stored); }));
    if (found != nullptr) {
        *clusters = found->clusters;
        *count = found->count;
        status = 0;
    }
    return api.leave(status);
}

extern "C" {

int32_t idm__extract_attr_value(const char *text, int32_t *consumed, char **attr_value, char terminator) {
    static constexpr const char kName[] = "idm__extract_attr_value";
    if (text == nullptr) return report_bad_internal_param(kInternal, kName, 1, hex(text));
    if (consumed == nullptr) return report_bad_internal_param(kInternal, kName, 2, hex(consumed));
    if (attr_value == nullptr) return report_bad_internal_param(kInternal, kName, 3, hex(attr_value));
    *attr_value = nullptr;
    // The value ends at the terminator or at the line's LF at the latest.
    const char *end = static_cast<const char *>(std::strchr(text, '\n'));
    const size_t length = end != nullptr ? static_cast<size_t>(end - text) + 1 : std::strlen(text);
    const idm::clmap::ValueScan v = idm::clmap::scan_value(std::string_view(text, length), terminator);
    *consumed = static_cast<int32_t>(v.consumed);
    if (v.status != 0) return report(kNodeFileInvalid, kMsg690);
    if (v.length == 0) return 0;
    *attr_value = idm::clmap::copy_value(text + v.begin, v.length);
    return *attr_value != nullptr ? 0 : 6;
}

int32_t idm__getnode(const char *key, char **clusters, int32_t count, idm_clnode **node) {
    static constexpr const char kName[] = "idm__getnode";
    if (node == nullptr) return report_bad_internal_param(kInternal, kName, 4, hex(node));
    *node = nullptr;
    if (key == nullptr) return report_bad_internal_param(kInternal, kName, 1, hex(key));
    if (count < 0 || (count > 0 && clusters == nullptr))
        return report_bad_internal_param(kInternal, kName, 3, hex(static_cast<uintptr_t>(static_cast<intptr_t>(count))));
    return idm::clmap::new_record(key, count, [clusters](int32_t i) {
        return clusters[i] != nullptr ? std::string_view(clusters[i]) : std::string_view();
    }, node);
}

void idm__free_arrays(char **array, int32_t count) {
    if (array == nullptr) return;
    for (int32_t i = 0; i < count; ++i) {
        std::free(array[i]);
        array[i] = nullptr;
    }
}

int idm__rtree_compare_routine(const void *probe, const void *stored) { return idm::clmap::compare_keys(probe, stored); }

// The record, its key, its array and its names are one block.
void idm__rtree_cleanup_routine(void *item) { std::free(item); }

__attribute__((visibility("default"))) void sec__idm_clmap_init(void) {
    static constexpr trace::ApiIds kIds{tp::kClmapInitEntry, tp::kClmapInitEntry, tp::kClmapInitExit, tp::kClmapInitExit};
    const trace::Api api(kIds);
    sec__lock_init(&idmutex);
    idm::clmap::store_lastmod(0);
    sec__lock_write(&idmutex);
    sec__rst_init(&nametree, idm__rtree_compare_routine, idm__rtree_cleanup_routine);
    sec__rst_init(&iptree, idm__rtree_compare_routine, idm__rtree_cleanup_routine);
    sec__unlock_write(&idmutex);
    api.leave(0);
}

__attribute__((visibility("default"))) int32_t sec_is_in_any_cluster(const char *host) {
    trace::Api api(idm::clmap::kAnyIds, trace::text(host, idm::clmap::kNullHost));
    pthread_once(&idm__init_once_block, idm__state_init);
    int32_t answer = -1;
    {
        MapHold hold(&idmutex);
        char **clusters = nullptr;
        int32_t count = 0;
        if (sec__get_cluster_names(hold, host, &clusters, &count) == 0)
            answer = count != 0 && clusters != nullptr ? 1 : 0;
    }
    return api.leave(answer);
}

__attribute__((visibility("default"))) int32_t sec_is_in_active_cluster(const char *host) {
    trace::Api api(idm::clmap::kActiveIds, trace::text(host, idm::clmap::kNullHost));
    pthread_once(&idm__init_once_block, idm__state_init);
    int32_t answer = -1;
    {
        MapHold hold(&idmutex);
        cu_cluster_info_t info{};
        if (cu_get_cluster_info_1(&info) == 0) {
            info.cluster_name[sizeof info.cluster_name - 1] = '\0';
            char **clusters = nullptr;
            int32_t count = 0;
            if (sec__get_cluster_names(hold, host, &clusters, &count) == 0) {
                answer = 0;
                for (int32_t i = 0; i < count; ++i)
                    if (clusters[i] != nullptr && std::strcmp(clusters[i], info.cluster_name) == 0) {
                        answer = 1;
                        break;
                    }
            }
        }
    }
    return api.leave(answer);
}

}  // extern "C"
