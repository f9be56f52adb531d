// Rules and ids shaped as a translator fills them, built from the input:
// idm__native_check_rule, then idm__native_apply_rule against an id.
//
// Input: eight fields, one a line (a missing one is "~"): the initial state
// word (decimal or 0x hex); the rule's registry type, registry, tokens and
// mapping; the id's registry type, registry and tokens.  "~" is a null text,
// no token array, no mapping.  Tokens are '|'-separated, a "<count>#" prefix
// sets token_cnt (never more than listed, at least -5).  A mapping is
// "<length> <text>" ("~" as length: the text's length + 1).
//
// Properties beyond "no crash": the status and the state word the check
// leaves are those of the reference model (tests/support/reference.h), 2650-662
// comes with every refusal, a second check changes nothing and nothing but the
// state word is written; a rule this check found valid is applied exactly as
// the model applies it, and a failed application leaves the result alone.
#include <algorithm>
#include <string>
#include <vector>

#include "../tests/support/reference.h"
#include "fuzz_common.h"
#include "oxidm_state.h"
#include "oxidm_natmap.h"

namespace {

char *text(std::string &s) { return s == "~" ? nullptr : s.data(); }

struct Tokens {
    std::vector<std::string> texts;
    std::vector<char *> ptrs;
    void fill(const std::string &field, char ***tokens, int32_t *count) {
        if (field == "~") return;
        char *end = nullptr;
        const long n = std::strtol(field.c_str(), &end, 10);
        const std::string list = *end == '#' ? std::string(end + 1) : field;
        for (size_t from = 0, bar = 0; bar != std::string::npos; from = bar + 1)
            texts.push_back(list.substr(from, (bar = list.find('|', from)) - from));
        for (std::string &t : texts) ptrs.push_back(text(t));
        *count = static_cast<int32_t>(*end == '#' ? std::max(-5L, std::min(n, long(texts.size()))) : long(texts.size()));
        *tokens = ptrs.data();
    }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    fuzz::trace_for(size);
    const std::string_view all(reinterpret_cast<const char *>(data), size);
    std::vector<std::string> f;
    for (size_t at = 0; at < all.size() && f.size() < 8; at = std::min(all.find('\n', at), all.size()) + 1)
        f.push_back(fuzz::c_text(all.substr(at, std::min(all.find('\n', at), all.size()) - at)));
    f.resize(8, "~");
    idm_rule rule{static_cast<uint32_t>(std::strtoul(f[0].c_str(), nullptr, 0)), text(f[1]), text(f[2]), 0, nullptr, nullptr};
    Tokens rule_tokens, id_tokens;
    rule_tokens.fill(f[3], &rule.tokens, &rule.token_cnt);
    const size_t space = f[4].find(' ');
    std::string length = f[4].substr(0, space), value = space == std::string::npos ? "~" : f[4].substr(space + 1);
    idm_buffer mapping{0, text(value)};
    if (f[4] != "~") {
        mapping.length = length != "~" ? static_cast<uint32_t>(std::strtoul(length.c_str(), nullptr, 0))
                         : mapping.value != nullptr ? static_cast<uint32_t>(value.size() + 1) : 0;
        rule.mapping = &mapping;
    }

    const idm_rule before = rule;
    const ref::Checked want = ref::check_rule(rule);
    const int32_t status = idm__native_check_rule(&rule);
    FUZZ_CHECK(status == want.status && rule.rule_state == want.state, std::to_string(rule.rule_state));
    FUZZ_CHECK(status == 0 || cux_error_msgno() == idm::kMsg662, "no 2650-662");
    FUZZ_CHECK(before.rgy_type == rule.rgy_type && before.rgy == rule.rgy && before.token_cnt == rule.token_cnt &&
                   before.tokens == rule.tokens && before.mapping == rule.mapping, "the check wrote more than the state");
    FUZZ_CHECK(idm__native_check_rule(&rule) == status && rule.rule_state == want.state, "second check differs");
    // Translators hand rules over with state 0: only a rule this check found
    // valid is applied.
    if (status != 0 || (before.rule_state & 0xFFFFu) != 0) return 0;

    idm_id id{text(f[5]), text(f[6]), 0, nullptr};
    id_tokens.fill(f[7], &id.tokens, &id.token_cnt);
    const ref::Applied applied = ref::apply(rule, id);
    char untouched[] = "untouched";
    idm_buffer result{7, untouched};
    FUZZ_CHECK(idm__native_apply_rule(&rule, &id, &result) == applied.status, std::to_string(applied.status));
    if (applied.status != 0) {
        FUZZ_CHECK(result.length == 7 && result.value == untouched, "result written on no match");
        return 0;
    }
    FUZZ_CHECK(result.length == applied.length, std::to_string(result.length));
    FUZZ_CHECK(applied.length == 0 ? result.value == nullptr : applied.name == result.value, applied.name);
    idm__release_buffer(&result);
    return 0;
}
