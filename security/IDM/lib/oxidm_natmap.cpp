// Rule matching and the rule cache.
//
// Owns no state of its own.  The routines read the rules and ids that a
// mechanism's translator filled and write only the rule's state word; the
// rule cache they extend and release is a field of the translator record,
// guarded by that record's mutex, which idm__native_map_identity holds around
// every call made here.  Nothing here allocates except the result copy of a
// match and the growth of the cache.
#include "oxidm_natmap.h"

#include <emmintrin.h>

#include <algorithm>

#include "oxidm_diag.h"
#include "oxidm_holds.h"
#include "oxidm_state.h"

using namespace idm;

namespace {

constexpr uint32_t kLowHalf = 0xFFFFu;
constexpr uint32_t kPositionUnit = 0x10000u;  // the high half counts token positions
constexpr uint32_t kMaxPosition = 0xFFFFu;
constexpr size_t kCacheStep = 10;              // slots added at each growth
constexpr char kTraceNull[] = "[null]";
constexpr size_t kLineBuffer = 256;             // a trace token line with its NUL
constexpr size_t kLineCut = 252;                // characters before the "..."

inline bool nonempty(const char *s) { return s != nullptr && *s != '\0'; }
inline const char *or_null(const char *s) { return nonempty(s) ? s : kTraceNull; }

// Exact comparison of two short texts (registry types): cheaper inline than
// a library call for the few bytes they hold.
inline bool same_text(const char *a, const char *b) {
    if (a == b) return true;  // a plug-in's rules and ids share its mnemonic
    while (*a == *b) {
        if (*a == '\0') return true;
        ++a;
        ++b;
    }
    return false;
}

// Number of '*' in s, stopping at 2: only "none", "one" and "more" matter.
inline int stars(const char *s) {
    int n = 0;
    for (; *s != '\0' && n < 2; ++s) n += *s == IDM_WILDCARD;
    return n;
}

// The trace token line: the tokens in order, each followed by one space,
// cut at 252 characters and then ended with "...".
void token_line(char (&line)[kLineBuffer], int32_t count, char *const *tokens) {
    std::memset(line, 0, sizeof line);
    size_t len = 0;
    for (int32_t i = 0; i < count; ++i) {
        if (len == kLineCut) {
            std::memcpy(line + len, "...", 3);
            return;
        }
        const char *t = or_null(tokens != nullptr ? tokens[i] : nullptr);
        size_t n = std::min(std::strlen(t), kLineCut - len);
        std::memcpy(line + len, t, n);
        len += n;
        if (len < kLineCut) line[len++] = ' ';
    }
    if (len == kLineCut) std::memcpy(line + len, "...", 3);
}

}  // namespace

namespace idm {

// Sixteen characters at a time (SSE2, which every x86-64 processor has).
// Sixteen bytes of a text are read at once only where they cannot cross
// into the next page, so reading past a text's NUL touches nothing its own
// page does not hold; the sanitizers would take those bytes for a read of
// someone else's memory, hence no sanitizer checks in the routine that reads
// them.
namespace {

inline bool block_readable(const char *p) { return (reinterpret_cast<uintptr_t>(p) & 4095) <= 4096 - 16; }

// Advances p and t past their common literal prefix, to the first place
// where they differ or the pattern holds a NUL or a '*'.
__attribute__((no_sanitize("address", "thread"))) inline void skip_literal_prefix(const char *&p, const char *&t) {
    const __m128i nul = _mm_setzero_si128();
    const __m128i star = _mm_set1_epi8(IDM_WILDCARD);
    while (block_readable(p) && block_readable(t)) {
        const __m128i a = _mm_loadu_si128(reinterpret_cast<const __m128i *>(p));
        const __m128i b = _mm_loadu_si128(reinterpret_cast<const __m128i *>(t));
        const __m128i stop = _mm_or_si128(_mm_cmpeq_epi8(a, nul), _mm_cmpeq_epi8(a, star));
        const unsigned m = static_cast<unsigned>(_mm_movemask_epi8(stop)) | (~static_cast<unsigned>(_mm_movemask_epi8(_mm_cmpeq_epi8(a, b))) & 0xFFFFu);
        if (m != 0) {
            const int k = __builtin_ctz(m);
            p += k;
            t += k;
            return;
        }
        p += 16;
        t += 16;
    }
    while (*p != IDM_WILDCARD && *p != '\0' && *p == *t) {
        ++p;
        ++t;
    }
}

}  // namespace

// The walk compares two texts per entry: the matcher is inlined there.
[[gnu::always_inline]] inline bool match_wildcard(const char *pattern, const char *text) {
    // One pass over the literal prefix, sixteen characters at a time: most
    // comparisons are of equal texts (a realm) or end early (a token).
    const char *p = pattern;
    const char *t = text;
    skip_literal_prefix(p, t);
    if (*p != IDM_WILDCARD) return *p == '\0' && *t == '\0';  // no '*': equal texts only
    // The text begins with the prefix F before the first '*'.
    const char *suffix = p + 1;
    if (*suffix == '\0') return true;  // "*" or "F*"
    size_t suffix_len = std::strlen(suffix);
    if (p != pattern) {
        // F*S: the length test keeps F and S from overlapping inside the text.
        size_t prefix_len = static_cast<size_t>(p - pattern);
        if (prefix_len + 1 + suffix_len > std::strlen(text) + 1) return false;
    }
    return idm__strncmpr(suffix, text, static_cast<uint32_t>(suffix_len)) == 0;
}

bool wildcard_match(const char *pattern, const char *text) { return match_wildcard(pattern, text); }

}  // namespace idm

