// The sample mechanisms of mpm/, linked into the command.
#include "oxidm_plugins.h"

#include <cstring>

#include "oxmpm_host.h"
#include "oxmpm_principal.h"

namespace oxidm_tool {

const std::vector<Mechanism> &mechanisms() {
    static const std::vector<Mechanism> kMechanisms = {
        {OXMPM_HOST_MNEMONIC, "user@host (host names without regard to case)", oxmpm_host_translate,
         oxmpm_host_cleanup},
        {OXMPM_PRINCIPAL_MNEMONIC, "name@REALM or name/instance@REALM", oxmpm_principal_translate,
         oxmpm_principal_cleanup},
    };
    return kMechanisms;
}

const Mechanism *find_mechanism(const std::string &mnemonic) {
    for (const Mechanism &m : mechanisms())
        if (m.mnemonic == mnemonic) return &m;
    return nullptr;
}

bool rule_fields(const std::string &mnemonic, const std::string &network_id, bool denial,
                 std::vector<std::string> &fields) {
    const Mechanism *m = find_mechanism(mnemonic);
    if (m == nullptr) return false;
    std::string nid = network_id, local = "x";
    idm_mapfile_entry entry{};
    entry.kind = denial ? IDM_ENTRY_DENIAL : IDM_ENTRY_AFFIRMATIVE;
    entry.network_id = nid.data();
    entry.local_id = denial ? nullptr : local.data();
    idm_rule rule{};
    idm_id id{};
    if (m->translator(&entry, nid.c_str(), &rule, &id) != 0) {
        m->cleanup(&rule, &id);
        return false;
    }
    bool ok = rule.rgy_type != nullptr && rule.rgy != nullptr && rule.token_cnt > 0 && rule.tokens != nullptr;
    if (ok) {
        fields.clear();
        fields.emplace_back(rule.rgy_type);
        fields.emplace_back(rule.rgy);
        for (int32_t i = 0; i < rule.token_cnt; ++i) fields.emplace_back(rule.tokens[i] ? rule.tokens[i] : "");
    }
    m->cleanup(&rule, &id);
    return ok;
}

}  // namespace oxidm_tool
