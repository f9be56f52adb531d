// The exported mapping entry points through the shipped library: the result
// buffer cleared before the service runs, dispatch to the native service, the
// translator registry as _sec_idm_get_translator shows it (and an error pending
// before the first call kept current), the exit records that carry the
// service's state words, and the header compiled as C.
#include <vector>

#include "harness.h"
#include "oxidm.h"
#include "oxidm_tracepoints.h"
#include "oxseclib_msg.h"

namespace {

int32_t translator_a(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cleanup_a(idm_rule *, idm_id *) { return 0; }
int32_t translator_b(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cleanup_b(idm_rule *, idm_id *) { return 0; }

TEST(FrontEnd, MappingClearsTheBufferAndGroupsReachTheService) {
    idm_buffer buf{77, const_cast<char *>("stale")};
    EXPECT_EQ(sec_idm_map_identity("nobody-registered", "alice", &buf), IDM_E_NO_TRANSLATOR);
    EXPECT_TRUE(buf.length == 0 && buf.value == nullptr);
    EXPECT_TRUE(oxtest::reported(IDM_E_NO_TRANSLATOR, idm::kMsg660, {"nobody-registered"}));
    idm_buffer user{14, const_cast<char *>("no-such-user!")}, *groups = &buf;
    uint32_t count = 5;
    EXPECT_EQ(sec_idm_get_groups(&user, &count, &groups), IDM_E_GROUPS);
    EXPECT_TRUE(oxtest::reported(IDM_E_GROUPS, idm::kMsg698, {"no-such-user!"}));
    EXPECT_TRUE(count == 0 && groups == nullptr);
}

TEST(FrontEnd, RegistryReplacesRoutinesAndKeepsCaseDistinctRecords) {
    cu_set_error_1(99, 0, "other.cat", 3, 17, "pending %1$s", "before");
    idm_translator_routine t = translator_b;
    idm_cleanup_routine c = cleanup_b;
    EXPECT_EQ(_sec_idm_get_translator("mech", &t, &c), 0);  // before any other call
    EXPECT_TRUE(t == translator_b && c == cleanup_b) << "untouched when nothing is registered";
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

// The exit records are the only place where the native service's state words
// (reserved, translator count) show, also before the service ran at all.
TEST(FrontEnd, ExitRecordsCarryTheServiceStateWords) {
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    sec_idm_register_translator(1, nullptr, translator_a, cleanup_a);  // refused: the service is not called
    sec_idm_register_translator(1, "m", translator_a, cleanup_a);
    idm_buffer out{};
    sec_idm_map_identity("x", "id", &out);
    std::vector<int> words;  // status and state words of each exit record
    for (const oxtest::TraceRecord &r : oxtest::trace_records()) {
        const size_t n = r.id == idm::trace::tp::kRegisterExitData ? 3 : r.id == idm::trace::tp::kMapExitData ? 2 : 0;
        for (size_t j = 0; j < n; ++j) words.push_back(r.i32(j));
    }
    EXPECT_EQ(words, (std::vector<int>{IDM_E_BAD_PARAMETER, 0, 0, IDM_OK, 0, 1, IDM_E_NO_TRANSLATOR, 0}));
}

}  // namespace

extern "C" int c_abi_check(void);
TEST(CAbi, HeaderCompilesAsCWithTheSevenFunctions) { EXPECT_EQ(c_abi_check(), 1); }
