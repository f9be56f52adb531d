// Node information text, judged by the pure parser: keywords by prefix and
// without regard to case, the ":" search, value lists split at blanks only,
// comments only at a statement's start, record completeness, and the fault
// point, offset and line of every kind of invalid text.  Also the value
// extraction and record routines that the loader builds on.
#include <cctype>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm_clmap.h"
#include "oxidm_state.h"

namespace {

using idm::clmap::Attr;
using idm::clmap::ParseResult;

// Collects the records as "N[a,b] A[x] C[c]" strings.
struct Collected {
    std::vector<std::string> lists[3];
    std::vector<std::string> records;
    int32_t fail_value_at = -1;  // the n-th value (from 0) fails with status 6
    int32_t values_seen = 0;
};

int32_t collect_value(void *context, Attr attr, std::string_view value) {
    auto *c = static_cast<Collected *>(context);
    if (c->values_seen++ == c->fail_value_at) return 6;
    c->lists[attr].emplace_back(value);
    return 0;
}

int32_t collect_record(void *context) {
    auto *c = static_cast<Collected *>(context);
    std::string r;
    const char tags[3] = {'N', 'A', 'C'};
    for (int a = 0; a < 3; ++a) {
        if (c->lists[a].empty()) continue;
        if (!r.empty()) r += ' ';
        r += tags[a];
        r += '[';
        for (size_t i = 0; i < c->lists[a].size(); ++i) r += (i ? "," : "") + c->lists[a][i];
        r += ']';
        c->lists[a].clear();
    }
    c->records.push_back(r);
    return 0;
}

struct Outcome {
    ParseResult result;
    std::vector<std::string> records;
};

Outcome parse(std::string_view text, int32_t fail_value_at = -1) {
    Collected c;
    c.fail_value_at = fail_value_at;
    idm::clmap::ParseSink sink{&c, collect_value, collect_record};
    ParseResult r = idm::clmap::parse(text, sink);
    return {r, c.records};
}

struct ValidCase {
    const char *label;
    std::string text;
    std::vector<std::string> records;
};

TEST(ClusterText, ValidTexts) {
    const ValidCase cases[] = {
        {"the example",
         "# cluster hosts\nNODE:\nNAME: hosta hosta-alt\nADDRESS: 10.1.1.1 fd00::1\nCLUSTER: clA clB\n"
         "node:\naddress: 10.1.1.2\ncluster: clA\n",
         {"N[hosta,hosta-alt] A[10.1.1.1,fd00::1] C[clA,clB]", "A[10.1.1.2] C[clA]"}},
        {"empty text", "", {}},
        {"only an LF", "\n", {}},
        {"comments, blank lines and whitespace", "# one\n\n   \t\r\n\v\f\n  # two NODE:\n", {}},
        {"indentation is free", "   NODE:\n\t NAME: h\n\t\tCLUSTER: c\n", {"N[h] C[c]"}},
        {"name and cluster without address", "NODE:\nNAME: h\nCLUSTER: c\n", {"N[h] C[c]"}},
        {"keywords by prefix and case", "Nodes:\nnames: h\nAddresses: a\nclusterS: c\n", {"N[h] A[a] C[c]"}},
        {"text between keyword and colon is skipped", "NODE list:\nNAME =: h\nADDRESS list: a\nCLUSTER is: c\n",
         {"N[h] A[a] C[c]"}},
        {"NODE continues on its own line", "NODE: NAME: hosta\nCLUSTER: c\n", {"N[hosta] C[c]"}},
        {"comment after NODE", "NODE: # comment\nNAME: h\nCLUSTER: c\n", {"N[h] C[c]"}},
        {"NODE: NAME: after a complete record", "NODE:\nNAME: a\nCLUSTER: c\nNODE: NAME: b\nCLUSTER: d\n",
         {"N[a] C[c]", "N[b] C[d]"}},
        {"# inside a value list is text", "NODE:\nNAME: hosta # old\nCLUSTER: c\n", {"N[hosta,#,old] C[c]"}},
        {"blanks and CR around values", "NODE:\nNAME: h\nCLUSTER:  clA   clB  \r\n", {"N[h] C[clA,clB]"}},
        {"a tab stays inside a value", "NODE:\nNAME: a\tb\nCLUSTER: c\n", {"N[a\tb] C[c]"}},
        {"tabs at a value's ends are trimmed", "NODE:\nNAME:\ta\t b\t\nCLUSTER: c\n", {"N[a,b] C[c]"}},
        {"a tab between blanks is no value", "NODE:\nNAME: a \t b\nCLUSTER: c\n", {"N[a,b] C[c]"}},
        {"empty NAME then NAME with values", "NODE:\nNAME:\nNAME: hosta\nCLUSTER: c\n", {"N[hosta] C[c]"}},
        {"empty CLUSTER then CLUSTER with values", "NODE:\nNAME: h\nCLUSTER:\nCLUSTER: c\n", {"N[h] C[c]"}},
        {"whitespace-only value list gives nothing", "NODE:\nNAME: \t \nNAME: h\nCLUSTER: c\n", {"N[h] C[c]"}},
        {"no LF at the end", "NODE:\nNAME: h\nCLUSTER: c", {"N[h] C[c]"}},
        {"colon right at the end", "NODE:\nNAME: h\nCLUSTER: c\nADDRESS:", {"N[h] C[c]"}},
        {"values are not checked", "NODE:\nADDRESS: not-an-address 999.1.1.1\nCLUSTER: c\n",
         {"A[not-an-address,999.1.1.1] C[c]"}},
        {"a NUL byte is ordinary text", std::string("NODE:\nNAME: a\0b\nCLUSTER: c\n", 27),
         {std::string("N[a\0b] C[c]", 11)}},
        {"a colon inside a value", "NODE:\nADDRESS: fe80::1:2\nCLUSTER: c\n", {"A[fe80::1:2] C[c]"}},
        {"CR line ends", "NODE:\r\nNAME: h\r\nCLUSTER: c\r\n", {"N[h] C[c]"}},
    };
    for (const ValidCase &c : cases) {
        SCOPED_TRACE(c.label);
        Outcome o = parse(c.text);
        EXPECT_EQ(o.result.status, 0) << "point " << o.result.point;
        EXPECT_EQ(o.result.point, 0);
        EXPECT_EQ(o.records, c.records);
    }
}

struct InvalidCase {
    const char *label;
    std::string text;
    int point;
    size_t line;
    size_t records_before;  // records handed over before the fault
};

TEST(ClusterText, InvalidTexts) {
    const InvalidCase cases[] = {
        {"NODE alone at the end", "# x\nNODE:\n", 157, 2, 0},
        {"NODE alone without LF", "NODE:", 157, 1, 0},
        {"address without cluster", "NODE:\nADDRESS: a\n", 157, 1, 0},
        {"cluster without name or address", "NODE:\nCLUSTER: c\n", 157, 1, 0},
        {"empty CLUSTER only", "NODE:\nNAME: h\nCLUSTER:\n", 157, 1, 0},
        {"incomplete record at the next NODE", "NODE:\nNAME: a\nCLUSTER: c\n\nNODE:\nNAME: b\nNODE:\n", 157, 5, 1},
        {"NODE without colon", "NODE\n", 164, 1, 0},
        {"NODE with the colon on the next line", "NODE\n:\n", 164, 1, 0},
        {"NAME outside a record", "NAME: h\n", 165, 1, 0},
        {"second NAME with values", "NODE:\nNAME: a\nNAME: b\nCLUSTER: c\n", 165, 3, 0},
        {"NAME without colon", "NODE:\nNAMEhosta\n", 166, 2, 0},
        {"ADDRESS outside a record", "# c\n  ADDRESS: a\n", 167, 2, 0},
        {"second ADDRESS with values", "NODE:\nADDRESS: a\nADDRESS: b\n", 167, 3, 0},
        {"ADDRESS without colon", "NODE:\nADDRESS a\n", 168, 2, 0},
        {"CLUSTER outside a record", "CLUSTER: c\n", 169, 1, 0},
        {"second CLUSTER with values", "NODE:\nNAME: h\nCLUSTER: c\nCLUSTER: d\n", 169, 4, 0},
        {"CLUSTER without colon", "NODE:\nNAME: h\nCLUSTER c d\n", 170, 3, 0},
        {"no keyword", "NODE:\nNAME: h\nCLUSTER: c\nHOST: x\n", 171, 4, 0},
        {"text after NODE: is a statement", "NODE: x\n", 171, 1, 0},
        {"a trailing comment is no comment", "NODE:\nNAME: h\nCLUSTER: c\n NODE # x:\nbad\n", 171, 5, 1},
        {"a short keyword", "NOD:\n", 171, 1, 0},
        {"a keyword cut by the end", "CLUST", 171, 1, 0},
        {"a NUL inside a keyword", std::string("NO\0E:\n", 6), 171, 1, 0},
    };
    for (const InvalidCase &c : cases) {
        SCOPED_TRACE(c.label);
        Outcome o = parse(c.text);
        EXPECT_EQ(o.result.status, 21);
        EXPECT_EQ(o.result.point, c.point);
        EXPECT_EQ(o.result.line, c.line);
        EXPECT_EQ(o.records.size(), c.records_before);
    }
}

TEST(ClusterText, ASinkFailureStopsTheParseWithItsStatus) {
    Outcome o = parse("NODE:\nNAME: a b c\nCLUSTER: c\n", 1);
    EXPECT_EQ(o.result.status, 6);
    EXPECT_EQ(o.result.point, 0);
    EXPECT_TRUE(o.records.empty());
}

TEST(ClusterText, ScanValueStopsAtTheFirstBlankOrTheLine) {
    struct Case {
        const char *text;
        char terminator;
        int32_t status;
        size_t consumed;
        std::string value;
    } cases[] = {
        {"  abc def\n", ' ', 0, 5, "abc"},   {"abc\n", ' ', 21, 3, ""},        {"  abc\n", '\n', 0, 5, "abc"},
        {"\tabc\t \n", ' ', 0, 5, "abc"},     {" \t \n", ' ', 0, 2, ""},        {"a\tb c\n", ' ', 0, 3, "a\tb"},
        {" a b \r\n", '\n', 0, 6, "a b"},    {"", ' ', 21, 0, ""},             {"", '\n', 0, 0, ""},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.text);
        std::string_view text(c.text);
        idm::clmap::ValueScan v = idm::clmap::scan_value(text, c.terminator);
        EXPECT_EQ(v.status, c.status);
        EXPECT_EQ(v.consumed, c.consumed);
        EXPECT_EQ(std::string(text.substr(v.begin, v.length)), c.value);
    }
}

