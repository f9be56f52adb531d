// Rules and ids shaped as a translator fills them, built from the input:
// idm__native_check_rule, then idm__native_apply_rule against an id.
//
// Input: lines "<field> <value>", any order, later lines win:
//   S <state word>            rule_state at the start (decimal or 0x hex)
//   T <text> / R <text>       the rule's registry type / registry
//   K <tok>|<tok>|...         the rule's tokens ("K" alone: no token array)
//   N <count>                 token_cnt (default: the tokens listed; never
//                             more than listed: the count is the
//                             translator's promise; may be 0 or negative)
//   M <length> <text>         the mapping buffer ("~" as length: the text's
//                             length + 1)
//   t, r, k, n                the same for the id
// A text "~" stands for a null pointer; a missing T, R, t, r is null, a
// missing M no mapping.  Texts end at their line's LF or first NUL.
//
// Properties beyond "no crash":
//   - check_rule's result and the state word it leaves are exactly those of
//     a reference check written here from the rule's definition: a valid
//     rule (low half 1) returns 0 untouched, a low half other than 0 or 1
//     returns 38 untouched, otherwise the flags 4/8/16/32 as found, or 2 for
//     an unresolvable "*" mapping, or 1 with the position of the token that
//     supplies the local name; 0 exactly when the low half ends as 1;
//   - checking again returns the same and changes nothing;
//   - for a rule this check found valid, apply_rule matches exactly when
//     the reference check of the id, the token count, the registry type,
//     the registry and every token (one wildcard each) say so, and then
//     yields the whole id token named by the state word or the mapping's
//     text with the translator's length; on no match the result buffer is
//     untouched.
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "fuzz_common.h"
#include "oxidm_state.h"
#include "oxidm_natmap.h"

namespace {

// The fields of one input, and the texts and arrays behind them (owned
// here, as a translator owns what it puts into a rule).
struct Side {
    std::string rgy_type = "~", rgy = "~";
    bool has_tokens = false;
    std::vector<std::string> tokens;
    bool has_count = false;
    long count = 0;
    std::vector<char *> token_ptrs;

