// Node information text: what the parser hands over or where it fails, and
// the trees the loader builds from it; a sweep of random texts against the
// reference parser; hostile texts; the value and record routines.
#include <random>
#include <tuple>
#include <string>

#include "../support/reference_nodeinfo.h"
#include "harness.h"

namespace {

using namespace std::string_literals;

class ClusterText : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        pthread_once(&idm__init_once_block, idm__state_init);
    }
    // Rebuilds both trees from `text` as the loader does.
    int32_t construct(const std::string &text) {
        idm::clmap::MapHold hold(&idmutex);
        const std::string with_lf = text + '\n';
        return idm__construct_clcfg(hold, with_lf.data(), with_lf.size());
    }
};

// A valid text (point 0) gives these trees; an invalid one fails at this
// trace point on this line and leaves both trees empty.
TEST_F(ClusterText, TextsToTreesOrFaults) {
    const struct {
        const char *label;
        std::string text;
        int point;
        size_t line;
        const char *trees = " |";  // names | addresses
    } rows[] = {
        {"example", "# hosts\nNODE:\nNAME: hosta hosta-alt\nADDRESS: 10.1.1.1 fd00::1\nCLUSTER: clA clB\n"
                    "node:\naddress: 10.1.1.2\ncluster: clA\n", 0, 0,
         "hosta=clA,clB hosta-alt=clA,clB | 10.1.1.1=clA,clB 10.1.1.2=clA fd00::1=clA,clB"},
        {"empty", "", 0, 0, " |"},
        {"comments and whitespace", "# one\n\n   \t\r\n\v\f\n  # two NODE:\n", 0, 0, " |"},
        {"keywords by prefix and case", "  Nodes:\n\tnames: h\nAddresses: a\n\t\tclusterS: c\n", 0, 0, "h=c | a=c"},
        {"text before the colon", "NODE list:\nNAME =: h\nCLUSTER is: c\n", 0, 0, "h=c |"},
        {"statements after NODE:", "NODE: NAME: a\nCLUSTER: c\nNODE: # x\nNAME: b\nCLUSTER: d\n", 0, 0, "a=c b=d |"},
        {"# inside a list is text", "NODE:\nNAME: hosta # old\nCLUSTER: c\n", 0, 0, "#=c hosta=c old=c |"},
        {"blanks split, whitespace trims", "NODE:\nNAME:\ta\tb \t c\t\nCLUSTER:  clA   clB  \r\n", 0, 0,
         "a\tb=clA,clB c=clA,clB |"},
        {"empty lists before full ones", "NODE:\nNAME:\nNAME: h\nCLUSTER: \t\nCLUSTER: c\n", 0, 0, "h=c |"},
        {"no LF at the end", "NODE:\nNAME: h\nCLUSTER: c d", 0, 0, "h=c,d |"},
        {"a NUL ends the key", "NODE:\nNAME: a\0b\nCLUSTER: c\n"s, 0, 0, "a=c |"},
        {"values unchecked", "NODE:\nADDRESS: fe80::1:2 999.1.1.1\nCLUSTER: c\n", 0, 0, " | 999.1.1.1=c fe80::1:2=c"},
        {"first record of a key wins",
         "NODE:\nNAME: h\nADDRESS: 10.0.0.1\nCLUSTER: first\nNODE:\nNAME: h other\nADDRESS: 10.0.0.1\nCLUSTER: second\n", 0,
         0, "h=first other=second | 10.0.0.1=first"},
        {"NODE alone", "# x\nNODE:\n", 157, 2},
        {"empty cluster list", "NODE:\nNAME: h\nCLUSTER:\n", 157, 1},
        {"incomplete at the next NODE", "NODE:\nNAME: a\nCLUSTER: c\n\nNODE:\nNAME: b\nNODE:\n", 157, 5},
        {"NODE colon on the next line", "NODE\n:\n", 164, 1},
        {"NAME outside a record", "NAME: h\n", 165, 1},
        {"second NAME", "NODE:\nNAME: a\nNAME: b\nCLUSTER: c\n", 165, 3},
        {"NAME without colon", "NODE:\nNAMEhosta\n", 166, 2},
        {"ADDRESS outside a record", "# c\n  ADDRESS: a\n", 167, 2},
        {"ADDRESS without colon", "NODE:\nADDRESS a\n", 168, 2},
        {"CLUSTER outside a record", "CLUSTER: c\n", 169, 1},
        {"second CLUSTER", "NODE:\nNAME: h\nCLUSTER: c\nCLUSTER: d\n", 169, 4},
        {"CLUSTER without colon", "NODE:\nNAME: h\nCLUSTER c d\n", 170, 3},
        {"no keyword", "NODE:\nNAME: h\nCLUSTER: c\nHOST: x\n", 171, 4},
        {"no trailing comments", "NODE:\nNAME: h\nCLUSTER: c\n NODE # x:\nbad\n", 171, 5},
        {"keyword cut by the end", "CLUST", 171, 1},
        {"NUL inside a keyword", "NO\0E:\n"s, 171, 1},
    };
    for (const auto &row : rows) {
        SCOPED_TRACE(row.label);
        const refnode::Result lib = refnode::library_parse(row.text);
        EXPECT_EQ(std::tuple(lib.status, lib.point, lib.line), std::tuple(row.point ? 21 : 0, row.point, row.line));
        EXPECT_TRUE(lib == refnode::parse(row.text)) << "the reference parser agrees";
        oxtest::clear_errors();
        EXPECT_EQ(construct(row.text), lib.status);
        EXPECT_TRUE(row.point ? oxtest::reported(idm::kNodeFileInvalid, idm::kMsg690, {}) : oxtest::nothing_but_list_ends());
        EXPECT_EQ(refnode::format(refnode::library_trees()), row.trees);
    }
}

