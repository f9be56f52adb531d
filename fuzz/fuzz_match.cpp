// The one-wildcard matcher: idm::wildcard_match (and the right-anchored
// idm__strncmpr under it), idm__native_match_token, idm__native_match_rgy.
//
// Input: the pattern, an LF, the text (each up to its first NUL).
//
// Properties beyond "no crash": every routine agrees with the reference model
// (tests/support/reference.h); a mismatch reports 2650-666 (token) or 2650-667
// (registry) naming the pattern and the text; an empty token is refused as a
// bad parameter (2650-650) naming its position, the rule token's first.
#include <string>

#include "../tests/support/reference.h"
#include "fuzz_common.h"
#include "oxidm_state.h"
#include "oxidm_natmap.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    fuzz::Split in = fuzz::split_first_line(data, size);
    const std::string p = fuzz::c_text(in.head), t = fuzz::c_text(in.rest), both = p + "|" + t;
    const bool expected = ref::match(p, t);
    FUZZ_CHECK(idm::wildcard_match(p.c_str(), t.c_str()) == expected, both);

    const int32_t token = idm__native_match_token(p.c_str(), t.c_str());
    if (p.empty() || t.empty()) {
        FUZZ_CHECK(token == idm::kBadParameter && cux_error_msgno() == idm::kMsg650, both);
        FUZZ_CHECK(std::string(cux_error_insert(2)) == (p.empty() ? "1" : "2"), both);
        return 0;  // texts the callers never pass
    }
    const int32_t rgy = idm__native_match_rgy(p.c_str(), t.c_str());
    FUZZ_CHECK(token == (expected ? idm::kOk : idm::kRuleInvalid) && rgy == token, both);
    if (!expected)
        FUZZ_CHECK(cux_error_msgno() == idm::kMsg667 && cux_error_insert_count() == 2 && p == cux_error_insert(1) &&
                       t == cux_error_insert(2), both);
    return 0;
}
