// The exported mapping entry points through the shipped library: argument
// checks in their order, the reported message and inserts, trace records at
// each API level, and the pending-error rule of trace registration.
#include <cstring>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm.h"

namespace {

using oxtest::reported;
using oxtest::trace_records;

constexpr int kMsg650 = 271;

int32_t translator_a(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cleanup_a(idm_rule *, idm_id *) { return 0; }
int32_t translator_b(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cleanup_b(idm_rule *, idm_id *) { return 0; }

std::string hex(const void *p) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%x", static_cast<unsigned>(reinterpret_cast<uintptr_t>(p)));
    return buf;
}

class FrontEnd : public oxtest::Test {};

struct RegisterCase {
    const char *label;
    int32_t type;
    const char *mnemonic;
    idm_translator_routine translator;
    idm_cleanup_routine cleanup;
    int position;
};

TEST_F(FrontEnd, RegisterChecksArgumentsInOrder) {
    static const char kEmpty[] = "";
    const RegisterCase cases[] = {
        {"type 0", 0, "mech", translator_a, cleanup_a, 1},
        {"type 2 with all else valid", 2, "mech", translator_a, cleanup_a, 1},
        {"type -1 and everything null", -1, nullptr, nullptr, nullptr, 1},
        {"null mnemonic", 1, nullptr, translator_a, cleanup_a, 2},
        {"empty mnemonic", 1, kEmpty, translator_a, cleanup_a, 2},
        {"null translator", 1, "mech", nullptr, cleanup_a, 3},
        {"both routines null reports position 3 only", 1, "mech", nullptr, nullptr, 3},
        {"null cleanup", 1, "mech", translator_a, nullptr, 4},
    };
    for (const RegisterCase &c : cases) {
        SCOPED_TRACE(c.label);
        oxtest::clear_errors();
        EXPECT_EQ(sec_idm_register_translator(c.type, c.mnemonic, c.translator, c.cleanup), 4);
        std::string value = "0";
        if (c.position == 1) value = hex(reinterpret_cast<const void *>(static_cast<intptr_t>(c.type)));
        if (c.position == 2) value = hex(c.mnemonic);
        EXPECT_TRUE(reported(4, kMsg650, {"sec_idm_register_translator", std::to_string(c.position), value}));
        EXPECT_EQ(oxtest::reports_since_clear(), 1u) << "exactly one report per failure";
    }
}

TEST_F(FrontEnd, MapIdentityChecksArgumentsInOrderAndLeavesBufferOnError) {
    static const char kEmpty[] = "";
    idm_buffer sentinel{77, const_cast<char *>("untouched")};
    struct Case {
        const char *label;
        const char *mnemonic;
        const char *identity;
        bool buffer;
        int position;
    } cases[] = {
        {"null mnemonic", nullptr, "id", true, 1},
        {"empty mnemonic", kEmpty, "id", true, 1},
        {"null identity", "mech", nullptr, true, 2},
        {"empty identity", "mech", kEmpty, true, 2},
        {"null buffer", "mech", "id", false, 3},
        {"all null reports the mnemonic", nullptr, nullptr, false, 1},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        idm_buffer buf = sentinel;
        EXPECT_EQ(sec_idm_map_identity(c.mnemonic, c.identity, c.buffer ? &buf : nullptr), 4);
        std::string value = c.position == 1 ? hex(c.mnemonic) : c.position == 2 ? hex(c.identity) : "0";
        EXPECT_TRUE(reported(4, kMsg650, {"sec_idm_map_identity", std::to_string(c.position), value}));
        EXPECT_EQ(buf.length, 77u);
        EXPECT_STREQ(buf.value, "untouched");
    }
}

TEST_F(FrontEnd, MapIdentityClearsBufferBeforeTheService) {
    idm_buffer buf{77, const_cast<char *>("stale")};
    EXPECT_EQ(sec_idm_map_identity("nobody-registered", "alice", &buf), 22);
    EXPECT_EQ(buf.length, 0u);
    EXPECT_EQ(buf.value, nullptr);
    EXPECT_EQ(oxtest::last_error().msgno, 281);
    EXPECT_EQ(oxtest::last_error().inserts, std::vector<std::string>{"nobody-registered"});
}

TEST_F(FrontEnd, GetGroupsChecksArgumentsInOrder) {
    char name[] = "root";
    idm_buffer good{5, name};
    idm_buffer zero_length{0, name};
    idm_buffer null_value{5, nullptr};
    uint32_t count = 99;
    idm_buffer *list = reinterpret_cast<idm_buffer *>(0x1);
    struct Case {
        const char *label;
        idm_buffer *user;
        uint32_t *count;
        idm_buffer **list;
        int position;
    } cases[] = {
        {"null user", nullptr, &count, &list, 1},
        {"length 0 with a value", &zero_length, &count, &list, 1},
        {"null value", &null_value, &count, &list, 1},
        {"null count", &good, nullptr, &list, 2},
        {"null list", &good, &count, nullptr, 3},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        EXPECT_EQ(sec_idm_get_groups(c.user, c.count, c.list), 4);
        std::string value = c.position == 1 ? hex(c.user) : "0";
        EXPECT_TRUE(reported(4, kMsg650, {"sec_idm_get_groups", std::to_string(c.position), value}));
        EXPECT_EQ(count, 99u) << "outputs are the service's to set";
        EXPECT_EQ(list, reinterpret_cast<idm_buffer *>(0x1));
    }
}

TEST_F(FrontEnd, GetTranslatorBeforeAnyOtherCall) {
    idm_translator_routine t = translator_b;
    idm_cleanup_routine c = cleanup_b;
    EXPECT_EQ(_sec_idm_get_translator("mech", &t, &c), 0);
    EXPECT_EQ(t, translator_b) << "outputs untouched when nothing is registered";
    EXPECT_EQ(c, cleanup_b);
    EXPECT_EQ(trx_registrations("_SEI"), 0) << "no once-control, no trace point";
    EXPECT_EQ(_sec_idm_get_translator("mech", nullptr, &c), 4);
    EXPECT_EQ(_sec_idm_get_translator("mech", &t, nullptr), 4);
    EXPECT_TRUE(oxtest::nothing_reported());
    EXPECT_EQ(trx_count(), 0u);
}

TEST_F(FrontEnd, RegistryReplacesRoutinesAndKeepsCaseDistinctRecords) {
    EXPECT_EQ(sec_idm_register_translator(1, "mech", translator_a, cleanup_a), 0);
    EXPECT_EQ(sec_idm_register_translator(1, "mech", translator_b, cleanup_b), 0);
    EXPECT_EQ(sec_idm_register_translator(1, "MECH", translator_a, cleanup_a), 0);
    idm_translator_routine t = nullptr;
    idm_cleanup_routine c = nullptr;
    EXPECT_EQ(_sec_idm_get_translator("mech", &t, &c), 0);
    EXPECT_EQ(t, translator_b);
    EXPECT_EQ(c, cleanup_b);
    EXPECT_EQ(_sec_idm_get_translator("MECH", &t, &c), 0);
    EXPECT_EQ(t, translator_a);
    t = nullptr;
    c = nullptr;
    EXPECT_EQ(_sec_idm_get_translator("mec", &t, &c), 0);
    EXPECT_EQ(t, nullptr);
    EXPECT_EQ(c, nullptr);
    // translator_count is the second word of the exit record 92.
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    EXPECT_EQ(sec_idm_register_translator(1, "mech", translator_a, cleanup_a), 0);
    auto records = trace_records();
    ASSERT_EQ(records.size(), 4u);
    EXPECT_EQ(records.back().id, 92);
    EXPECT_EQ(records.back().i32(0), 0);
    EXPECT_EQ(records.back().i32(1), 0) << "reserved";
    EXPECT_EQ(records.back().i32(2), 2) << "two records: mech and MECH";
}

// Trace records of each exported function at each API level.
TEST_F(FrontEnd, TraceLevels) {
    char user[] = "x";
    idm_buffer ubuf{2, user};
    uint32_t count;
    idm_buffer *list;
    idm_buffer out;
    auto run = [&] {
        trx_clear();
        sec_idm_register_translator(2, nullptr, nullptr, nullptr);
        sec_idm_map_identity(nullptr, "id", &out);
        sec_idm_get_groups(nullptr, &count, &list);
        return oxtest::trace_ids();
    };
    EXPECT_EQ(run(), std::vector<int>{}) << "level 0 records nothing";
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    EXPECT_EQ(run(), (std::vector<int>{88, 91, 93, 96, 98, 101}));
    for (unsigned char level = 2; level < 8; ++level) {
        oxtest::set_trace_levels(0, level, 0, 0, 0);
        EXPECT_EQ(run(), std::vector<int>{}) << "API level " << int(level);
    }
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    EXPECT_EQ(run(), (std::vector<int>{90, 92, 95, 97, 100, 102}));
    (void)ubuf;
}

TEST_F(FrontEnd, Level8ItemsOfRegistration) {
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    EXPECT_EQ(sec_idm_register_translator(2, nullptr, translator_a, cleanup_a), 4);
    auto r = trace_records();
    // The first front-end call initialises the library, which sets up the
    // cluster map (bare ids 148 and 149 at API level 1 or 8).
    ASSERT_EQ(oxtest::trace_ids(), (std::vector<int>{90, 148, 149, 92}));
    r.erase(r.begin() + 1, r.begin() + 3);
    EXPECT_EQ(r[0].id, 90);
    ASSERT_EQ(r[0].items.size(), 4u);
    EXPECT_EQ(r[0].i32(0), 2);
    EXPECT_EQ(r[0].items[1], std::string("<null>", 7)) << "null mnemonic recorded as \"<null>\" with its NUL";
    EXPECT_EQ(r[0].u64(2), reinterpret_cast<uint64_t>(translator_a));
    EXPECT_EQ(r[0].u64(3), reinterpret_cast<uint64_t>(cleanup_a));
    EXPECT_EQ(r[1].id, 92);
    ASSERT_EQ(r[1].items.size(), 3u);
    EXPECT_EQ(r[1].i32(0), 4);
    EXPECT_EQ(r[1].i32(1), -1) << "state words are -1 for an invalid type";
    EXPECT_EQ(r[1].i32(2), -1);
}

TEST_F(FrontEnd, Level8ItemsOfMappingAndGroups) {
    idm_buffer out;
    sec_idm_map_identity(nullptr, nullptr, nullptr);  // initialisation, untraced
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    EXPECT_EQ(sec_idm_map_identity("m", nullptr, &out), 4);
    uint32_t count;
    idm_buffer *list;
    EXPECT_EQ(sec_idm_get_groups(nullptr, &count, &list), 4);
    auto r = trace_records();
    ASSERT_EQ(r.size(), 4u);
    EXPECT_EQ(r[0].id, 95);
    EXPECT_EQ(r[0].text(0), "m");
    EXPECT_EQ(r[0].text(1), "<null>");
    EXPECT_EQ(r[0].u64(2), reinterpret_cast<uint64_t>(&out));
    EXPECT_EQ(r[1].id, 97);
    EXPECT_EQ(r[1].i32(0), 4);
    EXPECT_EQ(r[1].i32(1), 0) << "first word of the native state";
    EXPECT_EQ(r[2].id, 100);
    EXPECT_EQ(r[2].u64(0), 0u);
    EXPECT_EQ(r[2].u64(1), reinterpret_cast<uint64_t>(&count));
    EXPECT_EQ(r[2].u64(2), reinterpret_cast<uint64_t>(&list));
    EXPECT_EQ(r[3].id, 102);
    EXPECT_EQ(r[3].items.size(), 1u);
    EXPECT_EQ(r[3].i32(0), 4);
}

// An error pending before the first trace point is current after registration.
TEST_F(FrontEnd, RegistrationKeepsPendingError) {
    ASSERT_EQ(trx_registrations("_SEI"), 0);
    cu_set_error_1(99, 0, "other.cat", 3, 17, "pending %1$s", "before");
    idm_translator_routine t = nullptr;
    idm_cleanup_routine c = nullptr;
    _sec_idm_get_translator("x", &t, &c);  // runs no trace point
    EXPECT_EQ(sec_idm_register_translator(1, "x", translator_a, cleanup_a), 0);
    EXPECT_EQ(trx_registrations("_SEI"), 1);
    EXPECT_EQ(cux_error_status(), 99);
    EXPECT_EQ(cux_error_msgno(), 17);
    EXPECT_STREQ(cux_error_text(), "pending before");
    EXPECT_EQ(cux_handles_live(), 1u) << "the library does not release the handle itself";
}

TEST_F(FrontEnd, RegistrationCategories) {
    sec_idm_register_translator(2, nullptr, nullptr, nullptr);
    const char *names[] = {"Error", "API", "Mapping", "Milestone", "Diag"};
    for (int i = 0; i < 5; ++i) EXPECT_STREQ(trx_category_name("_SEI", i), names[i]);
    EXPECT_EQ(trx_category_name("_SEI", 5), nullptr);
    EXPECT_EQ(trx_unregistrations("_SEI"), 0);
}

TEST_F(FrontEnd, FullMessageTextOfBadParameter) {
    EXPECT_EQ(sec_idm_register_translator(7, "m", translator_a, cleanup_a), 4);
    EXPECT_STREQ(cux_error_text(),
                 "2650-650 libox_idm Failure: Incorrect parameters detected.\n\t Detecting function name: "
                 "sec_idm_register_translator\n\t Positional parameter in error: 1\n\t Value of parameter: 0x7\n"
                 "Verify that the application is providing the correct parameters to this\nfunction, and correct "
                 "the application to pass valid parameters.\n");
}

}  // namespace

extern "C" int c_abi_check(void);
TEST(CAbi, HeaderCompilesAsCWithTheSevenFunctions) { EXPECT_EQ(c_abi_check(), 1); }
