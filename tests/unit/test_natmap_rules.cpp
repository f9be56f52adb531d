// Rule and id validation, the one-wildcard matcher (against a naive
// reference over a small alphabet), rule application, the result copy, the
// rule cache and the trace records of a successful application.
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"
#include "oxidm_natmap.h"

namespace {

using oxtest::reported;

// A rule or id whose texts live in the test.  `null` marks a missing text.
struct Texts {
    std::vector<std::optional<std::string>> items;
    std::vector<char *> ptrs;
    explicit Texts(std::vector<std::optional<std::string>> v) : items(std::move(v)) {
        for (auto &s : items) ptrs.push_back(s ? s->data() : nullptr);
    }
};

struct RuleSpec {
    std::optional<std::string> rgy_type = "mech";
    std::optional<std::string> rgy = "realm";
    std::vector<std::optional<std::string>> tokens = {"joe"};
    std::optional<std::string> mapping;  // none: the rule grants no local identity
    std::optional<uint32_t> mapping_length;  // none: strlen + 1
    uint32_t state = 0;
    RuleSpec with_rgy_type(std::optional<std::string> v) { rgy_type = std::move(v); return *this; }
    RuleSpec with_rgy(std::optional<std::string> v) { rgy = std::move(v); return *this; }
    RuleSpec with_tokens(std::vector<std::optional<std::string>> v) { tokens = std::move(v); return *this; }
    RuleSpec with_mapping(std::optional<std::string> v) { mapping = std::move(v); return *this; }
    RuleSpec with_mapping_length(uint32_t v) { mapping_length = v; return *this; }
    RuleSpec with_state(uint32_t v) { state = v; return *this; }
};

struct TestRule {
    std::optional<std::string> rgy_type, rgy, mapping_text;
    Texts tokens;
    idm_buffer mapping{};
    idm_rule rule{};
    explicit TestRule(const RuleSpec &s)
        : rgy_type(s.rgy_type), rgy(s.rgy), mapping_text(s.mapping), tokens(s.tokens) {
        rule.rule_state = s.state;
        rule.rgy_type = rgy_type ? rgy_type->data() : nullptr;
        rule.rgy = rgy ? rgy->data() : nullptr;
        rule.token_cnt = static_cast<int32_t>(tokens.ptrs.size());
        rule.tokens = tokens.ptrs.empty() ? nullptr : tokens.ptrs.data();
        if (mapping_text) {
            mapping.value = mapping_text->data();
            mapping.length = s.mapping_length.value_or(static_cast<uint32_t>(mapping_text->size() + 1));
            rule.mapping = &mapping;
        }
    }
    TestRule(const TestRule &) = delete;
};

struct TestId {
    std::string rgy_type, rgy;
    Texts tokens;
    idm_id id{};
    TestId(std::string type, std::string r, std::vector<std::optional<std::string>> t)
        : rgy_type(std::move(type)), rgy(std::move(r)), tokens(std::move(t)) {
        id.rgy_type = rgy_type.data();
        id.rgy = rgy.data();
        id.token_cnt = static_cast<int32_t>(tokens.ptrs.size());
        id.tokens = tokens.ptrs.empty() ? nullptr : tokens.ptrs.data();
    }
    TestId(const TestId &) = delete;
};

class NatmapRules : public oxtest::Test {
  protected:
    void TearDown() override {
        idm_test_fail_alloc(0);
        oxtest::Test::TearDown();
    }
};

// ---- the one-wildcard matcher ----

TEST_F(NatmapRules, WildcardTable) {
    struct Case {
        const char *pattern, *text;
        bool match;
    } cases[] = {
        {"*", "anything", true},        {"*", "x", true},
        {"*AB", "xAB", true},           {"*AB", "AB", true},        {"*AB", "B", false},  {"*AB", "ABx", false},
        {"ab*", "ab", true},            {"ab*", "abc", true},       {"ab*", "a", false},  {"ab*", "xab", false},
        {"a*c", "ac", true},            {"a*c", "abc", true},       {"a*c", "c", false},  {"a*c", "ca", false},
        {"ab*ba", "aba", false},        {"ab*ba", "abba", true},    {"ab*ba", "abxba", true},
        {"ABC", "abc", false},          {"abc", "abc", true},       {"abc", "abcd", false},
        {"a*b*", "aXb*", true},         {"a*b*", "aXbY", false},  // only the first '*' is a wildcard
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(std::string(c.pattern) + " vs " + c.text);
        oxtest::clear_errors();
        int32_t token = idm__native_match_token(c.pattern, c.text);
        int32_t rgy = idm__native_match_rgy(c.pattern, c.text);
        EXPECT_EQ(token, c.match ? 0 : 38);
        EXPECT_EQ(rgy, c.match ? 0 : 38);
        if (c.match) {
            EXPECT_TRUE(oxtest::nothing_reported());
        } else {
            EXPECT_TRUE(reported(38, idm::kMsg667, {c.pattern, c.text}));
            EXPECT_EQ(oxtest::reports_since_clear(), 2u);
        }
    }
    EXPECT_EQ(idm__native_match_token("j*", "bob"), 38);
    EXPECT_TRUE(reported(38, idm::kMsg666, {"j*", "bob"}));
}

// Naive reference: the text splits into the pattern's prefix before its
// first '*', anything, and the rest of the pattern.
bool reference_match(const std::string &p, const std::string &t) {
    size_t star = p.find('*');
    if (star == std::string::npos) return p == t;
    std::string f = p.substr(0, star), s = p.substr(star + 1);
    for (size_t i = f.size(); i + s.size() <= t.size(); ++i)
        if (t.compare(0, f.size(), f) == 0 && t.compare(i, s.size(), s) == 0 && i + s.size() == t.size()) return true;
    return false;
}

void all_words(const std::string &alphabet, size_t max_len, std::vector<std::string> &out) {
    std::vector<std::string> layer{""};
    for (size_t len = 1; len <= max_len; ++len) {
        std::vector<std::string> next;
        for (const auto &w : layer)
            for (char c : alphabet) next.push_back(w + c);
        out.insert(out.end(), next.begin(), next.end());
        layer = std::move(next);
    }
}

TEST_F(NatmapRules, ExhaustiveSweepAgainstReference) {
    std::vector<std::string> patterns, texts;
    all_words("ab*", 5, patterns);
    all_words("ab*", 5, texts);
    size_t mismatches = 0;
    for (const auto &p : patterns)
        for (const auto &t : texts) {
            bool expected = reference_match(p, t);
            if (idm::wildcard_match(p.c_str(), t.c_str()) != expected && ++mismatches <= 10)
                ADD_FAILURE() << "pattern \"" << p << "\" text \"" << t << "\": expected " << expected;
        }
    EXPECT_EQ(mismatches, 0u);
    // The exported routines agree with the matcher (a sample, they report).
    for (size_t i = 0; i < patterns.size(); i += 7)
        for (size_t j = 0; j < texts.size(); j += 11) {
            bool expected = reference_match(patterns[i], texts[j]);
            ASSERT_EQ(idm__native_match_token(patterns[i].c_str(), texts[j].c_str()), expected ? 0 : 38);
            ASSERT_EQ(idm__native_match_rgy(patterns[i].c_str(), texts[j].c_str()), expected ? 0 : 38);
        }
}

// Reference of the right-anchored comparison, written from its outcomes.
int32_t reference_strncmpr(const std::string &a, const std::string &b, uint32_t n) {
    if (static_cast<int32_t>(n) <= 0) return 0;
    size_t k = std::min<size_t>({n, a.size(), b.size()});
    for (size_t i = 1; i <= k; ++i) {
        unsigned char x = a[a.size() - i], y = b[b.size() - i];
        if (x != y) return x - y;
    }
    if (k == n || a.size() == b.size()) return 0;
    return static_cast<int32_t>(a.size()) - static_cast<int32_t>(b.size());
}

TEST_F(NatmapRules, RightAnchoredComparison) {
    struct Case {
        const char *s1, *s2;
        uint32_t n;
        int32_t result;
    } cases[] = {
        {"abc", "xabc", 3, 0}, {"abc", "bc", 3, 1}, {"abc", "xbc", 3, 'a' - 'x'}, {"zzz", "abc", 0, 0},
        {"abc", "abc", 0x80000000u, 0},  // negative as a signed count
        {"bc", "abc", 5, -1},            {"abc", "abc", 9, 0}, {"\xff", "a", 1, 0xff - 'a'},
    };
    for (const Case &c : cases) EXPECT_EQ(idm__strncmpr(c.s1, c.s2, c.n), c.result) << c.s1 << " " << c.s2 << " " << c.n;

    std::vector<std::string> words;
    all_words("ab", 4, words);
    for (const auto &a : words)
        for (const auto &b : words)
            for (uint32_t n : {0u, 1u, 2u, 3u, 4u, 5u, 0xffffffffu})
                ASSERT_EQ(idm__strncmpr(a.c_str(), b.c_str(), n), reference_strncmpr(a, b, n))
                    << a << " " << b << " " << n;
}

TEST_F(NatmapRules, MatchTokenRejectsMissingTokensByPosition) {
    static char empty[] = "";
    struct Case {
        const char *label;
        const char *rule_token, *id_token;
        int position;
    } cases[] = {
        {"null rule token", nullptr, "joe", 1},
        {"empty rule token, empty id token", empty, empty, 1},
        {"null id token", "joe", nullptr, 2},
        {"empty id token", "*", empty, 2},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::clear_errors();
        EXPECT_EQ(idm__native_match_token(c.rule_token, c.id_token), 4);
        const void *bad = c.position == 1 ? c.rule_token : c.id_token;
        char hex[32];
        std::snprintf(hex, sizeof hex, "%x", static_cast<unsigned>(reinterpret_cast<uintptr_t>(bad)));
        EXPECT_TRUE(reported(4, idm::kMsg650, {"idm__native_match_token", std::to_string(c.position), hex}));
        EXPECT_EQ(oxtest::reports_since_clear(), 1u);
    }
}

// ---- the state word ----

TEST_F(NatmapRules, CheckRuleStateWord) {
    using T = std::vector<std::optional<std::string>>;
    struct Case {
        const char *label;
        RuleSpec spec;
        uint32_t state;  // afterwards
    } cases[] = {
        {"literal mapping", RuleSpec().with_mapping("guest"), 1},
        {"no mapping (denial)", {}, 1},
        {"mapping * with the only token literal", RuleSpec().with_tokens(T{"joe"}).with_mapping("*"), 65537},
        {"mapping * with two literal tokens", RuleSpec().with_tokens(T{"joe", "x"}).with_mapping("*"), 2},
        {"full then partial", RuleSpec().with_tokens(T{"*", "x*"}).with_mapping("*"), 65537},
        {"partial then full", RuleSpec().with_tokens(T{"x*", "*"}).with_mapping("*"), 131073},
        {"two full", RuleSpec().with_tokens(T{"*", "*"}).with_mapping("*"), 2},
        {"two partial", RuleSpec().with_tokens(T{"a*", "b*"}).with_mapping("*"), 2},
        {"one partial among literals", RuleSpec().with_tokens(T{"a", "b", "*c"}).with_mapping("*"), 3 * 65536 + 1},
        {"one full, two partial", RuleSpec().with_tokens(T{"a*", "*", "b*"}).with_mapping("*"), 131073},
        {"mapping admin*", RuleSpec().with_mapping("admin*"), 2},
        {"mapping **", RuleSpec().with_mapping("**"), 2},
        {"token **", RuleSpec().with_tokens(T{"**"}), 32},
        {"token a*b*", RuleSpec().with_tokens(T{"x", "a*b*"}), 32},
        {"rgy a*b*", RuleSpec().with_rgy("a*b*"), 32},
        {"rgy * alone is fine", RuleSpec().with_rgy("*").with_tokens(T{"*"}).with_mapping("*"), 65537},
        {"null rgy_type, empty second token", RuleSpec().with_rgy_type(std::nullopt).with_tokens(T{"a", ""}), 12},
        {"empty rgy", RuleSpec().with_rgy(""), 8},
        {"bad rgy does not look for wildcards in it", RuleSpec().with_rgy_type("").with_rgy("**"), 8},
        {"no tokens", RuleSpec().with_tokens(T{}), 4},
        {"null token stops the examination", RuleSpec().with_tokens(T{std::nullopt, "**"}), 4},
        {"multi wildcard before an empty token", RuleSpec().with_tokens(T{"**", ""}), 36},
        {"mapping length 0", RuleSpec().with_mapping("root").with_mapping_length(0), 16},
        {"empty mapping value", RuleSpec().with_mapping(""), 16},
        {"all flags", RuleSpec().with_rgy(std::nullopt).with_tokens(T{"**", std::nullopt}).with_mapping(""), 60},
        {"flags keep a translator's high half", RuleSpec().with_tokens(T{}).with_state(0x50000), 0x50004},
        {"translator's high half: no resolution", RuleSpec().with_mapping("*").with_state(0x30000), 1},
        {"already valid returns at once", RuleSpec().with_rgy(std::nullopt).with_state(0x20001), 0x20001},
        {"ambiguous stays", RuleSpec().with_mapping("guest").with_state(2), 2},
        {"earlier flags stay", RuleSpec().with_mapping("guest").with_state(4), 4},
        {"refused stays", RuleSpec().with_state(32), 32},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::clear_errors();
        TestRule r(c.spec);
        bool valid = (c.state & 0xffff) == 1;
        EXPECT_EQ(idm__native_check_rule(&r.rule), valid ? 0 : 38);
        EXPECT_EQ(r.rule.rule_state, c.state);
        if (valid) {
            EXPECT_TRUE(oxtest::nothing_reported());
        } else {
            EXPECT_TRUE(reported(38, idm::kMsg662, {}));
        }
        EXPECT_EQ(oxtest::reports_since_clear(), valid ? 0u : 1u);
    }
}

TEST_F(NatmapRules, ValidRuleIsNotExaminedAgain) {
    TestRule r(RuleSpec().with_tokens({"x*"}).with_mapping("*"));
    ASSERT_EQ(idm__native_check_rule(&r.rule), 0);
    ASSERT_EQ(r.rule.rule_state, 65537u);
    r.rule.rgy = nullptr;
    r.rule.token_cnt = 0;
    EXPECT_EQ(idm__native_check_rule(&r.rule), 0);
    EXPECT_EQ(r.rule.rule_state, 65537u);
}

TEST_F(NatmapRules, CheckId) {
    static char empty[] = "";
    struct Case {
        const char *label;
        bool null_type, empty_rgy, no_tokens, zero_count;
    } cases[] = {
        {"valid", false, false, false, false},      {"null rgy_type", true, false, false, false},
        {"empty rgy", false, true, false, false},   {"null tokens", false, false, true, false},
        {"zero count", false, false, false, true},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::clear_errors();
        TestId t("mech", "realm", {"joe", std::nullopt});  // tokens are not examined here
        if (c.null_type) t.id.rgy_type = nullptr;
        if (c.empty_rgy) t.id.rgy = empty;
        if (c.no_tokens) t.id.tokens = nullptr;
        if (c.zero_count) t.id.token_cnt = 0;
        bool valid = std::strcmp(c.label, "valid") == 0;
        EXPECT_EQ(idm__native_check_id(&t.id), valid ? 0 : 38);
        if (valid) {
            EXPECT_TRUE(oxtest::nothing_reported());
        } else {
            EXPECT_TRUE(reported(38, idm::kMsg665, {}));
        }
    }
}

// ---- application ----

TEST_F(NatmapRules, ApplyRule) {
    using T = std::vector<std::optional<std::string>>;
    struct Case {
        const char *label;
        RuleSpec rule;
        T id_tokens;
        const char *id_type, *id_rgy;
        int32_t status;
        int msgno;  // 0: nothing reported
        std::vector<std::string> inserts;
        const char *name;  // expected local name, or null for an empty result
        uint32_t length;
    } cases[] = {
        {"full wildcard everywhere", RuleSpec().with_rgy("*").with_tokens(T{"*"}).with_mapping("*"), T{"joe"}, "mech", "any", 0, 0, {}, "joe", 4},
        {"partial wildcard yields the whole token", RuleSpec().with_tokens(T{"j*"}).with_mapping("*"), T{"joe"}, "mech", "realm", 0, 0, {}, "joe", 4},
        {"literal mapping with the translator's length", RuleSpec().with_mapping("guest").with_mapping_length(6), T{"joe"}, "mech", "realm", 0, 0, {}, "guest", 6},
        {"translator's own length is kept", RuleSpec().with_mapping("guest").with_mapping_length(3), T{"joe"}, "mech", "realm", 0, 0, {}, "guest", 3},
        {"instance supplies the name", RuleSpec().with_tokens(T{"joe", "*"}).with_mapping("*"), T{"joe", "adm"}, "mech", "realm", 0, 0, {}, "adm", 4},
        {"no mapping matches with an empty result", {}, T{"joe"}, "mech", "realm", 0, 0, {}, nullptr, 0},
        {"invalid rule", RuleSpec().with_tokens(T{"**"}), T{"joe"}, "mech", "realm", 38, idm::kMsg662, {}, nullptr, 0},
        {"invalid id", {}, T{}, "mech", "realm", 38, idm::kMsg665, {}, nullptr, 0},
        {"token counts before registry types", RuleSpec().with_tokens(T{"a", "b"}), T{"a"}, "other", "x", 38, idm::kMsg664, {"2", "1"}, nullptr, 0},
        {"registry types before registries", {}, T{"joe"}, "Mech", "x", 38, idm::kMsg663, {}, nullptr, 0},
        {"registry before tokens", RuleSpec().with_rgy("r*m").with_tokens(T{"x"}), T{"joe"}, "mech", "rmx", 38, idm::kMsg667, {"r*m", "rmx"}, nullptr, 0},
        {"first mismatching token", RuleSpec().with_tokens(T{"a", "b*", "c"}), T{"a", "x", "y"}, "mech", "realm", 38, idm::kMsg666, {"b*", "x"}, nullptr, 0},
        {"empty id token", RuleSpec().with_tokens(T{"a", "b"}), T{"a", ""}, "mech", "realm", 4, idm::kMsg650, {}, nullptr, 0},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::clear_errors();
        TestRule r(c.rule);
        TestId id(c.id_type, c.id_rgy, c.id_tokens);
        static char untouched[] = "untouched";
        idm_buffer result{77, untouched};
        int32_t status = idm__native_apply_rule(&r.rule, &id.id, &result);
        EXPECT_EQ(status, c.status);
        if (c.msgno == idm::kMsg650) {
            EXPECT_EQ(oxtest::last_error().msgno, idm::kMsg650);
            EXPECT_EQ(oxtest::last_error().inserts.at(1), "2");
        } else if (c.msgno != 0) {
            EXPECT_TRUE(reported(c.status, c.msgno, c.inserts));
        } else {
            EXPECT_TRUE(oxtest::nothing_reported());
        }
        EXPECT_EQ(oxtest::reports_since_clear(), c.msgno != 0 ? 1u : 0u) << "exactly one report";
        if (status != 0) {
            EXPECT_EQ(result.length, 77u) << "a failed application leaves the result alone";
            EXPECT_EQ(result.value, untouched);
        } else if (c.name == nullptr) {
            EXPECT_EQ(result.length, 0u);
            EXPECT_EQ(result.value, nullptr);
        } else {
            EXPECT_STREQ(result.value, c.name);
            EXPECT_EQ(result.length, c.length);
            idm__release_buffer(&result);
        }
    }
}

TEST_F(NatmapRules, ResultCopyOutOfMemory) {
    TestRule r(RuleSpec().with_mapping("guest").with_mapping_length(6));
    TestId id("mech", "realm", {"joe"});
    idm_buffer result{};
    idm_test_fail_alloc(1);
    EXPECT_EQ(idm__native_apply_rule(&r.rule, &id.id, &result), 6);
    EXPECT_TRUE(reported(6, idm::kMsg654, {"idm__native_get_mapping", "6"}));
    EXPECT_EQ(result.length, 0u);
    EXPECT_EQ(result.value, nullptr);
    EXPECT_EQ(r.rule.rule_state, 1u) << "the rule stays valid";
    idm_test_fail_alloc(0);
    EXPECT_EQ(idm__native_apply_rule(&r.rule, &id.id, &result), 0);
    EXPECT_STREQ(result.value, "guest");
    idm__release_buffer(&result);
}

TEST_F(NatmapRules, ReleaseBufferZeroesAndIsHarmlessTwice) {
    static std::vector<size_t> zeroed;
    zeroed.clear();
    idm_test_on_secret_free([](const void *, size_t n) { zeroed.push_back(n); });
    idm_buffer b{5, idm::xstrdup("root")};
    idm__release_buffer(&b);
    EXPECT_EQ(b.length, 0u);
    idm__release_buffer(&b);
    idm__release_buffer(nullptr);
    idm_buffer empty{0, nullptr};
    idm__release_buffer(&empty);
    idm_test_on_secret_free(nullptr);
    EXPECT_EQ(zeroed, std::vector<size_t>{5});
}

// ---- the rule cache ----

std::vector<std::string> g_cleanups;
int32_t recording_cleanup(idm_rule *rule, idm_id *id) {
    g_cleanups.push_back(std::string(rule != nullptr ? rule->rgy : "-") + (id != nullptr ? " id" : ""));
    return 0;
}

TEST_F(NatmapRules, CacheGrowsByTenSlots) {
    idm_translator t{};
    std::vector<idm_mapfile_entry> entries(21);
    std::vector<std::string> names;
    for (int i = 0; i < 21; ++i) names.push_back("r" + std::to_string(i + 1));
    auto cache = [&](int i) {
        idm_rule rule{};
        rule.rule_state = static_cast<uint32_t>(i);
        rule.rgy = names[i].data();
        return idm__native_cache_rule(&t, &entries[i], &rule);
    };
    struct Step {
        int index;               // 0-based entry whose rule is cached
        long fail;               // allocation that fails first (0: none)
        const char *attempted;   // 2650-654 insert
    } failures[] = {{0, 1, "480"}, {10, 1, "960"}, {20, 1, "1440"}};
    int next = 0;
    for (const Step &s : failures) {
        for (; next < s.index; ++next) ASSERT_EQ(cache(next), 0);
        idm_rule *before = t.rules;
        idm_test_fail_alloc(s.fail);
        EXPECT_EQ(cache(next), 6);
        EXPECT_TRUE(reported(6, idm::kMsg654, {"idm__native_cache_rule", s.attempted}));
        EXPECT_EQ(t.rule_count, s.index) << "cache unchanged";
        EXPECT_EQ(t.rules, before);
        EXPECT_EQ(entries[next].rule_index, 0);
        idm_test_fail_alloc(0);
        ASSERT_EQ(cache(next), 0);
        EXPECT_EQ(entries[next].rule_index, s.index + 1);
        // The slots after the new one are zero.
        for (int j = s.index + 1; j < s.index + 10; ++j) EXPECT_EQ(t.rules[j].rgy, nullptr);
        ++next;
    }
    EXPECT_EQ(t.rule_count, 21);
    EXPECT_EQ(t.rules[10].rule_state, 10u);
    EXPECT_STREQ(t.rules[20].rgy, "r21");

    g_cleanups.clear();
    idm__native_release_rule_list(recording_cleanup, t.rule_count, t.rules);
    EXPECT_EQ(g_cleanups.size(), 21u);
    EXPECT_EQ(g_cleanups.back(), "r21");
}

TEST_F(NatmapRules, ReleaseRuleList) {
    idm_translator t{};
    idm_mapfile_entry entries[3]{};
    std::string names[3] = {"a", "b", "c"};
    for (int i = 0; i < 3; ++i) {
        idm_rule rule{};
        rule.rgy = names[i].data();
        ASSERT_EQ(idm__native_cache_rule(&t, &entries[i], &rule), 0);
    }
    g_cleanups.clear();
    idm__native_release_rule_list(recording_cleanup, 0, t.rules);
    idm__native_release_rule_list(recording_cleanup, 3, nullptr);
    EXPECT_TRUE(g_cleanups.empty());
    idm__native_release_rule_list(recording_cleanup, 3, t.rules);  // frees the array (ASan checks)
    EXPECT_EQ(g_cleanups, (std::vector<std::string>{"a", "b", "c"}));
}

// ---- trace records ----

TEST_F(NatmapRules, MappingTraceRecords) {
    // 60 tokens of 4 characters plus a space: the line is cut at 252.
    std::vector<std::optional<std::string>> many;
    for (int i = 0; i < 60; ++i) many.push_back("t" + std::to_string(100 + i));
    RuleSpec spec = RuleSpec().with_rgy("*").with_tokens(many);
    spec.tokens[59] = "*";
    spec.mapping = "*";
    TestRule r(spec);
    TestId id("mech", "realm", many);
    idm_buffer result{};

    oxtest::set_trace_levels(0, 0, 1, 0, 0);
    ASSERT_EQ(idm__native_apply_rule(&r.rule, &id.id, &result), 0);
    std::vector<oxtest::TraceRecord> records = oxtest::trace_records();
    ASSERT_EQ(records.size(), 1u);
    const oxtest::TraceRecord &m = records[0];
    EXPECT_EQ(m.id, 131);
    ASSERT_EQ(m.items.size(), 8u);
    EXPECT_EQ(m.text(0), "mech");
    EXPECT_EQ(m.text(1), "*");
    EXPECT_EQ(m.i32(2), 60);
    std::string expected_line;
    for (int i = 0; i < 59; ++i) expected_line += "t" + std::to_string(100 + i) + " ";
    expected_line += "* ";
    expected_line = expected_line.substr(0, 252) + "...";
    EXPECT_EQ(m.text(3), expected_line);
    EXPECT_EQ(m.text(3).size(), 255u);
    EXPECT_EQ(m.text(5), "realm");
    EXPECT_EQ(m.text(7).substr(0, 10), "t100 t101 ");
    EXPECT_EQ(m.text(7).size(), 255u);
    idm__release_buffer(&result);

    // Level 2: record 133 only; "[null]" for a rule without mapping.
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 0, 2, 0, 0);
    TestRule denial{RuleSpec()};
    TestId joe("mech", "realm", {"joe"});
    ASSERT_EQ(idm__native_apply_rule(&denial.rule, &joe.id, &result), 0);
    records = oxtest::trace_records();
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].id, 133);
    EXPECT_EQ(records[0].text(0), "[null]");

    // A failed application records no mapping trace.
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 0, 8, 0, 0);
    TestId bob("mech", "realm", {"bob"});
    ASSERT_EQ(idm__native_apply_rule(&denial.rule, &bob.id, &result), 38);
    EXPECT_TRUE(oxtest::trace_ids().empty());
}