namespace {

// The bodies of idm__native_match_rgy and idm__native_match_token, inline in
// the walk's hot path.
inline int32_t match_rgy(const char *rule_rgy, const char *id_rgy) {
    // Both are non-empty after the checks; a null one simply does not match.
    if (rule_rgy == nullptr || id_rgy == nullptr || !match_wildcard(rule_rgy, id_rgy))
        return report(kRuleInvalid, kMsg667, rule_rgy != nullptr ? rule_rgy : "", id_rgy != nullptr ? id_rgy : "");
    return 0;
}

inline int32_t match_token(const char *rule_token, const char *id_token) {
    static constexpr const char kName[] = "idm__native_match_token";
    if (!nonempty(rule_token)) return report_bad_param(kName, 1, hex(rule_token));
    if (!nonempty(id_token)) return report_bad_param(kName, 2, hex(id_token));
    if (!match_wildcard(rule_token, id_token)) return report(kRuleInvalid, kMsg666, rule_token, id_token);
    return 0;
}

// What idm__native_check_rule and idm__native_check_id let pass without a
// report: a rule already found valid, an id with all its parts.
inline bool valid_rule(const idm_rule *rule) { return (rule->rule_state & kLowHalf) == IDM_RULE_VALID; }
inline bool complete_id(const idm_id *id) {
    return nonempty(id->rgy_type) && nonempty(id->rgy) && id->token_cnt > 0 && id->tokens != nullptr;
}

}  // namespace

