// One configuration file checked as the library reads it, with what needs
// the system besides: owner and mode of the file, of every directory above
// it and of symbolic link targets, the accounts below UID_MIN, the known
// mechanisms' translators.  Used by `check` and `install`.
#ifndef OXIDM_TOOL_CHECK_H
#define OXIDM_TOOL_CHECK_H

#include "checker.h"
#include "tool.h"

namespace oxidm_tool {

struct Checked {
    std::string path;
    bool map = true;
    check::MapfileReport map_report;
    check::NodeinfoReport node_report;
    std::vector<check::Finding> findings;  // all, in line order
    size_t count(check::Severity s) const;
};

// Checks the text of a map file (`mechanism`: only its lines; `earlier`:
// entries of a file the library reads first, named `earlier_file`).
Checked check_map_text(const std::string &path, const std::string &text, const std::string *mechanism,
                       const std::vector<check::MapEntry> *earlier = nullptr, const std::string &earlier_file = "");
Checked check_node_text(const std::string &path, const std::string &text);
// Owner and mode findings for `path` (`shown` names it in messages).
void permission_findings(const std::string &path, std::vector<check::Finding> &out);

Json checked_json(const Checked &c);
void checked_text(const Json &j);

}  // namespace oxidm_tool

#endif