TEST_F(NatmapRules, TokenLineEdges) {
    struct Case {
        const char *label;
        std::vector<std::optional<std::string>> tokens;
        std::string line;
    } cases[] = {
        {"exactly 252 with the last space", {std::string(251, 'a')}, std::string(251, 'a') + " ..."},
        {"252 characters token", {std::string(252, 'b')}, std::string(252, 'b') + "..."},
        {"second token starts at 252", {std::string(251, 'c'), "d"}, std::string(251, 'c') + " ..."},
        {"short", {"x", "y"}, "x y "},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::reset_trace();
        oxtest::set_trace_levels(0, 0, 1, 0, 0);
        std::vector<std::optional<std::string>> wild(c.tokens.size(), std::optional<std::string>("*"));
        TestRule r(RuleSpec().with_tokens(wild));
        TestId id("mech", "realm", c.tokens);
        idm_buffer result{};
        ASSERT_EQ(idm__native_apply_rule(&r.rule, &id.id, &result), 0);
        auto records = oxtest::trace_records();
        ASSERT_EQ(records.size(), 1u);
        EXPECT_EQ(records[0].text(7), c.line);
    }
}

TEST_F(NatmapRules, CheckTracesAndDumpsAtApiLevel8) {
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    TestRule r(RuleSpec().with_rgy(std::nullopt).with_tokens({"a", "b", std::nullopt}).with_mapping("root"));
    EXPECT_EQ(idm__native_check_rule(&r.rule), 38);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{120, 136, 139, 139, 139, 138, 122}));
    auto records = oxtest::trace_records();
    EXPECT_EQ(records[1].text(2), "<null>");
    EXPECT_EQ(records[4].text(1), "<null>");
    EXPECT_EQ(records[6].i32(0), 38);

    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    TestId id("mech", "realm", {"joe"});
    EXPECT_EQ(idm__native_check_id(&id.id), 0);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{123, 126}));

    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    EXPECT_EQ(idm__native_check_id(&id.id), 0);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{125, 137, 139, 127}));

    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    TestRule ok(RuleSpec().with_mapping("root"));
    idm_buffer result{};
    EXPECT_EQ(idm__native_apply_rule(&ok.rule, &id.id, &result), 0);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{128, 118, 121, 123, 126, 134}));
    idm__release_buffer(&result);
}

}  // namespace
