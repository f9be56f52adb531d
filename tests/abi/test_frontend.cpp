// The exported mapping entry points through the shipped library: the result
// buffer cleared before the service runs, dispatch to the native service, the
// translator registry as _sec_idm_get_translator shows it (and an error pending
// before the first call kept current), the API records that carry the service's
// state words, and the header compiled as C.
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm.h"

namespace {

int32_t translator_a(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cleanup_a(idm_rule *, idm_id *) { return 0; }
int32_t translator_b(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cleanup_b(idm_rule *, idm_id *) { return 0; }

TEST(FrontEnd, MappingClearsTheBufferAndGroupsReachTheService) {
    idm_buffer buf{77, const_cast<char *>("stale")};
    EXPECT_EQ(sec_idm_map_identity("nobody-registered", "alice", &buf), 22);
    EXPECT_TRUE(buf.length == 0 && buf.value == nullptr);
    EXPECT_TRUE(oxtest::reported(22, 281, {"nobody-registered"}));  // 2650-660
    idm_buffer user{14, const_cast<char *>("no-such-user!")}, *groups = &buf;
    uint32_t count = 5;
    EXPECT_EQ(sec_idm_get_groups(&user, &count, &groups), 15);
    EXPECT_TRUE(oxtest::reported(15, 323, {"no-such-user!"}));  // 2650-698
    EXPECT_TRUE(count == 0 && groups == nullptr);
}

TEST(FrontEnd, RegistryReplacesRoutinesAndKeepsCaseDistinctRecords) {
    cu_set_error_1(99, 0, "other.cat", 3, 17, "pending %1$s", "before");
    idm_translator_routine t = translator_b;
    idm_cleanup_routine c = cleanup_b;
    EXPECT_EQ(_sec_idm_get_translator("mech", &t, &c), 0);  // before any other call
    EXPECT_TRUE(t == translator_b && c == cleanup_b) << "untouched when nothing is registered";
    EXPECT_EQ(trx_registrations("_SEI"), 0) << "no once-control, no trace point";
    EXPECT_EQ(sec_idm_register_translator(1, "mech", translator_a, cleanup_a), 0);
    EXPECT_STREQ(cux_error_text(), "pending before") << "an error pending before the first call stays current";
    EXPECT_EQ(sec_idm_register_translator(1, "mech", translator_b, cleanup_b), 0);
    EXPECT_EQ(sec_idm_register_translator(1, "MECH", translator_a, cleanup_a), 0);
    struct { const char *mnemonic; idm_translator_routine t; idm_cleanup_routine c; } rows[] = {
        {"mech", translator_b, cleanup_b}, {"MECH", translator_a, cleanup_a}, {"mec", nullptr, nullptr}};
    for (const auto &r : rows) {
        t = nullptr, c = nullptr;
        EXPECT_EQ(_sec_idm_get_translator(r.mnemonic, &t, &c), 0);
        EXPECT_TRUE(t == r.t && c == r.c) << r.mnemonic;
    }
}

// The API records of the front end and of the native service under it, the
// only place where the service's two state words (reserved, translators) show,
// also before the service ran at all.
TEST(FrontEnd, ApiRecordsAtLevelsEightAndOne) {
    idm_buffer out{}, *groups;
    uint32_t count;
    auto run = [&](unsigned char level) {
        oxtest::reset_trace();
        oxtest::set_trace_levels(0, level, 0, 0, 0);
        sec_idm_register_translator(1, nullptr, translator_a, cleanup_a);  // refused: the service is not called
        sec_idm_register_translator(1, "m", translator_a, cleanup_a);
        sec_idm_map_identity("x", "id", &out);
        sec_idm_get_groups(nullptr, &count, &groups);
        return oxtest::trace_ids();
    };
    EXPECT_EQ(run(8), (std::vector<int>{90, 148, 149, 92, 90, 105, 107, 92, 95, 110, 112, 97, 100, 102}));
    const auto r = oxtest::trace_records();
    EXPECT_EQ(std::vector<int>({r[3].i32(1), r[3].i32(2), r[7].i32(0), r[7].i32(1), r[7].i32(2), r[11].i32(0),
                                r[11].i32(1)}), std::vector<int>({0, 0, 0, 0, 1, 22, 0}));
    EXPECT_EQ(run(1), (std::vector<int>{88, 91, 88, 103, 106, 91, 93, 108, 111, 96, 98, 101}));
}

}  // namespace

extern "C" int c_abi_check(void);
TEST(CAbi, HeaderCompilesAsCWithTheSevenFunctions) { EXPECT_EQ(c_abi_check(), 1); }