class ClusterRoutines : public oxtest::Test {
  protected:
    void TearDown() override {
        idm_test_fail_alloc(0);
        oxtest::Test::TearDown();
    }
};

TEST_F(ClusterRoutines, ExtractAttrValue) {
    int32_t consumed = -1;
    char *value = nullptr;
    EXPECT_EQ(idm__extract_attr_value("  clA clB\n", &consumed, &value, ' '), 0);
    EXPECT_STREQ(value, "clA");
    EXPECT_EQ(consumed, 5);
    std::free(value);
    EXPECT_TRUE(oxtest::nothing_reported());
    EXPECT_EQ(idm__extract_attr_value(" \t \n", &consumed, &value, ' '), 0);
    EXPECT_EQ(value, nullptr);
    // The end of the line before a blank: 2650-690 and status 21.
    EXPECT_EQ(idm__extract_attr_value(" last\n", &consumed, &value, ' '), 21);
    EXPECT_EQ(consumed, 5);
    EXPECT_EQ(value, nullptr);
    EXPECT_TRUE(oxtest::reported(21, idm::kMsg690, {}));
    idm_test_fail_alloc(1);
    EXPECT_EQ(idm__extract_attr_value(" last\n", &consumed, &value, '\n'), 6);
    EXPECT_TRUE(oxtest::reported(6, idm::kMsg654, {"idm__extract_attr_value", "5"}));
}

