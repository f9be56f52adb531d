// Rules against ids: the one-wildcard matcher, the rule check and the rule
// application swept against the reference model (reference.h), and the
// reports of a failed application in the order the checks run.
#include <sys/mman.h>

#include <cstring>
#include <set>
#include <string>
#include <vector>

#include "../support/reference.h"
#include "harness.h"
#include "oxidm_state.h"
#include "oxidm_natmap.h"

namespace {

using oxtest::reported;
using Strs = std::vector<std::string>;
using Texts = std::vector<const char *>;
char *mut(const char *s) { return const_cast<char *>(s); }

// Every word of up to max_len characters of the alphabet, shortest first.
Strs words(const std::string &alphabet, size_t max_len) {
    Strs out{""};
    for (size_t i = 0; i < out.size(); ++i)
        for (char c : alphabet)
            if (out[i].size() < max_len) out.push_back(out[i] + c);
    return out;
}

struct Map { bool on; uint32_t length; const char *value; };

// A rule or id over texts that outlive it (count -9: the tokens listed).
struct Rule {
    Texts toks;
    idm_buffer map;
    idm_rule r;
    Rule(const char *type, const char *rgy, const Texts &tokens, Map m = {}, uint32_t state = 0, int count = -9)
        : toks(tokens), map{m.length, mut(m.value)},
          r{state, mut(type), mut(rgy), count == -9 ? int32_t(toks.size()) : count,
            toks.empty() ? nullptr : const_cast<char **>(toks.data()), m.on ? &map : nullptr} {}
    Rule(const Rule &) = delete;
};
struct Id {
    Texts toks;
    idm_id id;
    Id(const char *type, const char *rgy, const Texts &tokens, int count = -9)
        : toks(tokens), id{mut(type), mut(rgy), count == -9 ? int32_t(toks.size()) : count,
                           toks.empty() ? nullptr : const_cast<char **>(toks.data())} {}
    Id(const Id &) = delete;
};
// The word's characters as indices into `atom` ('0' the first).
Texts atoms(const std::string &word, const Texts &atom) {
    Texts out;
    for (char c : word) out.push_back(atom[c - '0']);
    return out;
}

// A text copied so that its NUL is the last byte before an inaccessible page.
class AtPageEnd {
  public:
    AtPageEnd() : base_(static_cast<char *>(mmap(nullptr, 2 * 4096, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0))) {
        mprotect(base_ + 4096, 4096, PROT_NONE);
    }
    ~AtPageEnd() { munmap(base_, 2 * 4096); }
    const char *put(const std::string &s) { return static_cast<char *>(std::memcpy(base_ + 4096 - s.size() - 1, s.c_str(), s.size() + 1)); }

