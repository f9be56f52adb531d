// Rule matching: validation of the rule and id structures that a
// mechanism's translator delivers, registry and token matching with one
// wildcard, the application of a rule to an id, and the per-translator rule
// cache.
//
// None of these routines takes a lock.  The rule cache and the cached rules'
// state words belong to one translator record and are used only while its
// mutex is held (idm__native_map_identity).  Everything a translator put into
// a rule or an id is read here, never freed or changed: only `rule_state` is
// written.
#ifndef OXIDM_NATMAP_H
#define OXIDM_NATMAP_H

#include <cstdint>

#include "oxidm.h"
#include "oxidm_state.h"

extern "C" {

// Validates `rule` once and records the verdict in its state word: check
// status in the low half, the 1-based position of the token that supplies the
// local name in the high half.  An already valid rule (low half 1) returns 0
// at once.  Returns 0, or 38 with 2650-662 (flags 4/8/16/32 or state 2 written
// as found; any other earlier state is left as it was).
int32_t idm__native_check_rule(idm_rule *rule);

// Returns 0, or 38 with 2650-665 when the id has no registry type, no
// registry or no tokens.  The tokens themselves are checked when matched.
int32_t idm__native_check_id(idm_id *id);

// Matches a rule registry (may hold one '*') against an id registry.
// Returns 0, or 38 with 2650-667 (rule registry, id registry).
int32_t idm__native_match_rgy(const char *rule_rgy, const char *id_rgy);

// Matches a rule token (may hold one '*') against an id token.  Returns 0;
// 4 with 2650-650 for a null or empty argument (position 1 or 2); 38 with
// 2650-666 (rule token, id token) on a mismatch.
int32_t idm__native_match_token(const char *rule_token, const char *id_token);

// Compares the last n characters of s1 and s2 (right-anchored); 0 when they
// agree, otherwise the difference of the first differing bytes, or the
// difference of the lengths when one text is exhausted first.  n <= 0 (as a
// signed value) compares nothing and gives 0.
int32_t idm__strncmpr(const char *s1, const char *s2, uint32_t n);

// Applies `rule` to `id`: check rule, check id, token count (2650-664),
// registry type (2650-663), registry, tokens, then the local name into
// `result`.  Returns 0 on a match (result set; empty for a rule that grants no
// local identity), else the first failing status (38, 4, 6); `result` is
// written only on a match.
int32_t idm__native_apply_rule(idm_rule *rule, idm_id *id, idm_buffer *result);

// Sets `result` to the local name of a matched rule: the whole id token named
// by the high half of the state word, or the mapping's own text with the
// translator's `length`.  Empty for a rule without mapping.  Returns 0, or 6
// with 2650-654 (result empty); 38 with 2650-664 if the position lies past
// the id's tokens, which idm__native_apply_rule never lets happen.  The
// caller frees result->value.
int32_t idm__native_get_mapping(idm_rule *rule, idm_id *id, idm_buffer *result);

// Appends a byte copy of `rule` to the translator's rule cache (grown by 10
// slots, new slots zeroed) and sets the entry's 1-based `rule_index`.  The
// cache owns the rule's contents from then on.  Returns 0, or 6 with 2650-654
// (cache unchanged).  Caller holds the translator's mutex.
int32_t idm__native_cache_rule(idm_translator *translator, idm_mapfile_entry *entry, idm_rule *rule) OXIDM_REQUIRES(translator->mutex);

// Calls `cleanup` (rule slot, null) for each of the `count` cached rules in
// order, then frees the array.  Nothing for count < 1 or a null list.
void idm__native_release_rule_list(idm_cleanup_routine cleanup, int32_t count, idm_rule *rules);

// Frees a result buffer's text (zeroed first) and sets its length to 0;
// harmless on a null or already released buffer.
void idm__release_buffer(idm_buffer *buffer);

}  // extern "C"

namespace idm {

// The one-wildcard match shared by registries and tokens: only the first '*'
// of `pattern` is a wildcard and may stand for no characters.
bool wildcard_match(const char *pattern, const char *text);

}  // namespace idm

#endif
