// A naive model of rule matching, written from what a rule means and not from
// how the library walks it; the unit tests sweep the library against it and
// the fuzz targets fuzz_match and fuzz_check_rule compare every input with it.
// (idm__strncmpr is not modelled: the matcher is its only caller.)
#ifndef OXIDM_TEST_REFERENCE_H
#define OXIDM_TEST_REFERENCE_H

#include <cstdint>
#include <cstring>
#include <string>

#include "oxidm.h"

namespace ref {

// Only the first '*' of a pattern is a wildcard and stands for any run of
// characters, also none: F*S matches the texts that split into F, a run and S.
inline bool match(const std::string &p, const std::string &t) {
    size_t star = p.find('*');
    if (star == std::string::npos) return p == t;
    std::string f = p.substr(0, star), s = p.substr(star + 1);
    for (size_t run = 0; f.size() + run + s.size() <= t.size(); ++run)
        if (t == f + t.substr(f.size(), run) + s) return true;
    return false;
}

inline bool set(const char *s) { return s != nullptr && *s != '\0'; }
inline int stars(const char *s) { int n = 0; while (*s) n += *s++ == '*'; return n; }

// The verdict of the rule check: status and the state word it leaves.
struct Checked { int32_t status; uint32_t state; };
inline Checked check_rule(const idm_rule &r) {
    const uint32_t low = r.rule_state & 0xFFFFu;
    if (low == 1) return {IDM_OK, r.rule_state};
    if (low != 0) return {IDM_E_RULE, r.rule_state};
    uint32_t s = r.rule_state;
    if (!set(r.rgy_type) || !set(r.rgy)) s |= IDM_RULE_BAD_RGY;
    else if (stars(r.rgy) > 1) s |= IDM_RULE_MULTI_WILDCARD;
    if (r.mapping != nullptr && (r.mapping->length == 0 || !set(r.mapping->value))) s |= IDM_RULE_BAD_MAPPING;
    bool tokens_ok = r.token_cnt > 0 && r.tokens != nullptr;
    for (int32_t i = 0; tokens_ok && i < r.token_cnt; ++i) {
        tokens_ok = set(r.tokens[i]);
        if (tokens_ok && stars(r.tokens[i]) > 1) s |= IDM_RULE_MULTI_WILDCARD;
    }
    if (!tokens_ok) s |= IDM_RULE_BAD_TOKENS;
    if ((s & 0xFFFFu) != 0) return {IDM_E_RULE, s};
    if (r.mapping == nullptr || s != 0) return {IDM_OK, 1};
    const std::string value = r.mapping->value;
    if (value != "*") return value.find('*') == std::string::npos ? Checked{IDM_OK, 1} : Checked{IDM_E_RULE, 2};
    // "*": the one full wildcard token, else the one partial, else the only token.
    int full = 0, partial = 0, full_at = 0, partial_at = 0;
    for (int32_t i = 1; i <= r.token_cnt; ++i) {
        const std::string t = r.tokens[i - 1];
        if (t == "*" && full++ == 0) full_at = i;
        if (t != "*" && t.find('*') != std::string::npos && partial++ == 0) partial_at = i;
    }
    int at = full == 1 ? full_at : full > 0 ? 0 : partial == 1 ? partial_at : partial == 0 && r.token_cnt == 1 ? 1 : 0;
    return at == 0 ? Checked{IDM_E_RULE, 2} : Checked{IDM_OK, static_cast<uint32_t>(at) * 65536u + 1u};
}

// The application of a rule that checked valid to an id: status, and on 0
// the local name and its length (empty, 0 for a rule without mapping).
struct Applied { int32_t status; std::string name; uint32_t length; };
inline Applied apply(const idm_rule &r, const idm_id &id) {
    if (!set(id.rgy_type) || !set(id.rgy) || id.token_cnt <= 0 || id.tokens == nullptr) return {IDM_E_RULE, {}, 0};
    if (r.token_cnt != id.token_cnt || std::strcmp(r.rgy_type, id.rgy_type) != 0) return {IDM_E_RULE, {}, 0};
    if (!match(r.rgy, id.rgy)) return {IDM_E_RULE, {}, 0};
    for (int32_t i = 0; i < r.token_cnt; ++i) {
        if (!set(id.tokens[i])) return {IDM_E_BAD_PARAMETER, {}, 0};
        if (!match(r.tokens[i], id.tokens[i])) return {IDM_E_RULE, {}, 0};
    }
    if (r.mapping == nullptr) return {IDM_OK, {}, 0};
    if (uint32_t k = r.rule_state >> 16; k != 0)
        return {IDM_OK, id.tokens[k - 1], static_cast<uint32_t>(std::strlen(id.tokens[k - 1]) + 1)};
    return {IDM_OK, r.mapping->value, r.mapping->length};
}

}  // namespace ref

#endif