// A non-zero status of the sink at any value or record stops the parse with
// that status and hands over nothing more.
int g_fail_at, g_seen;
int32_t count_event(void *) { return g_seen++ == g_fail_at ? 6 : 0; }
TEST_F(ClusterText, ASinkFailureStopsTheParse) {
    const idm::clmap::ParseSink sink{nullptr, [](void *, idm::clmap::Attr, std::string_view) { return count_event(0); },
                                     count_event};
    for (g_fail_at = 0; g_fail_at < 7; ++g_fail_at) {
        g_seen = 0;
        const auto r = idm::clmap::parse("NODE:\nNAME: a b\nCLUSTER: c\nNODE:\nADDRESS: x\nCLUSTER: d", sink);
        EXPECT_TRUE(r.status == 6 && r.point == 0 && g_seen == g_fail_at + 1) << g_fail_at;
    }
}

TEST_F(ClusterText, AgreesWithTheReferenceOnRandomTexts) {
    static const std::string tokens[] = {
        "NODE", "node", "Nodes", "NAME", "name", "NAMES", "ADDRESS", "address", "CLUSTER", "Cluster", ":", ":", ":",
        " ",    " ",    "  ",    "\t",   "\n",   "\n",    "\n",      "\r",      "\r\n",    "#",       "a", "b1", "10.0.0.1",
        "x#y",  "\0"s,  "\xff",  "=",    "NAM",  "CLUST", "\v",      "\f"};
    std::mt19937 rng(1234);
    int valid = 0;
    for (int round = 0; round < 30000; ++round) {
        std::string text = round % 3 == 0 ? "NODE:\n" : "";
        for (int i = static_cast<int>(rng() % 40); i > 0; --i) text += tokens[rng() % std::size(tokens)];
        const refnode::Result lib = refnode::library_parse(text), ref = refnode::parse(text);
        ASSERT_TRUE(lib == ref) << testing::PrintToString(text) << " point " << lib.point << " line " << lib.line;
        valid += lib.status == 0;
        if (round % 10 != 0) continue;
        ASSERT_EQ(construct(text), lib.status) << testing::PrintToString(text);
        ASSERT_EQ(refnode::library_trees(), refnode::expected_trees(ref)) << testing::PrintToString(text);
    }
    EXPECT_GT(valid, 1000) << "the sweep reaches valid texts too";
}

TEST_F(ClusterText, HostileTextsEndQuickly) {
    auto repeat = [](const std::string &piece, int n) {
        std::string t;
        while (n-- > 0) t += piece;
        return t;
    };
    const std::pair<std::string, int32_t> rows[] = {
        {std::string(10 << 20, 'N'), 21},                                   // no LF, no colon
        {repeat("NODE:", 200000), 21},                                      // NODE: over and over on one line
        {"NODE:\nNAME:" + std::string(1 << 20, ' ') + "x\nCLUSTER: c\n", 0},  // a million blanks
        {"NODE:\nCLUSTER: c\nNAME:" + repeat(" a", 1000000), 0},             // a million values
        {"#" + std::string(10 << 20, 'x') + "\n", 0},                       // a 10 MB comment
        {"NODE:\nCLUSTER: c\nNAME:" + repeat(" \t ", 100000), 21},           // tabs between blanks
    };
    for (const auto &[text, status] : rows) EXPECT_EQ(refnode::library_parse(text).status, status) << text.substr(0, 20);
}

// One value cut from a line as a heap copy: its end at the first blank, or
// 2650-690 when the line ends first (the end of a text counts as one).
TEST_F(ClusterText, ExtractAttrValue) {
    EXPECT_EQ(idm::clmap::scan_value(" last", ' ').status, 21);
    int32_t consumed = -1;
    char *value = nullptr;
    EXPECT_EQ(idm__extract_attr_value(" \ta\tb\t c\n", &consumed, &value, ' '), 0);
    EXPECT_EQ(std::tuple(std::string(value ? value : "(null)"), consumed), std::tuple("a\tb", 6));
    std::free(value);
    EXPECT_TRUE(oxtest::nothing_reported());
    EXPECT_EQ(idm__extract_attr_value(" \t \n", &consumed, &value, '\n'), 0);
    EXPECT_EQ(std::tuple(value, consumed), std::tuple(static_cast<char *>(nullptr), 3));
    EXPECT_EQ(idm__extract_attr_value(" last\n", &consumed, &value, ' '), 21);
    EXPECT_EQ(std::tuple(value, consumed), std::tuple(static_cast<char *>(nullptr), 5));
    EXPECT_TRUE(oxtest::reported(idm::kNodeFileInvalid, idm::kMsg690, {}));
}

}  // namespace