TEST_F(ClusterRoutines, GetnodeCopiesAndReleasesEverythingOnFailure) {
    char a[] = "clA", b[] = "clusterB";
    char *clusters[3] = {a, nullptr, b};
    idm_clnode *node = nullptr;
    ASSERT_EQ(idm__getnode("hosta", clusters, 3, &node), 0);
    ASSERT_NE(node, nullptr);
    EXPECT_STREQ(node->key, "hosta");
    EXPECT_EQ(node->count, 3);
    EXPECT_STREQ(node->clusters[0], "clA");
    EXPECT_NE(node->clusters[0], a);
    EXPECT_EQ(node->clusters[1], nullptr);
    EXPECT_STREQ(node->clusters[2], "clusterB");
    idm__rtree_cleanup_routine(node);
    idm__rtree_cleanup_routine(nullptr);

    struct Case {
        long fail;
        std::string bytes;
    } cases[] = {
        {1, std::to_string(sizeof(idm_clnode))}, {2, "5"}, {3, "24"}, {4, "3"}, {5, "8"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.fail);
        idm_test_fail_alloc(c.fail);
        node = reinterpret_cast<idm_clnode *>(&node);
        EXPECT_EQ(idm__getnode("hosta", clusters, 3, &node), 6);
        EXPECT_EQ(node, nullptr);
        EXPECT_TRUE(oxtest::reported(6, idm::kMsg654, {"idm__getnode", c.bytes}));
    }
    idm_test_fail_alloc(0);
    ASSERT_EQ(idm__getnode("", nullptr, 0, &node), 0);
    EXPECT_STREQ(node->key, "");
    EXPECT_EQ(node->clusters, nullptr);
    EXPECT_EQ(node->count, 0);
    idm__rtree_cleanup_routine(node);
}

