// Node information text: where the parser fails, and the trees the loader
// builds from it.
#include <string>
#include <tuple>

#include "../support/reference_nodeinfo.h"
#include "harness.h"

namespace {

using namespace std::string_literals;

using ClusterText = oxtest::Test;

// A valid text (point 0) gives these trees; an invalid one fails at this
// trace point on this line and leaves both trees empty.
TEST_F(ClusterText, TextsToTreesOrFaults) {
    using namespace idm::trace::tp;
    pthread_once(&idm__init_once_block, idm__state_init);
    const struct {
        const char *label;
        std::string text;
        int point;  // 0: valid
        size_t line;
        const char *trees = " |";  // names | addresses
    } rows[] = {
        {"comments and whitespace", "# hosts\n# one\n\n   \t\r\n\v\f\n  # two NODE:\n", 0, 0, " |"},
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
        {"NODE alone", "# x\nNODE:\n", kNodeRecordIncomplete, 2},
        {"empty cluster list", "NODE:\nNAME: h\nCLUSTER:\n", kNodeRecordIncomplete, 1},
        {"incomplete at the next NODE", "NODE:\nNAME: a\nCLUSTER: c\n\nNODE:\nNAME: b\nNODE:\n", kNodeRecordIncomplete, 5},
        {"NODE colon on the next line", "NODE\n:\n", kNodeNoColon, 1},
        {"second NAME", "NODE:\nNAME: a\nNAME: b\nCLUSTER: c\n", kNameMisplaced, 3},
        {"NAME without colon", "NODE:\nNAMEhosta\n", kNameNoColon, 2},
        {"ADDRESS outside a record", "# c\n  ADDRESS: a\n", kAddressMisplaced, 2},
        {"ADDRESS without colon", "NODE:\nADDRESS a\n", kAddressNoColon, 2},
        {"CLUSTER outside a record", "CLUSTER: c\n", kClusterMisplaced, 1},
        {"second CLUSTER", "NODE:\nNAME: h\nCLUSTER: c\nCLUSTER: d\n", kClusterMisplaced, 4},
        {"CLUSTER without colon, no LF", "NODE:\nNAME: h\nCLUSTER c d", kClusterNoColon, 3},
        {"no keyword", "NODE:\nNAME: h\nCLUSTER: c\nHOST: x\n", kNoKeyword, 4},
        {"no trailing comments", "NODE:\nNAME: h\nCLUSTER: c\n NODE # x:\nbad\n", kNoKeyword, 5},
        {"keyword cut by the end", "CLUST", kNoKeyword, 1},
        {"NUL inside a keyword", "NO\0E:\n"s, kNoKeyword, 1},
    };
    for (const auto &row : rows) {
        SCOPED_TRACE(row.label);
        const refnode::Result lib = refnode::library_parse(row.text);
        const int32_t status = row.point ? idm::kNodeFileInvalid : idm::kOk;
        EXPECT_EQ(std::tuple(lib.status, lib.point, lib.line), std::tuple(status, row.point, row.line));
        oxtest::clear_errors();
        EXPECT_EQ(refnode::construct(row.text + '\n'), lib.status);
        EXPECT_TRUE(row.point ? oxtest::reported(status, idm::kMsg690, {}) : oxtest::nothing_but_list_ends());
        EXPECT_EQ(refnode::format(refnode::library_trees()), row.trees);
    }
}

}  // namespace
