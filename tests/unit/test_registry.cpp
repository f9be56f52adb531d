// The translator registry inside the library: a mutex that cannot be made
// leaves the list as it was, two threads registering one new mnemonic make
// one record; and the texts of the messages the library reports.
#include <pthread.h>

#include <string>
#include <thread>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"

namespace {

int32_t translator_a(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t translator_b(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cleanup_a(idm_rule *, idm_id *) { return 0; }
const std::string kName = "idm__native_register_translator";

TEST(Registry, MutexThatCannotBeMadeLeavesTheListUnchanged) {
    struct { int result, status, msgno; std::vector<std::string> inserts; } cases[] = {
        {ENOMEM, idm::kNoMemory, idm::kMsg654, {kName, std::to_string(sizeof(pthread_mutex_t))}},
        {EAGAIN, idm::kInternal, idm::kMsg661, {kName}},
        {EINVAL, idm::kInternal, idm::kMsg655, {"pthread_mutex_init", std::to_string(EINVAL), kName}},
    };
    for (const auto &c : cases) {
        idm_test_fail_mutex_init(c.result);
        EXPECT_EQ(sec_idm_register_translator(1, "m", translator_a, cleanup_a), c.status);
        EXPECT_TRUE(oxtest::reported(c.status, c.msgno, c.inserts));
        EXPECT_TRUE(idm__native_state.translator_count == 0 && idm__native_state.translators == nullptr);
    }
    idm_test_fail_mutex_init(0);
    EXPECT_EQ(sec_idm_register_translator(1, "m", translator_a, cleanup_a), 0);
}

TEST(Registry, ConcurrentRegistrationOfOneMnemonicMakesOneRecord) {
    for (int round = 0; round < 30; ++round) {
        const std::string mnemonic = "m" + std::to_string(round);
        pthread_barrier_t barrier;
        pthread_barrier_init(&barrier, nullptr, 2);
        auto reg = [&](idm_translator_routine t) {
            pthread_barrier_wait(&barrier);
            EXPECT_EQ(sec_idm_register_translator(1, mnemonic.c_str(), t, cleanup_a), 0);
        };
        std::thread a(reg, translator_a), b(reg, translator_b);
        a.join(), b.join();
        EXPECT_EQ(idm__native_state.translator_count, static_cast<uint32_t>(round + 1));
    }
}

struct ExpectedMessage { int number; const char *id, *text; };
const ExpectedMessage kReported[] = {
#include "expected_messages.inc"
};

TEST(MessageTable, ReportedEntriesAndNoNullEntry) {
    EXPECT_STREQ(cu_mesgtbl_oxseclib_msg[0], "Reserved: DO NOT USE!");
    for (int i = 0; i < OXSECLIB_MSG_COUNT; ++i) ASSERT_NE(cu_mesgtbl_oxseclib_msg[i], nullptr) << i;
    for (const ExpectedMessage &m : kReported) EXPECT_STREQ(cu_mesgtbl_oxseclib_msg[m.number], m.text) << m.id;
    EXPECT_STREQ(cu_badid_oxseclib_msg, "Bad message id for message set oxseclib_msg");
}

}  // namespace