TEST_F(ClusterRoutines, CompareIsExactAndFreeArraysNullsEntries) {
    idm_clnode x{const_cast<char *>("HostA"), nullptr, 0}, y{const_cast<char *>("hosta"), nullptr, 0};
    EXPECT_LT(idm__rtree_compare_routine(&x, &y), 0);
    EXPECT_GT(idm__rtree_compare_routine(&y, &x), 0);
    EXPECT_EQ(idm__rtree_compare_routine(&x, &x), 0);
    char *array[3] = {static_cast<char *>(std::malloc(2)), nullptr, static_cast<char *>(std::malloc(2))};
    idm__free_arrays(array, 0);
    EXPECT_NE(array[0], nullptr);
    idm__free_arrays(array, 3);
    EXPECT_EQ(array[0], nullptr);
    EXPECT_EQ(array[2], nullptr);
}

}  // namespace

// ---- a reference parser, written line by line with plain string
// operations, against which the real one is swept over random texts ----

namespace oracle {

bool space(char c) { return std::isspace(static_cast<unsigned char>(c)) != 0; }

bool starts_with_keyword(const std::string &s, const std::string &kw) {
    if (s.size() < kw.size()) return false;
    for (size_t i = 0; i < kw.size(); ++i) {
        char c = s[i];
        if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
        if (c != kw[i]) return false;
    }
    return true;
}

// Splits at blanks, trims whitespace, drops empty fields.
std::vector<std::string> values(const std::string &rest) {
    std::vector<std::string> out;
    size_t start = 0;
    while (start <= rest.size()) {
        size_t blank = rest.find(' ', start);
        std::string field = rest.substr(start, blank == std::string::npos ? std::string::npos : blank - start);
        size_t b = 0, e = field.size();
        while (b < e && space(field[b])) ++b;
        while (e > b && space(field[e - 1])) --e;
        if (e > b) out.push_back(field.substr(b, e - b));
        if (blank == std::string::npos) break;
        start = blank + 1;
    }
    return out;
}

struct Result {
    int32_t status = 0;
    int point = 0;
    size_t line = 0;
    std::vector<std::string> records;
};

Result parse(const std::string &text) {
    Result r;
    std::vector<std::string> lines;
    size_t from = 0;
    for (;;) {
        size_t lf = text.find('\n', from);
        lines.push_back(text.substr(from, lf == std::string::npos ? std::string::npos : lf - from));
        if (lf == std::string::npos) break;
        from = lf + 1;
    }
    bool open = false;
    size_t open_line = 0;
    std::vector<std::string> lists[3];
    auto complete = [&] { return !lists[2].empty() && (!lists[0].empty() || !lists[1].empty()); };
    auto store = [&] {
        Collected c;
        for (int a = 0; a < 3; ++a) c.lists[a] = lists[a];
        collect_record(&c);
        r.records.push_back(c.records[0]);
        for (auto &l : lists) l.clear();
    };
    auto fail = [&](int point, size_t line) {
        r.status = 21;
        r.point = point;
        r.line = line;
        return r;
    };
    const struct {
        const char *kw;
        int attr, outside, no_colon;
    } attrs[] = {{"NAME", 0, 165, 166}, {"ADDRESS", 1, 167, 168}, {"CLUSTER", 2, 169, 170}};
    for (size_t ln = 0; ln < lines.size(); ++ln) {
        std::string rest = lines[ln];
        for (;;) {
            size_t b = 0;
            while (b < rest.size() && space(rest[b])) ++b;
            rest = rest.substr(b);
            if (rest.empty() || rest[0] == '#') break;
            if (starts_with_keyword(rest, "NODE")) {
                if (open && !complete()) return fail(157, open_line);
                if (open) store();
                size_t colon = rest.find(':', 4);
                if (colon == std::string::npos) return fail(164, ln + 1);
                open = true;
                open_line = ln + 1;
                for (auto &l : lists) l.clear();
                rest = rest.substr(colon + 1);
                continue;
            }
            bool matched = false;
            for (const auto &a : attrs) {
                if (!starts_with_keyword(rest, a.kw)) continue;
                matched = true;
                if (!open || !lists[a.attr].empty()) return fail(a.outside, ln + 1);
                size_t colon = rest.find(':', std::strlen(a.kw));
                if (colon == std::string::npos) return fail(a.no_colon, ln + 1);
                lists[a.attr] = values(rest.substr(colon + 1));
                break;
            }
            if (!matched) return fail(171, ln + 1);
            break;  // an attribute takes the rest of its line
        }
    }
    if (open) {
        if (!complete()) return fail(157, open_line);
        store();
    }
    return r;
}

}  // namespace oracle