extern "C" {

// ---------------------------------------------------------------------------
// Validation and matching
// ---------------------------------------------------------------------------

int32_t idm__strncmpr(const char *s1, const char *s2, uint32_t n) {
    if (static_cast<int32_t>(n) <= 0) return 0;
    size_t len1 = std::strlen(s1);
    size_t len2 = std::strlen(s2);
    // Callers never pass an empty text; comparing one anyway must not step
    // in front of it.
    if (len1 == 0 || len2 == 0) return static_cast<int32_t>(len1) - static_cast<int32_t>(len2);
    const unsigned char *a = reinterpret_cast<const unsigned char *>(s1) + len1;
    const unsigned char *b = reinterpret_cast<const unsigned char *>(s2) + len2;
    const unsigned char *first1 = reinterpret_cast<const unsigned char *>(s1);
    const unsigned char *first2 = reinterpret_cast<const unsigned char *>(s2);
    for (uint32_t compared = 1;; ++compared) {
        --a;
        --b;
        if (*a != *b) return static_cast<int32_t>(*a) - static_cast<int32_t>(*b);
        bool at_first1 = a == first1;
        bool at_first2 = b == first2;
        if (at_first1 && at_first2) return 0;
        if (compared == n) return 0;
        if (at_first1 || at_first2) return static_cast<int32_t>(len1) - static_cast<int32_t>(len2);
    }
}

int32_t idm__native_match_rgy(const char *rule_rgy, const char *id_rgy) { return match_rgy(rule_rgy, id_rgy); }

int32_t idm__native_match_token(const char *rule_token, const char *id_token) {
    return match_token(rule_token, id_token);
}

int32_t idm__native_check_rule(idm_rule *rule) {
    static constexpr trace::ApiIds kIds{tp::kCheckRuleEntry, tp::kCheckRuleEntryData, tp::kCheckRuleExit, tp::kCheckRuleExitData};
    const trace::Api api(kIds, trace::ptr(rule));
    if (api.entered_with_data()) idm__trace_native_rule(rule);

    if (valid_rule(rule)) return api.leave(0);
    uint32_t low = rule->rule_state & kLowHalf;
    if (low == IDM_RULE_UNCHECKED) {
        auto flag = [rule](uint32_t f) { rule->rule_state |= f; };
        if (!nonempty(rule->rgy_type) || !nonempty(rule->rgy)) flag(IDM_RULE_BAD_RGY);
        else if (stars(rule->rgy) > 1) flag(IDM_RULE_MULTI_WILDCARD);

        const idm_buffer *mapping = rule->mapping;
        if (mapping != nullptr && (mapping->length == 0 || !nonempty(mapping->value))) flag(IDM_RULE_BAD_MAPPING);

        // A negative count is as unusable as none: it would let a rule with a
        // literal mapping match without comparing a single token.
        if (rule->token_cnt <= 0 || rule->tokens == nullptr) {
            flag(IDM_RULE_BAD_TOKENS);
        } else {
            for (int32_t i = 0; i < rule->token_cnt; ++i) {
                const char *t = rule->tokens[i];
                if (!nonempty(t)) {
                    flag(IDM_RULE_BAD_TOKENS);
                    break;
                }
                if (stars(t) > 1) flag(IDM_RULE_MULTI_WILDCARD);
            }
        }

        if ((rule->rule_state & kLowHalf) == 0) {
            if (mapping == nullptr || rule->rule_state != 0) {
                rule->rule_state = IDM_RULE_VALID;
                return api.leave(0);
            }
            const char *value = mapping->value;
            if (std::strcmp(value, "*") == 0) {
                // Which token supplies the local name: the one full wildcard,
                // else the one partial wildcard, else the only token.
                uint32_t full = 0, partial = 0;
                int32_t full_at = 0, partial_at = 0;
                for (int32_t i = 1; i <= rule->token_cnt; ++i) {
                    const char *t = rule->tokens[i - 1];
                    if (std::strcmp(t, "*") == 0) {
                        if (full++ == 0) full_at = i;
                    } else if (std::strchr(t, IDM_WILDCARD) != nullptr) {
                        if (partial++ == 0) partial_at = i;
                    }
                }
                int32_t at = 0;
                if (full == 1) at = full_at;
                else if (full == 0 && partial == 1) at = partial_at;
                else if (full == 0 && partial == 0 && rule->token_cnt == 1) at = 1;
                // A position the high half cannot hold names no single token.
                if (at == 0 || static_cast<uint32_t>(at) > kMaxPosition) {
                    rule->rule_state = IDM_RULE_AMBIGUOUS;
                } else {
                    rule->rule_state = static_cast<uint32_t>(at) * kPositionUnit + IDM_RULE_VALID;
                    return api.leave(0);
                }
            } else if (std::strchr(value, IDM_WILDCARD) != nullptr) {
                rule->rule_state = IDM_RULE_AMBIGUOUS;
            } else {
                rule->rule_state = IDM_RULE_VALID;
                return api.leave(0);
            }
        }
    }
    return api.leave(report(kRuleInvalid, kMsg662));
}

int32_t idm__native_check_id(idm_id *id) {
    static constexpr trace::ApiIds kIds{tp::kCheckIdEntry, tp::kCheckIdEntryData, tp::kCheckIdExit, tp::kCheckIdExitData};
    const trace::Api api(kIds, trace::ptr(id));
    if (api.entered_with_data()) idm__trace_native_id(id);
    int32_t status = 0;
    if (!complete_id(id)) status = report(kRuleInvalid, kMsg665);
    return api.leave(status);
}

// ---------------------------------------------------------------------------
// Application
// ---------------------------------------------------------------------------

int32_t idm__native_get_mapping(idm_rule *rule, idm_id *id, idm_buffer *result) {
    result->length = 0;
    result->value = nullptr;
    if (rule->mapping == nullptr) return 0;
    uint32_t k = rule->rule_state >> 16;
    const char *name;
    uint32_t length;
    if (k != 0) {
        // Only a rule checked against an id of the same token count gets
        // here; a position past the id's tokens is a count mismatch.
        if (id->tokens == nullptr || static_cast<int64_t>(k) > id->token_cnt)
            return report(kRuleInvalid, kMsg664, static_cast<int>(rule->token_cnt), static_cast<int>(id->token_cnt));
        name = id->tokens[k - 1];
        length = static_cast<uint32_t>(std::strlen(name) + 1);
    } else {
        name = rule->mapping->value;
        length = rule->mapping->length;
    }
    char *copy = xstrdup(name);
    if (copy == nullptr) return report_no_memory("idm__native_get_mapping", length);
    result->value = copy;
    result->length = length;
    return 0;
}

int32_t idm__native_apply_rule(idm_rule *rule, idm_id *id, idm_buffer *result) {
    static constexpr trace::ApiIds kIds{tp::kApplyEntry, tp::kApplyEntryData, tp::kApplyExit, tp::kApplyExitData};
    trace::Api api(kIds, trace::ptr(rule), trace::ptr(id), trace::ptr(result));

    // With the API trace off, a cached valid rule and a complete id pass the
    // two checks as their calls would, without the calls: the walk meets
    // them at nearly every entry.
    if (trace::level(trace::kApi) != 0 || !valid_rule(rule) || !complete_id(id)) {
        if (int32_t s = idm__native_check_rule(rule); s != 0) return api.leave(s);
        if (int32_t s = idm__native_check_id(id); s != 0) return api.leave(s);
    }
    if (rule->token_cnt != id->token_cnt)
        return api.leave(report(kRuleInvalid, kMsg664, static_cast<int>(rule->token_cnt), static_cast<int>(id->token_cnt)));
    if (!same_text(rule->rgy_type, id->rgy_type)) return api.leave(report(kRuleInvalid, kMsg663));
    if (int32_t s = match_rgy(rule->rgy, id->rgy); s != 0) return api.leave(s);
    for (int32_t i = 0; i < rule->token_cnt; ++i)
        if (int32_t s = match_token(rule->tokens[i], id->tokens[i]); s != 0) return api.leave(s);
    if (int32_t s = idm__native_get_mapping(rule, id, result); s != 0) return api.leave(s);

    unsigned char l = trace::level(trace::kMapping);
    if (l == 1 || l == 8) {
        char rule_line[kLineBuffer];
        char id_line[kLineBuffer];
        token_line(rule_line, rule->token_cnt, rule->tokens);
        token_line(id_line, id->token_cnt, id->tokens);
        trace::record_data(tp::kApplyMatched, trace::text(or_null(rule->rgy_type)), trace::text(or_null(rule->rgy)),
                           trace::i32(rule->token_cnt), trace::text(rule_line), trace::text(or_null(id->rgy_type)),
                           trace::text(or_null(id->rgy)), trace::i32(id->token_cnt), trace::text(id_line));
    }
    l = trace::level(trace::kMapping);
    if (l == 2 || l == 8) trace::record_data(tp::kApplyResult, trace::text(or_null(result->value)));
    return api.leave(0);
}

// ---------------------------------------------------------------------------
// Rule cache
// ---------------------------------------------------------------------------

int32_t idm__native_cache_rule(idm_translator *translator, idm_mapfile_entry *entry, idm_rule *rule) {
    int32_t n = translator->rule_count;
    if (static_cast<size_t>(n) % kCacheStep == 0) {
        size_t bytes = (static_cast<size_t>(n) + kCacheStep) * sizeof(idm_rule);
        void *grown = translator->rules != nullptr ? xrealloc(translator->rules, bytes) : xmalloc(bytes);
        if (grown == nullptr) return report_no_memory("idm__native_cache_rule", bytes);
        translator->rules = static_cast<idm_rule *>(grown);
        std::memset(translator->rules + n, 0, kCacheStep * sizeof(idm_rule));
    }
    std::memcpy(&translator->rules[n], rule, sizeof(idm_rule));
    translator->rule_count = n + 1;
    entry->rule_index = n + 1;
    return 0;
}

void idm__native_release_rule_list(idm_cleanup_routine cleanup, int32_t count, idm_rule *rules) {
    if (count < 1 || rules == nullptr) return;
    // Frees the array also when a thread is cancelled inside the MPM's
    // cleanup routine; the unwind must not call into the MPM again.
    struct FreeArray {
        idm_rule *p;
        ~FreeArray() { std::free(p); }
    } hold{rules};
    if (cleanup == nullptr) return;
    for (int32_t i = 0; i < count; ++i) (void)cleanup(&rules[i], nullptr);
}

void idm__release_buffer(idm_buffer *buffer) {
    if (buffer == nullptr || buffer->length == 0 || buffer->value == nullptr) return;
    free_secret(buffer->value);
    buffer->length = 0;
}

}  // extern "C"
