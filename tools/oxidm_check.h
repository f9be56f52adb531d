// The checkers of `oxidm check`: map files and the node information file,
// judged line by line exactly as libox_idm judges them.  The judging itself
// is the library's own (idm::mapfile::judge_line, idm::clmap::parse); this
// module walks the text the way the library's readers do and adds what an
// administrator wants to know besides: warnings.
//
// Built into the private shared object liboxidm-check, which carries its
// own hidden copy of the library's internals: the command keeps talking to
// the shipped libox_idm for every answer, and nothing here touches the
// library's state (no trees, no reports, no trace).
#ifndef OXIDM_TOOL_CHECK_H
#define OXIDM_TOOL_CHECK_H

#include <cstddef>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace oxidm_tool::check {

enum class Severity { kError, kWarning, kNote };
const char *severity_name(Severity s);

struct Finding {
    size_t line;  // from 1; 0 for the file as a whole
    Severity severity;
    std::string code;     // short stable tag, e.g. "invalid-rule"
    std::string message;  // one sentence
};

// ---- map files ----

enum class EntryKind { kAffirmative, kDenial };

// An entry the library would make from a line.
struct MapEntry {
    size_t line;
    std::string mechanism;
    EntryKind kind;
    std::string network_id;
    std::string local_id;  // empty for a denial
};

// Splits a network identifier into the fields the mechanism's translator
// would match one by one (registry type, registry, tokens...), each holding
// at most the one wildcard the library honours.  Returns false when it
// cannot tell (then the identifier is compared as one text).
using FieldSplitter = std::function<bool(const MapEntry &entry, std::vector<std::string> &fields)>;

struct MapfileReport {
    std::vector<Finding> findings;
    std::vector<MapEntry> entries;  // in file order, every mechanism (or only --mech)
    size_t lines = 0;               // lines of the file (a final line without LF counts)
    size_t pieces = 0;              // reads of at most 1023 characters
    size_t errors() const;
    size_t warnings() const;
};

// Judges map file text.  With `mechanism`, only that mechanism's lines
// are entries and lines of other mechanisms are noted as ignored; without
// it, every line is judged for the mechanism its selector names.
// `is_uid0(name)` tells whether a local user has uid 0 (may be empty);
// `known` lists the mechanisms in use, so that a selector that differs from
// one only in case or blanks is pointed out (may be null).
MapfileReport check_mapfile_text(std::string_view text, const std::string *mechanism,
                                 const std::function<bool(const std::string &)> &is_uid0 = {},
                                 const FieldSplitter &split = {}, const std::vector<std::string> *known = nullptr);

// Adds to `out` a finding for every entry of `later` that an entry before
// it shadows: an entry of `earlier` (a file the library reads first, named
// `earlier_file` in the messages) or an earlier entry of `later` itself.
// check_mapfile_text runs it with no earlier file.
void shadowing(const std::vector<MapEntry> &earlier, const std::string &earlier_file,
               const std::vector<MapEntry> &later, const FieldSplitter &split, std::vector<Finding> &out);

// ---- node information file ----

struct NodeHost {
    std::string key;  // as written
    bool address;     // true: ADDRESS value (iptree), false: NAME value (nametree)
    std::vector<std::string> clusters;
    size_t line;      // line of the value
};

struct NodeinfoReport {
    std::vector<Finding> findings;
    bool loads = true;               // the library would load the text (no error)
    size_t first_error_line = 0;     // line of the library's own verdict, or 0
    std::vector<NodeHost> hosts;     // what the trees would hold (first record wins), when loads
    size_t records = 0;
    size_t lines = 0;
    size_t errors() const;
    size_t warnings() const;
};

// Judges node information text as the loader would after appending an LF.
// The library stops at the first error; the checker then resumes at the
// next NODE statement to find further errors, and says so.
NodeinfoReport check_nodeinfo_text(std::string_view text);

// ---- shared ----

// The library's wildcard match of one field: only the first '*' of
// `pattern` is a wildcard and may stand for no characters.
bool wildcard_match(std::string_view pattern, std::string_view text);
// True when every text that `inner` matches is matched by `outer` (both
// fields with at most one '*').
bool field_covers(std::string_view outer, std::string_view inner);

}  // namespace oxidm_tool::check

#endif
