// The mapping walk under threads: mappers racing a writer that replaces the
// map file see one version of the entries per walk, never a mixture; a
// translator replaced by a new registration while mappings run is used as a
// pair, never half old and half new; a thread cancelled inside the MPM's
// translator or cleanup routine leaves no mutex locked and the record usable.
#include <pthread.h>
#include <sched.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "../unit/test_sweep.h"
#include "harness.h"
#include "test_mpm.h"
#include "oxidm_state.h"

namespace {

constexpr int64_t kOld = 1'000'000;
constexpr int kEntries = 12;

// ---- version test translator ----
//
// A line "vers:<v>.<i>=<v>" gives a rule whose registry type is the
// version <v>; the identity's id carries the version the walk saw first, so
// an entry of another version within one walk fails to match (2650-663) and
// is counted as a mixture.  The last line of each version matches "joe".

thread_local std::string t_version;  // version of the first rule of this walk
thread_local int t_mixed = 0;

using oxtest::heap_copy;

int32_t version_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    if (entry != nullptr) {
        std::string nid = entry->network_id;
        std::string version = nid.substr(0, nid.find('.'));
        std::string token = nid.substr(nid.find('.') + 1);
        rule->rgy_type = heap_copy(version.c_str());
        rule->rgy = heap_copy("r");
        rule->token_cnt = 1;
        rule->tokens = oxtest::one_token(token.c_str());
        rule->mapping = oxtest::mapping_of(entry->local_id);
    }
    if (t_version.empty()) t_version = rule->rgy_type;
    else if (t_version != rule->rgy_type) ++t_mixed;
    id->rgy_type = heap_copy(t_version.c_str());
    id->rgy = heap_copy("r");
    id->token_cnt = 1;
    id->tokens = oxtest::one_token(network_id);
    return 0;
}

int32_t version_cleanup(idm_rule *rule, idm_id *id) { return oxtest::free_rule_and_id(rule, id); }

std::string version_file(int v) {
    std::string text;
    for (int i = 0; i < kEntries - 1; ++i)
        text += "vers:v" + std::to_string(v) + ".x" + std::to_string(i) + "=v" + std::to_string(v) + "\n";
    return text + "vers:v" + std::to_string(v) + ".joe=v" + std::to_string(v) + "\n";
}

class MappingThreads : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
    }
};

TEST_F(MappingThreads, MappersSeeOneVersionOfTheFilesPerWalk) {
    ASSERT_EQ(sec_idm_register_translator(1, "vers", version_translate, version_cleanup), 0);
    oxtest::write_file(oxtest::kLocalMap, version_file(0), kOld);
    constexpr int kWrites = 150;
    std::atomic<bool> done{false};
    std::atomic<int> failures{0}, mixtures{0}, answers{0}, versions_seen{0};
    auto mapper = [&] {
        std::string previous;
        while (!done.load()) {
            t_version.clear();
            t_mixed = 0;
            idm_buffer local{};
            int32_t status = sec_idm_map_identity("vers", "joe", &local);
            if (status != 0 || local.value == nullptr || t_version != local.value) failures.fetch_add(1);
            if (t_mixed != 0) mixtures.fetch_add(1);
            if (t_version != previous) versions_seen.fetch_add(1);
            previous = t_version;
            answers.fetch_add(1);
            std::free(local.value);
        }
    };
    std::thread a(mapper), b(mapper);
    for (int v = 1; v <= kWrites; ++v) {
        oxtest::write_file(oxtest::kLocalMap, version_file(v), kOld + v);
        usleep(200);
    }
    done.store(true);
    a.join();
    b.join();
    EXPECT_EQ(failures.load(), 0);
    EXPECT_EQ(mixtures.load(), 0);
    EXPECT_GT(versions_seen.load(), 2) << "the mappers raced the writer";
    // The last version is in force afterwards.
    idm_buffer local{};
    ASSERT_EQ(sec_idm_map_identity("vers", "joe", &local), 0);
    EXPECT_STREQ(local.value, ("v" + std::to_string(kWrites)).c_str());
    std::free(local.value);
}

// ---- replaced routines ----
//
// Two translator/cleanup pairs that tag what they allocate; each walk must
// use one pair for every call (the rule cache may hold rules of either).

thread_local char t_pair = 0;
thread_local int t_pair_mixed = 0;

void note(char tag) {
    if (t_pair == 0) t_pair = tag;
    else if (t_pair != tag) ++t_pair_mixed;
}

template <char Tag>
int32_t pair_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    note(Tag);
    return version_translate(entry, network_id, rule, id);
}
template <char Tag>
int32_t pair_cleanup(idm_rule *rule, idm_id *id) {
    if (id != nullptr) note(Tag);  // cleanup of a rule belongs to the refresh
    return version_cleanup(rule, id);
}