TEST(ClusterText, AgreesWithAReferenceParserOnRandomTexts) {
    static const std::vector<std::string> tokens = {
        "NODE", "node", "Nodes", "NAME", "name", "NAMES", "ADDRESS", "address", "CLUSTER", "Cluster", ":", ":", ":",
        " ", " ", "  ", "\t", "\n", "\n", "\n", "\r", "\r\n", "#", "a", "b1", "10.0.0.1", "x#y", std::string(1, '\0'),
        "\xff", "=", "NAM", "CLUST", "\v", "\f"};
    std::mt19937 rng(1234);
    int valid = 0;
    for (int round = 0; round < 30000; ++round) {
        std::string text;
        if (round % 3 == 0) text = "NODE:\n";
        int n = static_cast<int>(rng() % 40);
        for (int i = 0; i < n; ++i) text += tokens[rng() % tokens.size()];
        Outcome o = parse(text);
        oracle::Result want = oracle::parse(text);
        if (o.result.status == 0) ++valid;
        ASSERT_EQ(o.result.status, want.status) << testing::PrintToString(text);
        ASSERT_EQ(o.result.point, want.point) << testing::PrintToString(text);
        if (want.status != 0) {
            ASSERT_EQ(o.result.line, want.line) << testing::PrintToString(text);
        }
        ASSERT_EQ(o.records, want.records) << testing::PrintToString(text);
    }
    EXPECT_GT(valid, 1000) << "the sweep reaches valid texts too";
}

TEST(ClusterText, HostileTextsEndQuickly) {
    const struct {
        const char *label;
        std::string text;
        int32_t status;
    } cases[] = {
        {"10 MB without an LF or a colon", std::string(10 << 20, 'N'), 21},
        {"NODE: repeated on one line", [] {
             std::string t;
             for (int i = 0; i < 200000; ++i) t += "NODE:";
             return t;
         }(), 21},
        {"a value list of a million blanks", "NODE:\nNAME:" + std::string(1 << 20, ' ') + "x\nCLUSTER: c\n", 0},
        {"a million single-letter values", [] {
             std::string t = "NODE:\nCLUSTER: c\nNAME:";
             for (int i = 0; i < 1000000; ++i) t += " a";
             return t;
         }(), 0},
        {"a 10 MB comment", "#" + std::string(10 << 20, 'x') + "\n", 0},
        {"tabs between blanks", "NODE:\nCLUSTER: c\nNAME:" + [] {
             std::string t;
             for (int i = 0; i < 100000; ++i) t += " \t ";
             return t;
         }(), 21},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        Collected sink;
        idm::clmap::ParseSink s{&sink, [](void *, Attr, std::string_view) -> int32_t { return 0; },
                                [](void *) -> int32_t { return 0; }};
        EXPECT_EQ(idm::clmap::parse(c.text, s).status, c.status);
    }
    std::mt19937 rng(99);
    for (int round = 0; round < 20; ++round) {
        std::string bytes(1 << 16, '\0');
        for (char &b : bytes) b = static_cast<char>(rng());
        Outcome o = parse(bytes);
        EXPECT_TRUE(o.result.status == 0 || o.result.status == 21);
    }
}
