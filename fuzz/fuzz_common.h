// Pieces shared by the fuzz targets: splitting an input into its parts,
// switching the trace on for part of the inputs (so that the records built
// from hostile texts are exercised too), and a reference judge of one map
// file line written straight from the line format, independent of the
// library's own.
#ifndef OXIDM_FUZZ_COMMON_H
#define OXIDM_FUZZ_COMMON_H

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>

#include "ox_tr.h"

namespace fuzz {

// Stops the run with a message libFuzzer shows next to the crash input.
[[noreturn]] inline void fail(const char *what, std::string_view detail = {}) {
    std::fprintf(stderr, "property violated: %s [%.*s]\n", what, static_cast<int>(detail.size()), detail.data());
    std::abort();
}
#define FUZZ_CHECK(cond, detail)          \
    do {                                  \
        if (!(cond)) ::fuzz::fail(#cond, detail); \
    } while (0)

// The text before the first LF and the rest after it (the whole input is
// the head when it holds no LF).
struct Split {
    std::string_view head, rest;
};
inline Split split_first_line(const uint8_t *data, size_t size) {
    std::string_view all(reinterpret_cast<const char *>(data), size);
    size_t lf = all.find('\n');
    if (lf == std::string_view::npos) return {all, {}};
    return {all.substr(0, lf), all.substr(lf + 1)};
}

// A text as the C-string interfaces see it: up to its first NUL.
inline std::string c_text(std::string_view s) { return std::string(s.substr(0, s.find('\0'))); }

// Every trace category at level 8 for about one input in four (chosen by the
// input's size, so a given input always runs the same way), otherwise off.
// Records are formatted (their items copied) but not kept.
inline void trace_for(size_t size) {
    static const int once = (trx_keep(0), 0);
    (void)once;
    trx_set_all_levels("_SEI", size % 4 == 3 ? 8 : 0);
}

// ---- reference judge of one map file line ----

enum class Kind { kSkipped, kInvalid, kAffirmative, kDenial };
struct Verdict {
    Kind kind = Kind::kSkipped;
    std::string network, local;
    bool operator==(const Verdict &) const = default;
};

inline bool blank(char c) { return c == ' ' || c == '\t'; }

// One piece as read from a file (no NUL; at most one LF, at its end), for
// `mechanism`: the LF goes, the line is cut at its first '#', a blank line is
// skipped, so is a line whose text before its first colon (after leading
// blanks) is not exactly the mechanism; then the rule after the colon.
inline Verdict reference_judge(std::string_view mechanism, std::string_view piece) {
    Verdict skipped, invalid;
    invalid.kind = Kind::kInvalid;
    if (!piece.empty() && piece.back() == '\n') piece.remove_suffix(1);
    if (size_t hash = piece.find('#'); hash != std::string_view::npos) piece = piece.substr(0, hash);
    size_t i = 0;
    while (i < piece.size() && blank(piece[i])) ++i;
    if (i == piece.size()) return skipped;
    size_t colon = piece.find(':', i);
    if (colon == std::string_view::npos || piece.substr(i, colon - i) != mechanism) return skipped;

    std::string_view rule = piece.substr(colon + 1);
    size_t r = 0;
    while (r < rule.size() && blank(rule[r])) ++r;
    rule = rule.substr(r);
    if (rule.empty()) return invalid;
    auto ident_end = [&](size_t from, bool at_equals) {
        size_t e = from;
        while (e < rule.size() && !blank(rule[e]) && !(at_equals && rule[e] == '=')) ++e;
        return e;
    };
    Verdict v;
    if (rule[0] == '!') {
        if (rule.find('=') != std::string_view::npos) return invalid;
        size_t s = 1;
        while (s < rule.size() && blank(rule[s])) ++s;
        if (s == rule.size()) return invalid;
        v.kind = Kind::kDenial;
        v.network = std::string(rule.substr(s, ident_end(s, false) - s));
        return v;
    }
    size_t eq = rule.find('=');
    if (eq == std::string_view::npos || eq == 0 || eq + 1 == rule.size()) return invalid;
    size_t l = eq + 1;
    while (l < rule.size() && blank(rule[l])) ++l;
    if (l == rule.size()) return invalid;
    v.kind = Kind::kAffirmative;
    v.network = std::string(rule.substr(0, ident_end(0, true)));
    v.local = std::string(rule.substr(l, ident_end(l, false) - l));
    return v;
}

// What every accepted identifier must satisfy, whatever the input.
inline void check_identifiers(const Verdict &v) {
    auto clean = [](std::string_view id) {
        return !id.empty() && id.find_first_of(" \t#\n") == std::string_view::npos &&
               id.find('\0') == std::string_view::npos;
    };
    if (v.kind != Kind::kAffirmative && v.kind != Kind::kDenial) return;
    FUZZ_CHECK(clean(v.network), v.network);
    FUZZ_CHECK(v.network.find('=') == std::string::npos, v.network);
    if (v.kind == Kind::kAffirmative) FUZZ_CHECK(clean(v.local), v.local);
    else FUZZ_CHECK(v.local.empty(), v.local);
}

}  // namespace fuzz

#endif