TEST_F(MappingThreads, TranslatorReplacedWhileMappingsRun) {
    ASSERT_EQ(sec_idm_register_translator(1, "vers", pair_translate<'A'>, pair_cleanup<'A'>), 0);
    oxtest::write_file(oxtest::kLocalMap, version_file(0), kOld);
    std::atomic<bool> done{false};
    std::atomic<int> failures{0}, mixtures{0};
    auto mapper = [&] {
        for (int i = 0; !done.load(); ++i) {
            t_version.clear();
            t_pair = 0;
            t_pair_mixed = 0;
            idm_buffer local{};
            if (sec_idm_map_identity("vers", "joe", &local) != 0 || local.value == nullptr) failures.fetch_add(1);
            if (t_pair_mixed != 0) mixtures.fetch_add(1);
            std::free(local.value);
        }
    };
    std::thread a(mapper), b(mapper);
    for (int i = 0; i < 400; ++i) {
        if (i % 2 == 0) ASSERT_EQ(sec_idm_register_translator(1, "vers", pair_translate<'B'>, pair_cleanup<'B'>), 0);
        else ASSERT_EQ(sec_idm_register_translator(1, "vers", pair_translate<'A'>, pair_cleanup<'A'>), 0);
        if (i % 40 == 0) oxtest::write_file(oxtest::kLocalMap, version_file(i), kOld + i + 1);
        usleep(100);
    }
    done.store(true);
    a.join();
    b.join();
    EXPECT_EQ(failures.load(), 0);
    EXPECT_EQ(mixtures.load(), 0);
    EXPECT_EQ(idm__native_state.translator_count, 1u);
}

// ---- cancellation inside the MPM ----
//
// These routines allocate nothing, so a cancelled call leaks nothing.

std::atomic<int> g_inside{0};
std::atomic<int> g_block_at{0};  // 1: block in the translator; 2: block in a rule cleanup
char g_type[] = "c";
char g_rgy[] = "r";
char g_joe[] = "joe";
char *g_tokens[] = {g_joe};
char g_name[] = "local";
idm_buffer g_mapping{6, g_name};

// Waits for the cancellation at pthread_testcancel only: acted on inside a
// sleeping call, it would unwind through the thread sanitizer's interceptor
// frame, which then misses the unlock of the mutex hold.
void block_here() {
    g_inside.store(1);
    for (;;) {
        pthread_testcancel();
        sched_yield();
    }
}

// Fields are set one by one: a scoped temporary in this frame would stay
// poisoned after the cancellation unwind, and the sanitizer's own clean-up
// then trips over it (a false stack-use-after-scope report).
int32_t cancel_translate(const idm_mapfile_entry *entry, const char *, idm_rule *rule, idm_id *id) {
    if (entry != nullptr) {
        rule->rgy_type = g_type;
        rule->rgy = g_rgy;
        rule->token_cnt = 1;
        rule->tokens = g_tokens;
        rule->mapping = &g_mapping;
    }
    id->rgy_type = g_type;
    id->rgy = g_rgy;
    id->token_cnt = 1;
    id->tokens = g_tokens;
    if (g_block_at.load() == 1) block_here();
    return 0;
}
int32_t cancel_cleanup(idm_rule *rule, idm_id *) {
    if (rule != nullptr && g_block_at.load() == 2) block_here();
    if (rule == nullptr && g_block_at.load() == 3) block_here();
    return 0;
}

void *map_in_thread(void *) {
    idm_buffer local{};
    (void)sec_idm_map_identity("canc", "joe", &local);
    std::free(local.value);
    return nullptr;
}

bool unlocked(pthread_mutex_t *m) {
    if (pthread_mutex_trylock(m) != 0) return false;
    pthread_mutex_unlock(m);
    return true;
}

TEST_F(MappingThreads, CancelledInsideTheMpmLeavesNoMutexLocked) {
    ASSERT_EQ(sec_idm_register_translator(1, "canc", cancel_translate, cancel_cleanup), 0);
    oxtest::write_file(oxtest::kLocalMap, "canc:joe=local\n", kOld);
    struct Case {
        const char *label;
        int block_at;
        bool change_files;  // so that the refresh releases the cached rule
    } cases[] = {
        {"translator, entry not cached", 1, false},
        {"translator, cached rule", 1, false},
        {"cleanup of a cached rule during the refresh", 2, true},
        {"cleanup of the id after the match, the name already copied", 3, false},
    };
    int64_t mtime = kOld;
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        if (c.change_files) oxtest::write_file(oxtest::kLocalMap, "canc:joe=local\n", mtime += 10);
        g_inside.store(0);
        g_block_at.store(c.block_at);
        pthread_t thread;
        ASSERT_EQ(pthread_create(&thread, nullptr, map_in_thread, nullptr), 0);
        while (g_inside.load() == 0) usleep(1000);
        ASSERT_EQ(pthread_cancel(thread), 0);
        void *result = nullptr;
        ASSERT_EQ(pthread_join(thread, &result), 0);
        EXPECT_EQ(result, PTHREAD_CANCELED);
        g_block_at.store(0);

        idm_translator *record = idm__native_find_translator("canc");
        ASSERT_NE(record, nullptr);
        EXPECT_TRUE(unlocked(&record->mutex));
        EXPECT_TRUE(unlocked(&idm__native_state.mutex));
        EXPECT_EQ(mssx_locks_held(), 0);
        // The next call completes with the right answer.
        idm_buffer local{};
        EXPECT_EQ(sec_idm_map_identity("canc", "joe", &local), 0);
        EXPECT_STREQ(local.value, "local");
        std::free(local.value);
        EXPECT_TRUE(sweep::no_leaks());
    }
}

}  // namespace
