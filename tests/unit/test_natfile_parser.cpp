// Map file line format and parser: the pure line check, one selected line
// into an entry, the entry array's growth, whole streams (long lines, CR LF,
// NUL bytes, a million lines), allocation failures and release.
#include <stdio.h>

#include <cstring>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"

namespace {

using idm::mapfile::LineKind;
using oxtest::reported;

// An entry as text: "net=local" or "!net".
std::string show(const idm_mapfile_entry &e) {
    if (e.kind == IDM_ENTRY_DENIAL) return std::string("!") + e.network_id + (e.local_id ? "<local set>" : "");
    return std::string(e.network_id) + "=" + (e.local_id ? e.local_id : "<null>");
}

// An entry list owned by a test.
struct List {
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    ~List() { idm__native_release_entry_list(count, entries); }
    std::vector<std::string> shown() const {
        std::vector<std::string> out;
        for (int32_t i = 0; i < count; ++i) out.push_back(show(entries[i]));
        return out;
    }
};

// Parses `content` (any bytes) as a map file for `mechanism`.
int32_t parse(const std::string &content, List &list, const char *mechanism = "mechA") {
    std::string copy = content;
    FILE *f = fmemopen(copy.empty() ? nullptr : copy.data(), copy.empty() ? 1 : copy.size(), "r");
    if (f == nullptr) {
        ADD_FAILURE() << "fmemopen";
        return -1;
    }
    int32_t status = idm__parse_mapfile(mechanism, "/test/map", f, &list.count, &list.entries);
    std::fclose(f);
    return status;
}

std::string str(size_t n) { return std::to_string(n); }

// A literal with its embedded NUL bytes (without the terminating one).
template <size_t N>
std::string bytes(const char (&s)[N]) {
    return std::string(s, N - 1);
}

class Parser : public oxtest::Test {
  protected:
    void TearDown() override {
        idm_test_fail_alloc(0);
        idm_test_on_secret_free(nullptr);
        oxtest::Test::TearDown();
    }
};

// ---------------------------------------------------------------------------
// The pure line check
// ---------------------------------------------------------------------------

struct LineCase {
    const char *label;
    std::string line;
    LineKind kind;
    const char *network;
    const char *local;
};

const LineCase kLines[] = {
    {"plain affirmative", "mechA:alice.realm1=alice", LineKind::kAffirmative, "alice.realm1", "alice"},
    {"blanks everywhere, rest ignored", "  mechA:  alice.realm1  =  root  extra", LineKind::kAffirmative,
     "alice.realm1", "root"},
    {"text between identifier and '=' ignored", "mechA:alice bob=root", LineKind::kAffirmative, "alice", "root"},
    {"local identifier may hold '='", "mechA:a=b=c", LineKind::kAffirmative, "a", "b=c"},
    {"local identifier may hold '!' and ':'", "mechA:a=!x:y", LineKind::kAffirmative, "a", "!x:y"},
    {"tabs are blanks", "\tmechA:\talice\t=\tbob\tmore", LineKind::kAffirmative, "alice", "bob"},
    {"denial", "mechA:!bob.realm1", LineKind::kDenial, "bob.realm1", ""},
    {"denial with blanks, rest and comment", "mechA: !  bob.realm1 more # note", LineKind::kDenial, "bob.realm1",
     ""},
    {"other mechanism", "mechB:alice=alice", LineKind::kSkipped, "", ""},
    {"selector is case-sensitive", "MECHA:alice=alice", LineKind::kSkipped, "", ""},
    {"blank before the colon", "mechA :alice=alice", LineKind::kSkipped, "", ""},
    {"prefix of the selector", "mech:alice=alice", LineKind::kSkipped, "", ""},
    {"selector longer than the mechanism", "mechAB:alice=alice", LineKind::kSkipped, "", ""},
    {"no colon", "mechA alice=alice", LineKind::kSkipped, "", ""},
    {"empty", "", LineKind::kSkipped, "", ""},
    {"only a line feed", "\n", LineKind::kSkipped, "", ""},
    {"blanks only", " \t \n", LineKind::kSkipped, "", ""},
    {"comment only", "# mechA:alice=bob", LineKind::kSkipped, "", ""},
    {"comment after blanks", "   #x", LineKind::kSkipped, "", ""},
    {"comment leaves no '='", "mechA:alice#=root", LineKind::kInvalid, "", ""},
    {"empty network identifier", "mechA:=alice", LineKind::kInvalid, "", ""},
    {"'=' last", "mechA:alice=", LineKind::kInvalid, "", ""},
    {"blanks only after '='", "mechA:alice= \t ", LineKind::kInvalid, "", ""},
    {"nothing after the colon", "mechA:", LineKind::kInvalid, "", ""},
    {"blanks only after the colon", "mechA: \t", LineKind::kInvalid, "", ""},
    {"no '=' at all", "mechA:alice bob", LineKind::kInvalid, "", ""},
    {"denial with '='", "mechA:!bob=x", LineKind::kInvalid, "", ""},
    {"denial with '=' in the ignored rest", "mechA:!bob x=y", LineKind::kInvalid, "", ""},
    {"bare '!'", "mechA:!", LineKind::kInvalid, "", ""},
    {"'!' then blanks", "mechA:! \t", LineKind::kInvalid, "", ""},
    {"line feed removed", "mechA:a=b\n", LineKind::kAffirmative, "a", "b"},
    {"carriage return is ordinary", "mechA:a=b\r\n", LineKind::kAffirmative, "a", "b\r"},
    {"carriage return after blanks is an identifier", "mechA:a= \r\n", LineKind::kAffirmative, "a", "\r"},
    {"'#' cuts inside the local identifier", "mechA:a=bo#b", LineKind::kAffirmative, "a", "bo"},
    {"'!' inside the network identifier", "mechA:a!b=c", LineKind::kAffirmative, "a!b", "c"},
    {"second colon belongs to the rule", "mechA:x:y=z", LineKind::kAffirmative, "x:y", "z"},
};

TEST_F(Parser, JudgeLineTable) {
    for (const LineCase &c : kLines) {
        SCOPED_TRACE(c.label);
        idm::mapfile::LineVerdict v = idm::mapfile::judge_line("mechA", c.line);
        EXPECT_EQ(v.kind, c.kind);
        if (c.kind == LineKind::kAffirmative || c.kind == LineKind::kDenial) {
            EXPECT_EQ(v.network_id, c.network);
            EXPECT_EQ(v.local_id, c.local);
        }
    }
}

// The same table through the C routines, one selected line at a time, and
// as one file: the file yields the valid lines' entries in line order.
TEST_F(Parser, TableThroughTheParserRoutines) {
    std::string file;
    std::vector<std::string> expected;
    for (const LineCase &c : kLines) {
        SCOPED_TRACE(c.label);
        if (c.line.find('\n') == std::string::npos) file += c.line + "\n";
        else file += c.line;
        if (c.kind == LineKind::kAffirmative) expected.push_back(std::string(c.network) + "=" + c.local);
        if (c.kind == LineKind::kDenial) expected.push_back(std::string("!") + c.network);

        std::string line = c.line;
        if (!line.empty() && line.back() == '\n') line.pop_back();
        if (size_t hash = line.find('#'); hash != std::string::npos) line.resize(hash);
        bool selected = idm__test_entry_mech("mechA", line.c_str()) == 0;
        if (c.kind == LineKind::kSkipped) continue;
        ASSERT_TRUE(selected);
        List list;
        EXPECT_EQ(idm__read_mapfile_entries(line.c_str(), &list.count, &list.entries), 0);
        EXPECT_TRUE(oxtest::nothing_reported());
        if (c.kind == LineKind::kInvalid) {
            EXPECT_EQ(list.count, 0);
            EXPECT_EQ(list.entries, nullptr);
        } else {
            ASSERT_EQ(list.count, 1);
            EXPECT_EQ(list.entries[0].kind, c.kind == LineKind::kDenial ? IDM_ENTRY_DENIAL : IDM_ENTRY_AFFIRMATIVE);
            EXPECT_STREQ(list.entries[0].network_id, c.network);
            if (c.kind == LineKind::kDenial) EXPECT_EQ(list.entries[0].local_id, nullptr);
            else EXPECT_STREQ(list.entries[0].local_id, c.local);
            EXPECT_EQ(list.entries[0].rule_index, 0);
        }
    }
    List list;
    ASSERT_EQ(parse(file, list), 0);
    EXPECT_EQ(list.shown(), expected);
    EXPECT_TRUE(oxtest::nothing_reported());
}

TEST_F(Parser, SelectorTest) {
    struct {
        const char *label;
        const char *mechanism;
        const char *line;
        int32_t result;
    } cases[] = {
        {"exact", "krb5", "krb5:x=y", 0},
        {"leading blanks", "krb5", " \t krb5:x", 0},
        {"no rule needed", "krb5", "krb5:", 0},
        {"case", "krb5", "KRB5:x=y", 1},
        {"shorter selector", "krb5", "krb:x=y", 1},
        {"longer selector", "krb5", "krb55:x=y", 1},
        {"blank before colon", "krb5", "krb5 :x=y", 1},
        {"no colon", "krb5", "krb5", 1},
        {"null mechanism", nullptr, "krb5:x", 1},
        {"null line", "krb5", nullptr, 1},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        EXPECT_EQ(idm__test_entry_mech(c.mechanism, c.line), c.result);
    }
}

// ---------------------------------------------------------------------------
// One selected line: entry contents, arguments, allocation failures
// ---------------------------------------------------------------------------

TEST_F(Parser, EntryTakesTheClockAndZeroedSlots) {
    cux_set_clock(1234567);
    List list;
    ASSERT_EQ(idm__read_mapfile_entries("m:!deny", &list.count, &list.entries), 0);
    ASSERT_EQ(idm__read_mapfile_entries("m:net=local", &list.count, &list.entries), 0);
    ASSERT_EQ(list.count, 2);
    EXPECT_EQ(list.entries[0].read_time, 1234567);
    EXPECT_EQ(list.entries[0].kind, IDM_ENTRY_DENIAL);
    EXPECT_EQ(list.entries[1].kind, IDM_ENTRY_AFFIRMATIVE);
    // Slots not yet used are zero.
    for (int i = 2; i < 10; ++i) {
        EXPECT_EQ(list.entries[i].network_id, nullptr);
        EXPECT_EQ(list.entries[i].read_time, 0);
    }
}

TEST_F(Parser, LineArgumentChecks) {
    idm_mapfile_entry *array = nullptr;
    int32_t count = 0, negative = -1;
    idm_mapfile_entry dummy{};
    idm_mapfile_entry *stray = &dummy;
    const char *empty = "";
    char hex_empty[32], hex_stray_loc[32];
    std::snprintf(hex_empty, sizeof hex_empty, "%x", static_cast<unsigned>(reinterpret_cast<uintptr_t>(empty)));
    std::snprintf(hex_stray_loc, sizeof hex_stray_loc, "%x",
                  static_cast<unsigned>(reinterpret_cast<uintptr_t>(&stray)));
    struct {
        const char *label;
        const char *line;
        int32_t *count;
        idm_mapfile_entry **array;
        std::vector<std::string> inserts;
    } cases[] = {
        {"null line", nullptr, &count, &array, {"idm__read_mapfile_entries", "1", "0"}},
        {"empty line", empty, &count, &array, {"idm__read_mapfile_entries", "1", hex_empty}},
        {"null count", "m:a=b", nullptr, &array, {"idm__read_mapfile_entries", "2", "0"}},
        {"negative count", "m:a=b", &negative, &array, {"idm__read_mapfile_entries", "2", "ffffffff"}},
        {"null array location", "m:a=b", &count, nullptr, {"idm__read_mapfile_entries", "3", "0"}},
        {"array without entries", "m:a=b", &count, &stray, {"idm__read_mapfile_entries", "3", hex_stray_loc}},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::reset_trace();
        oxtest::set_trace_levels(1, 0, 0, 0, 0);
        EXPECT_EQ(idm__read_mapfile_entries(c.line, c.count, c.array), 23);
        EXPECT_TRUE(reported(23, idm::kMsg651, c.inserts));
        EXPECT_EQ(oxtest::trace_ids(), std::vector<int>{59});
    }
    EXPECT_EQ(count, 0);
    EXPECT_EQ(array, nullptr);
}

TEST_F(Parser, LineAllocationFailures) {
    struct {
        const char *label;
        const char *line;
        long fail;
        int32_t returned;
        std::vector<std::string> inserts;
        int trace_id;
    } cases[] = {
        {"network identifier copy", "m:alice=bob", 1, 23, {"idm__read_mapfile_entries", "6"}, 62},
        {"local identifier copy", "m:alice=robert", 2, 23, {"idm__read_mapfile_entries", "7"}, 65},
        {"array creation", "m:alice=bob", 3, 6, {"idm_alloc_entries", str(10 * sizeof(idm_mapfile_entry))}, 61},
        {"denial identifier copy", "m:!mallory", 1, 23, {"idm__read_mapfile_entries", "8"}, 62},
        {"array creation for a denial", "m:!mallory", 2, 6,
         {"idm_alloc_entries", str(10 * sizeof(idm_mapfile_entry))}, 61},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::reset_trace();
        oxtest::set_trace_levels(1, 0, 0, 0, 0);
        List list;
        idm_test_fail_alloc(c.fail);
        EXPECT_EQ(idm__read_mapfile_entries(c.line, &list.count, &list.entries), c.returned);
        EXPECT_EQ(idm_test_alloc_fired(), 1);
        idm_test_fail_alloc(0);
        // The growth failure is recorded with 23 and returned as 6.
        EXPECT_TRUE(reported(23, idm::kMsg658, c.inserts));
        EXPECT_EQ(oxtest::trace_ids(), std::vector<int>{c.trace_id});
        EXPECT_EQ(list.count, 0);
        EXPECT_EQ(list.entries, nullptr);
    }
}

// ---------------------------------------------------------------------------
// Growth
// ---------------------------------------------------------------------------

TEST_F(Parser, GrowsTenSlotsAtATime) {
    List list;
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    for (int i = 0; i < 21; ++i) {
        std::string line = "m:n" + std::to_string(i) + "=l";
        ASSERT_EQ(idm__read_mapfile_entries(line.c_str(), &list.count, &list.entries), 0);
    }
    std::vector<std::pair<int32_t, int32_t>> growth;  // trace 55: count, bytes
    for (const auto &r : oxtest::trace_records())
        if (r.id == 55) growth.emplace_back(r.i32(0), r.i32(1));
    const int32_t e = sizeof(idm_mapfile_entry);
    EXPECT_EQ(growth, (std::vector<std::pair<int32_t, int32_t>>{{0, 10 * e}, {10, 20 * e}, {20, 30 * e}}));
    EXPECT_EQ(list.count, 21);
    EXPECT_STREQ(list.entries[20].network_id, "n20");
}

TEST_F(Parser, GrowthOnlyAtMultiplesOfTen) {
    idm_mapfile_entry *array = nullptr;
    ASSERT_EQ(idm__alloc_entries(0, &array), 0);
    ASSERT_NE(array, nullptr);
    idm_mapfile_entry *before = array;
    idm_test_fail_alloc(1);
    for (int32_t c = 1; c < 10; ++c) EXPECT_EQ(idm__alloc_entries(c, &array), 0);
    EXPECT_EQ(idm_test_alloc_fired(), 0);
    EXPECT_EQ(array, before);
    // A failed enlargement leaves the array as it was.
    EXPECT_EQ(idm__alloc_entries(10, &array), 6);
    EXPECT_TRUE(reported(23, idm::kMsg658, {"idm_alloc_entries", str(20 * sizeof(idm_mapfile_entry))}));
    EXPECT_EQ(array, before);
    std::free(array);
}

// A failure inside a line stops the file; what was appended stays.
TEST_F(Parser, FailureAtTheEleventhEntryKeepsTheFirstTen) {
    std::string file;
    for (int i = 0; i < 12; ++i) file += "mechA:n" + std::to_string(i) + "=l\n";
    // Entry k allocates its two copies, and the array before entries 1 and 11.
    const long eleventh_growth = 3 + 9 * 2 + 3;
    List list;
    idm_test_fail_alloc(eleventh_growth);
    EXPECT_EQ(parse(file, list), 6);
    EXPECT_EQ(idm_test_alloc_fired(), 1);
    EXPECT_TRUE(reported(23, idm::kMsg658, {"idm_alloc_entries", str(20 * sizeof(idm_mapfile_entry))}));
    ASSERT_EQ(list.count, 10);
    EXPECT_STREQ(list.entries[9].network_id, "n9");
}

// ---------------------------------------------------------------------------
// Whole streams
// ---------------------------------------------------------------------------

TEST_F(Parser, EmptyAndCommentOnlyFiles) {
    for (const char *content : {"", "\n\n", "# only\n  # comments\n\t\n", "mechB:a=b\nMECHA:a=b\n"}) {
        SCOPED_TRACE(content);
        List list;
        EXPECT_EQ(parse(content, list), 0);
        EXPECT_EQ(list.count, 0);
        EXPECT_EQ(list.entries, nullptr);
    }
}

TEST_F(Parser, LongLineIsSplitAfter1023Characters) {
    struct {
        const char *label;
        const char *mechanism;
        std::string line;
        std::vector<std::string> expected;
    } cases[] = {
        // 1030 characters: the identifier is cut at character 1023, the last
        // 7 characters are a line of their own (skipped: no selector).
        {"rest skipped", "mechA", "mechA:net=" + std::string(1013, 'L') + "ABCDEFG",
         {"net=" + std::string(1013, 'L')}},
        // Here the 7 characters are a valid line themselves.
        {"rest is a line", "m", "m:net=" + std::string(1017, 'L') + "m:ab=cd",
         {"net=" + std::string(1017, 'L'), "ab=cd"}},
        // Exactly 1023 characters and its line feed: one line.
        {"1023 characters", "mechA", "mechA:net=" + std::string(1013, 'L'), {"net=" + std::string(1013, 'L')}},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        List list;
        ASSERT_EQ(parse(c.line + "\n" + std::string(c.mechanism) + ":after=x\n", list, c.mechanism), 0);
        std::vector<std::string> expected = c.expected;
        expected.push_back("after=x");
        EXPECT_EQ(list.shown(), expected);
    }
}

TEST_F(Parser, CarriageReturnStaysInTheLastIdentifier) {
    List list;
    ASSERT_EQ(parse("mechA:a=b\r\nmechA:!c\r\nmechA:d=e f\r\n", list), 0);
    EXPECT_EQ(list.shown(), (std::vector<std::string>{"a=b\r", "!c\r", "d=e"}));
}

TEST_F(Parser, NulBytesAndBinaryJunk) {
    std::string junk = bytes("mechA:a=b\0hidden=x\nmechA:c=d\n");
    junk += bytes("\xff\xfe\x00\x01mechA:z=z\n");
    junk += bytes("\0mechA:y=y\n");
    junk += "mechA:\x80\x81=\xc3\xa9\n";
    for (int i = 0; i < 256; ++i) junk += static_cast<char>((i * 37) & 0xff);
    junk += "\nmechA:last=one";  // no final line feed
    List list;
    ASSERT_EQ(parse(junk, list), 0);
    // Text after a NUL byte is not part of its line.
    EXPECT_EQ(list.shown(), (std::vector<std::string>{"a=b", "c=d", "\x80\x81=\xc3\xa9", "last=one"}));
}

TEST_F(Parser, DiagnosticTraceOfAFile) {
    oxtest::set_trace_levels(0, 0, 0, 0, 1);
    List list;
    ASSERT_EQ(parse("\n# c\nmechB:x=y\nmechA:bad\nmechA:!d\n", list), 0);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{42, 43, 44, 43, 45, 43, 45, 43, 56, 43, 55, 58, 46}));
    const auto records = oxtest::trace_records();
    EXPECT_EQ(records[0].text(0), "/test/map");
    EXPECT_EQ(records[0].text(1), "mechA");
    EXPECT_EQ(records[7].text(0), "mechA:bad\n");
    EXPECT_EQ(records[11].text(1), "Denial of mapping");
    EXPECT_EQ(records[11].text(2), "d");
    EXPECT_EQ(records[11].text(3), "");
}

