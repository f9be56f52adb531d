// The one-wildcard matcher: idm::wildcard_match, idm__native_match_token,
// idm__native_match_rgy and the right-anchored idm__strncmpr.
//
// Input: the pattern, an LF, the text (each up to its first NUL); the
// first byte of the input also gives a count for idm__strncmpr.
//
// Properties beyond "no crash":
//   - the matchers agree with a reference written here from the pattern
//     forms: only the first '*' is a wildcard and stands for any run of
//     characters, so P = F '*' S matches T exactly when T begins with F,
//     ends with S and is at least as long as F and S together; without '*'
//     only the equal text matches;
//   - idm__native_match_token returns 4 for an empty argument (rule token
//     first), 38 with 2650-666 naming both tokens on a mismatch, 0 on a
//     match; idm__native_match_rgy 38 with 2650-667 or 0;
//   - idm__strncmpr returns what the cursor walk of its definition returns,
//     for every count.
#include <cstring>
#include <string>

#include "fuzz_common.h"
#include "oxidm_state.h"
#include "oxidm_natmap.h"

namespace {

bool reference_match(const std::string &p, const std::string &t) {
    size_t star = p.find('*');
    if (star == std::string::npos) return p == t;
    std::string_view f(p.data(), star), s(p.data() + star + 1, p.size() - star - 1);
    return t.size() >= f.size() + s.size() && t.compare(0, f.size(), f) == 0 &&
           t.compare(t.size() - s.size(), s.size(), s) == 0;
}

// The cursor walk: both texts non-empty.
int32_t reference_strncmpr(const std::string &s1, const std::string &s2, uint32_t n) {
    if (static_cast<int32_t>(n) <= 0) return 0;
    size_t a = s1.size(), b = s2.size();
    for (uint32_t compared = 1;; ++compared) {
        --a;
        --b;
        const int c1 = static_cast<unsigned char>(s1[a]), c2 = static_cast<unsigned char>(s2[b]);
        if (c1 != c2) return c1 - c2;
        if (a == 0 && b == 0) return 0;
        if (compared == n) return 0;
        if (a == 0 || b == 0) return static_cast<int32_t>(s1.size()) - static_cast<int32_t>(s2.size());
    }
}

void check_reported(int msgno, const std::string &first, const std::string &second) {
    FUZZ_CHECK(cux_error_msgno() == msgno, first);
    FUZZ_CHECK(cux_error_insert_count() == 2, first);
    FUZZ_CHECK(first == cux_error_insert(1) && second == cux_error_insert(2), first);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    fuzz::Split in = fuzz::split_first_line(data, size);
    const std::string pattern = fuzz::c_text(in.head);
    const std::string text = fuzz::c_text(in.rest);

    const bool expected = reference_match(pattern, text);
    FUZZ_CHECK(idm::wildcard_match(pattern.c_str(), text.c_str()) == expected, pattern + "|" + text);

    const int32_t token = idm__native_match_token(pattern.c_str(), text.c_str());
    if (pattern.empty() || text.empty()) {
        FUZZ_CHECK(token == 4, pattern + "|" + text);
        FUZZ_CHECK(cux_error_msgno() == idm::kMsg650, pattern);
        FUZZ_CHECK(std::strcmp(cux_error_insert(2), pattern.empty() ? "1" : "2") == 0, pattern + "|" + text);
    } else if (expected) {
        FUZZ_CHECK(token == 0, pattern + "|" + text);
    } else {
        FUZZ_CHECK(token == 38, pattern + "|" + text);
        check_reported(idm::kMsg666, pattern, text);
    }

    if (!pattern.empty() && !text.empty()) {
        const int32_t rgy = idm__native_match_rgy(pattern.c_str(), text.c_str());
        FUZZ_CHECK(rgy == (expected ? 0 : 38), pattern + "|" + text);
        if (!expected) check_reported(idm::kMsg667, pattern, text);

        const uint32_t counts[] = {static_cast<uint32_t>(pattern.size()), static_cast<uint32_t>(text.size()),
                                   size > 0 ? static_cast<uint32_t>(data[0] % 24) : 0u, 0x80000000u, 1u};
        for (uint32_t n : counts) {
            FUZZ_CHECK(idm__strncmpr(pattern.c_str(), text.c_str(), n) == reference_strncmpr(pattern, text, n),
                       pattern + "|" + text + "|" + std::to_string(n));
            FUZZ_CHECK(idm__strncmpr(text.c_str(), pattern.c_str(), n) == reference_strncmpr(text, pattern, n),
                       text + "|" + pattern + "|" + std::to_string(n));
        }
    } else {
        // Texts the callers never pass: no crash, no read before them.
        (void)idm__strncmpr(pattern.c_str(), text.c_str(), 5);
        (void)idm__strncmpr(text.c_str(), pattern.c_str(), 5);
    }
    return 0;
}
