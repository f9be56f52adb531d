// The mechanisms the command can ask about: the sample plug-ins of mpm/,
// each with its translator and cleanup routine as it registers them.
#ifndef OXIDM_TOOL_PLUGINS_H
#define OXIDM_TOOL_PLUGINS_H

#include <string>
#include <vector>

#include "oxidm.h"

namespace oxidm_tool {

struct Mechanism {
    std::string mnemonic;
    std::string summary;  // one line: what its identities look like
    idm_translator_routine translator;
    idm_cleanup_routine cleanup;
};

const std::vector<Mechanism> &mechanisms();
// Null when the command does not know the mnemonic.
const Mechanism *find_mechanism(const std::string &mnemonic);

// Splits an entry's network identifier into the fields the library matches
// (registry type, registry, tokens), by asking the mechanism's translator
// for the rule.  False when the mechanism is unknown or refuses the entry.
bool rule_fields(const std::string &mnemonic, const std::string &network_id, bool denial,
                 std::vector<std::string> &fields);

}  // namespace oxidm_tool

#endif