TEST_F(Parser, ApiTraceOfALine) {
    int32_t count = 0;
    idm_mapfile_entry *array = nullptr;
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    ASSERT_EQ(idm__read_mapfile_entries("m:a=b", &count, &array), 0);
    EXPECT_EQ(oxtest::trace_ids(), (std::vector<int>{48, 51}));
    oxtest::reset_trace();
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    ASSERT_EQ(idm__read_mapfile_entries("m:c=d", &count, &array), 0);
    const auto r = oxtest::trace_records();
    ASSERT_EQ(r.size(), 2u);
    EXPECT_EQ(r[0].id, 50);
    EXPECT_EQ(r[0].text(0), "m:c=d");
    EXPECT_EQ(r[0].i32(1), 1);
    EXPECT_EQ(r[0].u64(2), reinterpret_cast<uint64_t>(&array));
    EXPECT_EQ(r[1].id, 53);
    EXPECT_EQ(r[1].i32(0), 0);
    idm__native_release_entry_list(count, array);
}

TEST_F(Parser, ParseArgumentChecks) {
    List list;
    char text[] = "m:a=b\n";
    FILE *f = fmemopen(text, sizeof text - 1, "r");
    ASSERT_NE(f, nullptr);
    struct {
        const char *label;
        const char *mechanism;
        const char *path;
        FILE *stream;
        int32_t *count;
        idm_mapfile_entry **array;
        const char *position;
    } cases[] = {
        {"null mechanism", nullptr, "/p", f, &list.count, &list.entries, "1"},
        {"empty mechanism", "", "/p", f, &list.count, &list.entries, "1"},
        {"null path", "m", nullptr, f, &list.count, &list.entries, "2"},
        {"empty path", "m", "", f, &list.count, &list.entries, "2"},
        {"null stream", "m", "/p", nullptr, &list.count, &list.entries, "3"},
        {"null count", "m", "/p", f, nullptr, &list.entries, "4"},
        {"null array location", "m", "/p", f, &list.count, nullptr, "5"},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::clear_errors();
        EXPECT_EQ(idm__parse_mapfile(c.mechanism, c.path, c.stream, c.count, c.array), 23);
        ASSERT_TRUE(cux_error_pending());
        auto e = oxtest::last_error();
        EXPECT_EQ(e.msgno, idm::kMsg651);
        ASSERT_EQ(e.inserts.size(), 3u);
        EXPECT_EQ(e.inserts[0], "idm__parse_mapfile");
        EXPECT_EQ(e.inserts[1], c.position);
    }
    std::fclose(f);
}

