// The checkers of `oxidm check` and `oxidm install`.  The verdicts are the
// library's own: its line judge, the mechanism's translator followed by the
// library's rule check, its one-wildcard matcher, its node file parser and
// memory bound; this module walks the text as the library's readers do and
// adds warnings.  Built into liboxidm-check with a hidden copy of the
// library's internals (tools/CMakeLists.txt); nothing here touches the
// library's state, and the rule check reports through libox_cu.
#ifndef OXIDM_TOOL_CHECKER_H
#define OXIDM_TOOL_CHECKER_H

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "oxidm.h"

namespace oxidm_tool::check {

enum class Severity { kError, kWarning, kNote };
// A library message on one line: runs of blanks and line feeds become one space.
std::string one_line(const char *text);
const char *severity_name(Severity s);

struct Finding {
    size_t line;  // from 1; 0 for the file as a whole
    Severity severity;
    std::string code;     // short stable tag, e.g. "invalid-rule"
    std::string message;  // one sentence
};

// A mechanism's routines, as registered with the library.
struct Translator {
    idm_translator_routine translate;
    idm_cleanup_routine cleanup;
};

enum class EntryKind { kAffirmative, kDenial };

// An entry the library would make from a line, and what the mechanism's
// translator and the library's rule check made of it.
struct MapEntry {
    size_t line = 0;
    std::string mechanism;
    EntryKind kind = EntryKind::kAffirmative;
    std::string network_id;
    std::string local_id;  // empty for a denial
    bool usable = false;   // the translator filled a rule the library accepts
    std::string rgy_type = {}, rgy = {};
    std::vector<std::string> tokens = {};
    int32_t name_token = 0;  // 1-based token that supplies the local name of a "*" mapping, else 0
};

// An account the system keeps below UID_MIN (root among them).
struct Account {
    std::string name;
    uint32_t uid;
};

struct MapContext {
    const std::string *mechanism = nullptr;  // judge only this mechanism's lines
    // The translator of a mechanism, or null when it is not known (its lines
    // are then parsed only).
    const Translator *(*translator_for)(const std::string &mnemonic) = nullptr;
    const std::vector<std::string> *known = nullptr;  // mnemonics, for near misses
    std::vector<Account> privileged;                  // accounts below UID_MIN
    uint32_t uid_min = 1000;
    // Entries of the files the library reads before this one, and the name
    // of that file in messages.
    const std::vector<MapEntry> *earlier = nullptr;
    std::string earlier_file;
};

struct MapfileReport {
    std::vector<Finding> findings;
    std::vector<MapEntry> entries;         // in file order
    std::vector<std::string> parsed_only;  // mechanisms whose lines were parsed only
    size_t lines = 0;                      // lines of the file (a final line without LF counts)
};

MapfileReport check_mapfile_text(std::string_view text, const MapContext &ctx);

struct NodeHost {
    std::string key;  // as written
    bool address;     // true: ADDRESS value (iptree), false: NAME value (nametree)
    std::vector<std::string> clusters;
    size_t line;  // line of the value
};

struct NodeinfoReport {
    std::vector<Finding> findings;
    bool loads = true;            // the library would load the text (no error)
    size_t first_error_line = 0;  // line of the library's own verdict, or 0
    std::vector<NodeHost> hosts;  // what the trees would hold (first record wins), when loads
    size_t records = 0;
    size_t lines = 0;
};

// Judges node information text as the loader would after appending an LF.
// The library stops at the first error; the checker then resumes at the
// next NODE statement to find further errors, and says so.
NodeinfoReport check_nodeinfo_text(std::string_view text);

}  // namespace oxidm_tool::check

#endif