    void fill_tokens(char ***tokens_out, int32_t *count_out) {
        token_ptrs.clear();
        for (std::string &t : tokens) token_ptrs.push_back(t == "~" ? nullptr : t.data());
        token_ptrs.push_back(nullptr);
        long n = has_count ? count : static_cast<long>(tokens.size());
        if (n > static_cast<long>(tokens.size())) n = static_cast<long>(tokens.size());
        if (n < -5) n = -5;
        *count_out = static_cast<int32_t>(n);
        *tokens_out = has_tokens ? token_ptrs.data() : nullptr;
    }
};
char *text_or_null(std::string &s) { return s == "~" ? nullptr : s.data(); }

struct Input {
    uint32_t state = 0;
    Side rule, id;
    bool has_mapping = false;
    std::string mapping_length, mapping_value;
};

std::vector<std::string> split_tokens(std::string_view v) {
    std::vector<std::string> out;
    size_t at = 0;
    for (;;) {
        size_t bar = v.find('|', at);
        out.emplace_back(v.substr(at, bar == std::string_view::npos ? std::string_view::npos : bar - at));
        if (bar == std::string_view::npos) return out;
        at = bar + 1;
    }
}

Input read_input(std::string_view all) {
    Input in;
    size_t at = 0;
    while (at < all.size()) {
        size_t lf = all.find('\n', at);
        std::string_view line = all.substr(at, lf == std::string_view::npos ? std::string_view::npos : lf - at);
        at = lf == std::string_view::npos ? all.size() : lf + 1;
        if (line.empty()) continue;
        const char field = line[0];
        const bool bare = line.size() == 1;
        std::string value = fuzz::c_text(line.size() > 1 ? line.substr(2) : std::string_view{});
        Side &side = (field >= 'a' && field <= 'z') ? in.id : in.rule;
        switch (field) {
        case 'S': in.state = static_cast<uint32_t>(std::strtoul(value.c_str(), nullptr, 0)); break;
        case 'T': case 't': side.rgy_type = value; break;
        case 'R': case 'r': side.rgy = value; break;
        case 'K': case 'k':
            side.has_tokens = !bare;
            side.tokens = bare ? std::vector<std::string>{} : split_tokens(value);
            break;
        case 'N': case 'n':
            side.has_count = true;
            side.count = std::strtol(value.c_str(), nullptr, 10);
            break;
        case 'M': {
            in.has_mapping = true;
            size_t space = value.find(' ');
            in.mapping_length = value.substr(0, space);
            in.mapping_value = space == std::string::npos ? std::string("~") : value.substr(space + 1);
            break;
        }
        default: break;
        }
    }
    return in;
}

bool nonempty(const char *s) { return s != nullptr && *s != '\0'; }
int stars(const char *s) {
    int n = 0;
    for (; *s != '\0'; ++s) n += *s == '*';
    return n;
}

// The reference check: {status, state word afterwards}.
struct Checked {
    int32_t status;
    uint32_t state;
};
Checked reference_check(const idm_rule &r) {
    const uint32_t low = r.rule_state & 0xFFFFu;
    if (low == 1) return {0, r.rule_state};
    if (low != 0) return {38, r.rule_state};
    uint32_t s = r.rule_state;
    if (!nonempty(r.rgy_type) || !nonempty(r.rgy)) s |= 8;
    else if (stars(r.rgy) > 1) s |= 32;
    if (r.mapping != nullptr && (r.mapping->length == 0 || !nonempty(r.mapping->value))) s |= 16;
    if (r.token_cnt <= 0 || r.tokens == nullptr) {
        s |= 4;
    } else {
        for (int32_t i = 0; i < r.token_cnt; ++i) {
            if (!nonempty(r.tokens[i])) {
                s |= 4;
                break;
            }
            if (stars(r.tokens[i]) > 1) s |= 32;
        }
    }
    if ((s & 0xFFFFu) != 0) return {38, s};
    if (r.mapping == nullptr || s != 0) return {0, 1};
    const char *value = r.mapping->value;
    if (std::strcmp(value, "*") != 0) return std::strchr(value, '*') != nullptr ? Checked{38, 2} : Checked{0, 1};
    int full = 0, partial = 0, full_at = 0, partial_at = 0;
    for (int32_t i = 1; i <= r.token_cnt; ++i) {
        const char *t = r.tokens[i - 1];
        if (std::strcmp(t, "*") == 0) {
            if (full++ == 0) full_at = i;
        } else if (std::strchr(t, '*') != nullptr) {
            if (partial++ == 0) partial_at = i;
        }
    }
    int at = 0;
    if (full == 1) at = full_at;
    else if (full == 0 && partial == 1) at = partial_at;
    else if (full == 0 && partial == 0 && r.token_cnt == 1) at = 1;
    if (at == 0) return {38, 2};
    return {0, static_cast<uint32_t>(at) * 65536u + 1u};
}

bool wildcard(const std::string &p, const std::string &t) {
    size_t star = p.find('*');
    if (star == std::string::npos) return p == t;
    std::string_view f(p.data(), star), s(p.data() + star + 1, p.size() - star - 1);
    return t.size() >= f.size() + s.size() && t.compare(0, f.size(), f) == 0 &&
           t.compare(t.size() - s.size(), s.size(), s) == 0;
}

// The reference application of a rule that checked valid: {status, name,
// length} (name empty and length 0 for a rule without mapping).
struct Applied {
    int32_t status;
    std::string name;
    uint32_t length;
};
Applied reference_apply(const idm_rule &r, const idm_id &id) {
    if (!nonempty(id.rgy_type) || !nonempty(id.rgy) || id.token_cnt <= 0 || id.tokens == nullptr) return {38, {}, 0};
    if (r.token_cnt != id.token_cnt) return {38, {}, 0};
    if (std::strcmp(r.rgy_type, id.rgy_type) != 0) return {38, {}, 0};
    if (!wildcard(r.rgy, id.rgy)) return {38, {}, 0};
    for (int32_t i = 0; i < r.token_cnt; ++i) {
        if (!nonempty(id.tokens[i])) return {4, {}, 0};
        if (!wildcard(r.tokens[i], id.tokens[i])) return {38, {}, 0};
    }
    if (r.mapping == nullptr) return {0, {}, 0};
    const uint32_t k = r.rule_state >> 16;
    if (k != 0) return {0, id.tokens[k - 1], static_cast<uint32_t>(std::strlen(id.tokens[k - 1]) + 1)};
    return {0, r.mapping->value, r.mapping->length};
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    fuzz::trace_for(size);
    Input in = read_input(std::string_view(reinterpret_cast<const char *>(data), size));

    idm_rule rule{};
    rule.rule_state = in.state;
    rule.rgy_type = text_or_null(in.rule.rgy_type);
    rule.rgy = text_or_null(in.rule.rgy);
    in.rule.fill_tokens(&rule.tokens, &rule.token_cnt);
    idm_buffer mapping{};
    if (in.has_mapping) {
        mapping.value = text_or_null(in.mapping_value);
        if (in.mapping_length == "~")
            mapping.length = mapping.value != nullptr ? static_cast<uint32_t>(std::strlen(mapping.value) + 1) : 0;
        else
            mapping.length = static_cast<uint32_t>(std::strtoul(in.mapping_length.c_str(), nullptr, 0));
        rule.mapping = &mapping;
    }

    const idm_rule before = rule;
    const Checked expected = reference_check(rule);
    const int32_t status = idm__native_check_rule(&rule);
    FUZZ_CHECK(status == expected.status, std::to_string(status));
    FUZZ_CHECK(rule.rule_state == expected.state, std::to_string(rule.rule_state));
    FUZZ_CHECK((status == 0) == ((rule.rule_state & 0xFFFFu) == 1u), std::to_string(rule.rule_state));
    FUZZ_CHECK(before.rgy_type == rule.rgy_type && before.rgy == rule.rgy && before.token_cnt == rule.token_cnt &&
                   before.tokens == rule.tokens && before.mapping == rule.mapping,
               "check_rule changed more than the state word");
    if (status != 0) FUZZ_CHECK(cux_error_msgno() == idm::kMsg662, "no 2650-662");

    const uint32_t state = rule.rule_state;
    FUZZ_CHECK(idm__native_check_rule(&rule) == status && rule.rule_state == state, "second check differs");
    // Only a rule that this check found valid goes on to be applied: the
    // state word belongs to the library, and a rule that arrives marked
    // valid has not been examined (translators hand rules over as 0).
    if (status != 0 || (before.rule_state & 0xFFFFu) != 0) return 0;

    idm_id id{};
    id.rgy_type = text_or_null(in.id.rgy_type);
    id.rgy = text_or_null(in.id.rgy);
    in.id.fill_tokens(&id.tokens, &id.token_cnt);

    const Applied want = reference_apply(rule, id);
    char untouched_text[] = "untouched";
    idm_buffer result{7, untouched_text};
    const idm_buffer untouched = result;
    const int32_t applied = idm__native_apply_rule(&rule, &id, &result);
    FUZZ_CHECK(applied == want.status, std::to_string(applied));
    if (applied != 0) {
        FUZZ_CHECK(result.length == untouched.length && result.value == untouched.value, "result written on no match");
        return 0;
    }
    FUZZ_CHECK(result.length == want.length, std::to_string(result.length));
    if (want.length == 0) {
        FUZZ_CHECK(result.value == nullptr, "value for a rule without mapping");
    } else {
        FUZZ_CHECK(result.value != nullptr && want.name == result.value, want.name);
        idm__release_buffer(&result);
    }
    return 0;
}