  private:
    char *base_;
};

// The matcher and the two reporting routines against the model: a mismatch is
// a rule failure naming both texts; a missing registry matches nothing.  The
// matcher reads sixteen characters at a time: also behind a long common prefix
// and with both texts ending at a page's end.
TEST(NatmapRules, MatcherAgreesWithReference) {
    const Strs all = words("ab*", 4);
    AtPageEnd pattern_page, text_page;
    for (size_t i = 1; i < all.size(); ++i)
        for (size_t j = 1; j < all.size(); ++j) {
            const std::string &p = all[i], &t = all[j];
            const bool m = ref::match(p, t);
            ASSERT_EQ(idm::wildcard_match(p.c_str(), t.c_str()), m) << p << " " << t;
            for (const std::string prefix : {"abababab--", "abababababababab--"}) {
                const std::string long_p = prefix + p, long_t = prefix + t;
                const bool long_m = ref::match(long_p, long_t);
                ASSERT_EQ(idm::wildcard_match(long_p.c_str(), long_t.c_str()), long_m) << long_p << " " << long_t;
                ASSERT_EQ(idm::wildcard_match(pattern_page.put(long_p), text_page.put(long_t)), long_m);
                ASSERT_EQ(idm::wildcard_match(pattern_page.put(long_p), long_t.c_str()), long_m);
                ASSERT_EQ(idm::wildcard_match(long_p.c_str(), text_page.put(long_t)), long_m);
            }
            ASSERT_EQ(idm__native_match_token(p.c_str(), t.c_str()), m ? idm::kOk : idm::kRuleInvalid) << p << " " << t;
            ASSERT_TRUE(m || reported(idm::kRuleInvalid, idm::kMsg666, {p, t}));
            oxtest::clear_errors();
            ASSERT_EQ(idm__native_match_rgy(p.c_str(), t.c_str()), m ? idm::kOk : idm::kRuleInvalid) << p << " " << t;
            ASSERT_TRUE(m ? oxtest::nothing_reported() : reported(idm::kRuleInvalid, idm::kMsg667, {p, t}));
        }
    EXPECT_EQ(idm__native_match_rgy(nullptr, "x"), idm::kRuleInvalid);
    EXPECT_EQ(idm__native_match_rgy("*", nullptr), idm::kRuleInvalid);
    EXPECT_TRUE(reported(idm::kRuleInvalid, idm::kMsg667, {"*", ""}));
}

// Every combination of a few registry types, registries, token lists, mappings
// and initial state words: the check leaves the model's status and state word
// and reports 2650-662 once for every refusal, nothing else; each rule it finds
// valid is applied to a range of ids exactly as the model applies it.
TEST(NatmapRules, CheckAndApplyAgreeWithReference) {
    const char *types[] = {nullptr, "", "m"}, *rgys[] = {nullptr, "", "r", "*", "r*", "a*b*"};
    const Map maps[] = {{false, 0, nullptr}, {true, 2, "g"}, {true, 5, "g"},  {true, 0, "g"},  {true, 1, ""},
                        {true, 1, nullptr},  {true, 2, "*"}, {true, 3, "g*"}, {true, 3, "**"}};
    const uint32_t states[] = {0, 0x30000, 1, 0x20001, 2, 4, 32};
    const Strs token_words = words("012345", 2), id_words = words("0123", 2);
    size_t bad = 0, applied = 0;
    for (size_t k = 0, i; k < 3 * 6 * 9 * 7 * token_words.size(); ++k) {
        auto pick = [&i](const auto &v) -> const auto & { return v[std::exchange(i, i / std::size(v)) % std::size(v)]; };
        i = k;
        const char *type = pick(types), *rgy = pick(rgys);
        const Map &m = pick(maps);
        const uint32_t state = pick(states);
        Rule x(type, rgy, atoms(pick(token_words), {"a", "*", "a*", "**", "", nullptr}), m, state);
        const ref::Checked want = ref::check_rule(x.r);
        oxtest::clear_errors();
        const int32_t status = idm__native_check_rule(&x.r);
        const bool reports_ok = status == 0 ? oxtest::reports_since_clear() == 0
                                            : oxtest::reports_since_clear() == 1 && reported(idm::kRuleInvalid, idm::kMsg662, {});
        if ((status != want.status || x.r.rule_state != want.state || !reports_ok) && ++bad <= 5)
            ADD_FAILURE() << "rule " << k << ": " << status << ", state " << x.r.rule_state;
        for (size_t w = 1; status == 0 && (state & 0xFFFFu) == 0 && w < 6 * id_words.size(); ++w) {
            Id y(w % 2 ? "m" : "M", (w / 2) % 3 == 0 ? "r" : (w / 2) % 3 == 1 ? "ra" : "x",
                 atoms(id_words[w / 6], {"a", "b", "ab", ""}));
            const ref::Applied a = ref::apply(x.r, y.id);
            idm_buffer result{77, mut("untouched")};
            const int32_t s = idm__native_apply_rule(&x.r, &y.id, &result);
            const bool ok = s != 0 ? result.length == 77 && result.value[0] == 'u'
                                   : result.length == a.length && (a.length ? a.name == result.value : !result.value);
            if ((s != a.status || !ok) && ++bad <= 5) ADD_FAILURE() << "rule " << k << ", id " << w << ": " << s;
            if (s == 0) idm__release_buffer(&result);
            ++applied;
        }
    }
    EXPECT_TRUE(bad == 0 && applied > 10000) << bad << " failures, " << applied << " applications";
}

// A failed application is one report, of the first check that fails; the
// result is left alone.
TEST(NatmapRules, FailedApplicationReportsTheFirstFailingCheck) {
    const std::string long_a(300, 'a'), long_b(300, 'b');  // together past the error record's inline texts
    struct Case { Rule rule; Id id; int msgno; Strs inserts; } cases[] = {
        {{"m", "r", {"**"}}, {nullptr, "r", {}}, idm::kMsg662, {}},  // the rule first
        {{"m", "r", {"a"}}, {nullptr, "r", {"a"}}, idm::kMsg665, {}},
        {{"m", "r", {"a"}}, {"m", "", {"a"}}, idm::kMsg665, {}},
        {{"m", "r", {"a"}}, {"m", "r", {"a"}, 0}, idm::kMsg665, {}},
        {{"m", "r", {"a"}}, {"m", "r", {}, 1}, idm::kMsg665, {}},
        {{"m", "r", {"a", "b"}}, {"x", "r", {"a"}}, idm::kMsg664, {"2", "1"}},          // counts before types
        {{"m", "r", {"a"}}, {"M", "x", {"a"}}, idm::kMsg663, {}},                       // types before registries
        {{"mech", "r", {"a"}}, {"mecx", "r", {"a"}}, idm::kMsg663, {}},                 // the whole type counts
        {{"mech", "r", {"a"}}, {"mechs", "r", {"a"}}, idm::kMsg663, {}},
        {{"m", "r*m", {"x"}}, {"m", "rmx", {"a"}}, idm::kMsg667, {"r*m", "rmx"}},       // registry before tokens
        {{"m", "r", {"a", "b*", "c"}}, {"m", "r", {"a", "x", "y"}}, idm::kMsg666, {"b*", "x"}},
        {{"m", "r", {long_a.c_str()}}, {"m", "r", {long_b.c_str()}}, idm::kMsg666, {long_a, long_b}},
        {{"m", "r", {"a", "b"}}, {"m", "r", {"a", ""}}, idm::kMsg650, {}},  // the empty token, 2nd
    };
    for (Case &c : cases) {
        oxtest::clear_errors();
        idm_buffer result{77, mut("untouched")};
        const int32_t status = c.msgno == idm::kMsg650 ? idm::kBadParameter : idm::kRuleInvalid;
        EXPECT_EQ(idm__native_apply_rule(&c.rule.r, &c.id.id, &result), status) << c.msgno;
        EXPECT_TRUE(c.msgno == idm::kMsg650 ? testing::AssertionResult(oxtest::last_error().inserts.at(1) == "2")
                                            : reported(status, c.msgno, c.inserts));
        EXPECT_EQ(oxtest::reports_since_clear() * 100 + result.length, 177u) << "one report, result untouched";
    }
    // A match leaves the local identity in the mapping result record (tp::kApplyResult).
    oxtest::set_trace_levels(0, 0, 2, 0, 0);
    Rule r("m", "*", {"a", "*"}, {true, 2, "*"});
    Id id("m", "r", {"a", "joe"});
    idm_buffer result{};
    ASSERT_EQ(idm__native_apply_rule(&r.r, &id.id, &result), idm::kOk);
    EXPECT_EQ(oxtest::trace_records().back().text(0), "joe");
    idm__release_buffer(&result);
    // The matched record shows each side's tokens on one line, cut at 252 characters.
    const std::string x250(250, 'x'), x300(300, 'x');
    const struct { Texts tokens; std::string line; } lines[] = {
        {{"a", "bc"}, "a bc "}, {{x300.c_str(), "b"}, std::string(252, 'x') + "..."}, {{x250.c_str(), "b", "c"}, x250 + " b..."}};
    oxtest::set_trace_levels(0, 0, 1, 0, 0);
    for (const auto &l : lines) {
        Rule rule("m", "r", l.tokens, {true, 2, "g"});
        Id matched("m", "r", l.tokens);
        ASSERT_EQ(idm__native_apply_rule(&rule.r, &matched.id, &result), idm::kOk);
        EXPECT_EQ(oxtest::trace_records().back().text(3), l.line);
        EXPECT_EQ(oxtest::trace_records().back().text(7), l.line);
        idm__release_buffer(&result);
    }
}

// With the API trace on, the application of a valid rule to a complete id
// still runs both checks, whose entry points the trace records.
TEST(NatmapRules, ApplicationTracesItsChecksWhenTheApiTraceIsOn) {
    Rule rule("t", "r", {"a"}, {}, IDM_RULE_VALID);
    Id id("t", "r", {"b"});
    idm_buffer local{};
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    EXPECT_EQ(idm__native_apply_rule(&rule.r, &id.id, &local), idm::kRuleInvalid);
    std::set<int> ids;
    for (const oxtest::TraceRecord &r : oxtest::trace_records()) ids.insert(r.id);
    oxtest::reset_trace();
    EXPECT_EQ(ids.count(idm::tp::kCheckRuleEntry) + ids.count(idm::tp::kCheckIdEntry), 2u);
}

}  // namespace
