// The map file line format and the parser of a whole stream: every line is
// judged the same by the pure line check (shared with the checker tool and
// the fuzzers) and by the file parser, and a stream yields the entries of
// its valid lines in order, however its lines are cut.
#include <stdio.h>

#include <cstring>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"

namespace {

using idm::mapfile::LineKind;
using Shown = std::vector<std::string>;
using namespace std::string_literals;

// Parses `content` (any bytes) as a map file; the entries as "net=local" or "!net".
int32_t parse(const std::string &content, Shown *shown, const char *mechanism = "mechA") {
    std::string copy = content;
    FILE *f = fmemopen(copy.empty() ? nullptr : copy.data(), copy.empty() ? 1 : copy.size(), "r");
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    int32_t status = idm__parse_mapfile(mechanism, "/test/map", f, &count, &entries);
    std::fclose(f);
    EXPECT_EQ(count == 0, entries == nullptr);
    for (int32_t i = 0; i < count; ++i) {
        const idm_mapfile_entry &e = entries[i];
        EXPECT_EQ(e.rule_index, 0);
        EXPECT_EQ(e.read_time, 1234567);
        EXPECT_EQ(e.local_id == nullptr, e.kind == IDM_ENTRY_DENIAL);
        shown->push_back(e.kind == IDM_ENTRY_DENIAL ? std::string("!") + e.network_id
                                                    : std::string(e.network_id) + "=" + e.local_id);
    }
    idm__native_release_entry_list(count, entries);
    return status;
}

class Parser : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        cux_set_clock(1234567);
    }
};

constexpr LineKind S = LineKind::kSkipped, I = LineKind::kInvalid, A = LineKind::kAffirmative,
                   D = LineKind::kDenial;
const struct LineCase {
    const char *label, *line;
    LineKind kind;
    const char *network, *local;
} kLines[] = {
    {"plain affirmative", "mechA:alice.realm1=alice", A, "alice.realm1", "alice"},
    {"blanks everywhere, rest ignored", "  mechA:  alice.realm1  =  root  extra", A, "alice.realm1", "root"},
    {"text between identifier and '=' ignored", "mechA:alice bob=root", A, "alice", "root"},
    {"local identifier may hold '=', '!', ':'", "mechA:a=b=!x:y", A, "a", "b=!x:y"},
    {"tabs are blanks", "\tmechA:\talice\t=\tbob\tmore", A, "alice", "bob"},
    {"'!' inside the network identifier", "mechA:a!b=c", A, "a!b", "c"},
    {"second colon belongs to the rule", "mechA:x:y=z", A, "x:y", "z"},
    {"'#' cuts the local identifier", "mechA:a=bo#b", A, "a", "bo"},
    {"carriage return is ordinary", "mechA:a=b\r\n", A, "a", "b\r"},
    {"denial", "mechA:!bob.realm1", D, "bob.realm1", ""},
    {"denial with blanks, rest and comment", "mechA: !  bob.realm1 more # note", D, "bob.realm1", ""},
    {"other mechanism", "mechB:alice=alice", S, "", ""},
    {"selector is case-sensitive", "MECHA:alice=alice", S, "", ""},
    {"blank before the colon", "mechA :alice=alice", S, "", ""},
    {"prefix of the selector", "mech:alice=alice", S, "", ""},
    {"selector longer than the mechanism", "mechAB:alice=alice", S, "", ""},
    {"no colon", "mechA alice=alice", S, "", ""},
    {"empty", "", S, "", ""},
    {"blanks only", " \t \n", S, "", ""},
    {"comment after blanks", "   # mechA:alice=bob", S, "", ""},
    {"comment leaves no '='", "mechA:alice#=root", I, "", ""},
    {"empty network identifier", "mechA:=alice", I, "", ""},
    {"'=' last", "mechA:alice=", I, "", ""},
    {"blanks only after '='", "mechA:alice= \t ", I, "", ""},
    {"only blanks after the colon", "mechA: \t", I, "", ""},
    {"no '=' at all", "mechA:alice bob", I, "", ""},
    {"denial with '=' in the ignored rest", "mechA:!bob x=y", I, "", ""},
    {"bare '!'", "mechA:! \t", I, "", ""},
};

TEST_F(Parser, EachLineAloneAndAllAsOneFile) {
    std::string file;
    Shown all;
    for (const LineCase &c : kLines) {
        SCOPED_TRACE(c.label);
        const idm::mapfile::LineVerdict v = idm::mapfile::judge_line("mechA", c.line);
        EXPECT_EQ(v.kind, c.kind);
        Shown expected;
        if (c.kind == A) expected.push_back(std::string(c.network) + "=" + c.local);
        if (c.kind == D) expected.push_back(std::string("!") + c.network);
        EXPECT_EQ(std::string(v.network_id) + "=" + std::string(v.local_id), c.network + "="s + c.local);
        std::string line = std::string(c.line).substr(0, std::string(c.line).find_first_of("\n#"));
        EXPECT_EQ(idm__test_entry_mech("mechA", line.c_str()) == 0, c.kind == I || !expected.empty());
        Shown got;
        EXPECT_EQ(parse(c.line, &got), 0);
        EXPECT_EQ(got, expected);
        file += std::string(c.line) + (std::strchr(c.line, '\n') ? "" : "\n");
        all.insert(all.end(), expected.begin(), expected.end());
    }
    Shown got;
    EXPECT_EQ(parse(file, &got), 0);
    EXPECT_EQ(got, all);
    EXPECT_TRUE(oxtest::nothing_reported());
}

// Whole streams: pieces of at most 1023 characters, NUL bytes hiding the
// rest of their line, no final line feed, and an array that grows in its
// block as well as by moving.
TEST_F(Parser, Streams) {
    const std::string L1013(1013, 'L'), L1017(1017, 'L');
    std::string many;
    Shown many_shown;
    for (int i = 0; i < 45; ++i) {
        many += "mechA:n" + std::to_string(i) + "=l\n";
        many_shown.push_back("n" + std::to_string(i) + "=l");
    }
    const struct {
        const char *label, *mechanism;
        std::string content;
        Shown expected;
    } cases[] = {
        {"nothing to take", "mechA", "\n\n# only\n  # comments\n\t\nmechB:a=b\n", {}},
        {"1030 characters: the rest is a line of its own", "mechA",
         "mechA:net=" + L1013 + "ABCDEFG\nmechA:after=x\n", {"net=" + L1013, "after=x"}},
        {"the cut rest is a valid line", "m", "m:net=" + L1017 + "m:ab=cd\nm:after=x\n",
         {"net=" + L1017, "ab=cd", "after=x"}},
        {"1023 characters and the line feed", "mechA", "mechA:net=" + L1013 + "\nmechA:after=x\n",
         {"net=" + L1013, "after=x"}},
        {"CR LF", "mechA", "mechA:a=b\r\nmechA:!c\r\nmechA:d=e f\r\n", {"a=b\r", "!c\r", "d=e"}},
        {"NUL bytes and junk", "mechA",
         "mechA:a=b\0hidden=x\nmechA:c=d\n\xff\xfe\0\1mechA:z=z\n\0mechA:y=y\n"s +
             "mechA:\x80\x81=\xc3\xa9\n\x7f junk\nmechA:last=one",
         {"a=b", "c=d", "\x80\x81=\xc3\xa9", "last=one"}},
        {"45 entries", "mechA", many, many_shown},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        Shown got;
        EXPECT_EQ(parse(c.content, &got, c.mechanism), 0);
        EXPECT_EQ(got, c.expected);
    }
}

}  // namespace