// A million lines, every other one an entry for the mechanism.
TEST_F(Parser, MillionLineFile) {
    const int lines = 1000000, every = 2;
    std::string content;
    content.reserve(static_cast<size_t>(lines) * 24);
    for (int i = 0; i < lines; ++i) {
        content += (i % every == 0) ? "mechA:user" : "mechB:user";
        content += std::to_string(i);
        content += "=local\n";
    }
    List list;
    ASSERT_EQ(parse(content, list), 0);
    ASSERT_EQ(list.count, lines / every);
    EXPECT_STREQ(list.entries[0].network_id, "user0");
    EXPECT_STREQ(list.entries[list.count - 1].network_id, ("user" + std::to_string(lines - every)).c_str());
    EXPECT_STREQ(list.entries[list.count - 1].local_id, "local");
}

// ---------------------------------------------------------------------------
// Release
// ---------------------------------------------------------------------------

std::vector<std::string> *g_freed = nullptr;
void note_freed(const void *p, size_t n) {
    const char *c = static_cast<const char *>(p);
    bool zero = true;
    for (size_t i = 0; i < n; ++i) zero = zero && c[i] == 0;
    g_freed->push_back(std::to_string(n) + (zero ? " zeroed" : " NOT zeroed"));
}

TEST_F(Parser, ReleaseZeroesIdentifiers) {
    std::vector<std::string> freed;
    g_freed = &freed;
    int32_t count = 0;
    idm_mapfile_entry *array = nullptr;
    ASSERT_EQ(idm__read_mapfile_entries("m:alice=bob", &count, &array), 0);
    ASSERT_EQ(idm__read_mapfile_entries("m:!carol", &count, &array), 0);
    idm_test_on_secret_free(note_freed);
    idm__native_release_entry_list(0, array);  // count below 1: nothing
    idm__native_release_entry_list(2, nullptr);
    EXPECT_TRUE(freed.empty());
    idm__native_release_entry_list(count, array);
    EXPECT_EQ(freed, (std::vector<std::string>{"6 zeroed", "4 zeroed", "6 zeroed"}));
}

TEST_F(Parser, EntriesCleanupHandler) {
    std::vector<std::string> freed;
    g_freed = &freed;
    idm_entry_list list{nullptr, 0};
    idm__thread_cleanup_entries(nullptr);
    idm__thread_cleanup_entries(&list);
    ASSERT_EQ(idm__read_mapfile_entries("m:abc=de", &list.count, &list.entries), 0);
    idm_test_on_secret_free(note_freed);
    idm__thread_cleanup_entries(&list);
    EXPECT_EQ(freed, (std::vector<std::string>{"4 zeroed", "3 zeroed"}));
    EXPECT_EQ(list.entries, nullptr);
    EXPECT_EQ(list.count, 0);
}

}  // namespace
