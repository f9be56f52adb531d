// Translator registry failure paths (reached through the fault seam of the
// internal build), concurrent registration, the message table.
#include <pthread.h>

#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"

namespace {

using oxtest::reported;

int32_t translator_a(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cleanup_a(idm_rule *, idm_id *) { return 0; }
int32_t translator_b(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cleanup_b(idm_rule *, idm_id *) { return 0; }

class Registry : public oxtest::Test {
  protected:
    void TearDown() override {
        idm_test_fail_alloc(0);
        idm_test_fail_mutex_init(0);
        oxtest::Test::TearDown();
    }
};

std::string str(size_t n) { return std::to_string(n); }

TEST_F(Registry, FailuresLeaveTheListUnchangedAndALaterRegistrationSucceeds) {
    struct Case {
        const char *label;
        long fail_alloc;
        int mutex_result;
        int status;
        int msgno;
        std::vector<std::string> inserts;
    } cases[] = {
        {"record allocation", 1, 0, 6, idm::kMsg654, {"idm__native_register_translator", str(sizeof(idm_translator))}},
        {"mnemonic copy", 2, 0, 6, idm::kMsg654, {"idm__native_register_translator", "9"}},
        {"mutex ENOMEM", 0, ENOMEM, 6, idm::kMsg654, {"idm__native_register_translator", str(sizeof(pthread_mutex_t))}},
        {"mutex EAGAIN", 0, EAGAIN, 23, idm::kMsg661, {"idm__native_register_translator"}},
        {"mutex other", 0, EINVAL, 23, idm::kMsg655, {"pthread_mutex_init", str(EINVAL), "idm__native_register_translator"}},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.label);
        idm_test_fail_alloc(c.fail_alloc);
        idm_test_fail_mutex_init(c.mutex_result);
        EXPECT_EQ(sec_idm_register_translator(1, "mnemonic", translator_a, cleanup_a), c.status);
        EXPECT_TRUE(reported(c.status, c.msgno, c.inserts));
        idm_test_fail_alloc(0);
        idm_test_fail_mutex_init(0);
        EXPECT_EQ(idm__native_state.translator_count, 0u);
        EXPECT_EQ(idm__native_state.translators, nullptr);
    }
    EXPECT_EQ(sec_idm_register_translator(1, "mnemonic", translator_a, cleanup_a), 0);
    EXPECT_EQ(idm__native_state.translator_count, 1u);
    // A replacement allocates nothing, so it cannot fail.
    idm_test_fail_alloc(1);
    EXPECT_EQ(sec_idm_register_translator(1, "mnemonic", translator_b, cleanup_b), 0);
    EXPECT_EQ(idm_test_alloc_fired(), 0);
}

TEST_F(Registry, NewestRecordFirstAndMappingLookup) {
    for (const char *m : {"one", "two", "three"}) ASSERT_EQ(sec_idm_register_translator(1, m, translator_a, cleanup_a), 0);
    ASSERT_NE(idm__native_state.translators, nullptr);
    EXPECT_STREQ(idm__native_state.translators->mnemonic, "three");
    EXPECT_STREQ(idm__native_state.translators->next->next->mnemonic, "one");
    EXPECT_EQ(idm__native_find_translator("two"), idm__native_state.translators->next);
    EXPECT_EQ(idm__native_find_translator("Two"), nullptr);
    EXPECT_EQ(idm__native_state.translator_count, 3u);
}

// Two threads registering the same new mnemonic at once make one record.
TEST_F(Registry, ConcurrentRegistrationOfOneMnemonic) {
    for (int round = 0; round < 50; ++round) {
        std::string mnemonic = "m" + std::to_string(round);
        pthread_barrier_t barrier;
        pthread_barrier_init(&barrier, nullptr, 2);
        auto reg = [&](idm_translator_routine t) {
            pthread_barrier_wait(&barrier);
            EXPECT_EQ(sec_idm_register_translator(1, mnemonic.c_str(), t, cleanup_a), 0);
        };
        std::thread a(reg, translator_a), b(reg, translator_b);
        a.join();
        b.join();
        pthread_barrier_destroy(&barrier);
        EXPECT_EQ(idm__native_state.translator_count, static_cast<uint32_t>(round + 1));
    }
}

TEST_F(Registry, MappingTypeValid) {
    EXPECT_EQ(idm__mapping_type_valid(1), 1);
    for (int t : {0, 2, -1, 1 << 16}) EXPECT_EQ(idm__mapping_type_valid(t), 0) << t;
}

TEST_F(Registry, FirstCallsRunInitialisationOnce) {
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i)
        threads.emplace_back([] { sec_idm_register_translator(2, nullptr, nullptr, nullptr); });
    for (auto &t : threads) t.join();
    EXPECT_EQ(idm__state.mapping_type, 1u);
    EXPECT_EQ(idm__state.services[0].state, &idm__native_state);
    EXPECT_EQ(trx_registrations("_SEI"), 1);
}

struct ExpectedMessage {
    int number;
    const char *id;
    const char *text;
};
const ExpectedMessage kReported[] = {
#include "expected_messages.inc"
};

TEST(MessageTable, ReportedEntriesAndNoNullEntry) {
    EXPECT_STREQ(cu_mesgtbl_oxseclib_msg[0], "Reserved: DO NOT USE!");
    for (int i = 0; i < OXSECLIB_MSG_COUNT; ++i) ASSERT_NE(cu_mesgtbl_oxseclib_msg[i], nullptr) << i;
    EXPECT_EQ(sizeof(kReported) / sizeof(kReported[0]), 24u);
    for (const ExpectedMessage &m : kReported) EXPECT_STREQ(cu_mesgtbl_oxseclib_msg[m.number], m.text) << m.id;
    EXPECT_STREQ(cu_badid_oxseclib_msg, "Bad message id for message set oxseclib_msg");
}

TEST_F(Registry, RoutineEndAndDumps) {
    EXPECT_EQ(idm__trace_routine_end("", 5), 0);
    EXPECT_EQ(idm__trace_routine_end(nullptr, 5), 0);
    oxtest::set_trace_levels(0, 1, 0, 0, 0);
    idm__trace_routine_end("", 5);
    idm__trace_routine_end("fn", 5);
    oxtest::set_trace_levels(0, 8, 0, 0, 0);
    idm__trace_routine_end("fn", 5);
    auto r = oxtest::trace_records();
    ASSERT_EQ(r.size(), 2u);
    EXPECT_EQ(r[0].id, 2);
    EXPECT_EQ(r[0].kind, TRX_STRINGS);
    EXPECT_EQ(r[0].text(0), "fn");
    EXPECT_EQ(r[1].id, 3);
    EXPECT_EQ(r[1].text(0), "fn");
    EXPECT_EQ(r[1].i32(1), 5);

    trx_clear();
    char t1[] = "a", t2[] = "b";
    char *tokens[] = {t1, t2, nullptr};
    char gss[] = "gss";
    idm_rule rule{};
    rule.rule_state = 0x10001;
    rule.rgy_type = gss;
    rule.rgy = nullptr;
    rule.token_cnt = 3;
    rule.tokens = tokens;
    idm__trace_native_rule(&rule);
    idm_buffer mapping{0, nullptr};
    rule.token_cnt = 0;
    rule.mapping = &mapping;
    idm__trace_native_rule(&rule);
    idm__trace_native_rule(nullptr);
    r = oxtest::trace_records();
    std::vector<int> ids;
    for (auto &x : r) ids.push_back(x.id);
    EXPECT_EQ(ids, (std::vector<int>{136, 139, 139, 139, 136, 138}));
    EXPECT_EQ(r[0].u64(0), 0u);
    EXPECT_EQ(r[0].i32(0), 0x10001);
    EXPECT_EQ(r[0].text(1), "gss");
    EXPECT_EQ(r[0].text(2), "<null>");
    EXPECT_EQ(r[0].i32(3), 3);
    EXPECT_EQ(r[3].i32(0), 3);
    EXPECT_EQ(r[3].text(1), "<null>");
    EXPECT_EQ(r[5].i32(0), 0);
    EXPECT_EQ(r[5].text(1), "<null>");
    EXPECT_EQ(rule.rgy, nullptr) << "the dump never changes the rule";
}

}  // namespace
