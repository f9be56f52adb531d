// Allocation-failure sweeps of the mapping service's whole operations: a
// mapping pass that creates the map file set, reads the local and the
// global file, grows the entry list and the rule cache past ten and copies
// the result; and a registration.
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "oxidm_state.h"
#include "oxidm_natfile.h"
#include "test_sweep.h"

namespace {

using oxtest::heap_copy;
using oxtest::num;

using oxtest::Error;
using sweep::Row;

// ---- the translator: one token, the network identifier; allocates like a
// real MPM; notes the current error at every call into it, so that a report
// made in the middle of a walk is seen even when later entries report
// their own mismatches ----

std::vector<Error> g_errors;
unsigned long g_error_count = 0;

void note_errors() {
    if (cux_error_count() == g_error_count) return;
    g_error_count = cux_error_count();
    g_errors.push_back(oxtest::last_error());
}
void start_noting() {
    g_errors.clear();
    g_error_count = cux_error_count();
}



int32_t translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    note_errors();
    if (entry != nullptr) {
        rule->rgy_type = heap_copy("sw");
        rule->rgy = heap_copy("R");
        rule->token_cnt = 1;
        rule->tokens = oxtest::one_token(entry->network_id);
        if (entry->local_id != nullptr) {
            rule->mapping = oxtest::mapping_of(entry->local_id);
        }
    }
    id->rgy_type = heap_copy("sw");
    id->rgy = heap_copy("R");
    id->token_cnt = 1;
    id->tokens = oxtest::one_token(network_id);
    return 0;
}

int32_t cleanup(idm_rule *rule, idm_id *id) {
    note_errors();
    return oxtest::free_rule_and_id(rule, id);
}

// ---- the files: 13 entries, six local and seven global, so that the entry
// list and the rule cache each grow twice; "joe" matches the 12th, and
// the 13th would grant "guest" to anyone ----

const char *const kLocalLines[] = {"alice=al", "!eve", "bob=bl", "carol=cl", "dave=dl", "erin=el"};
const char *const kGlobalLines[] = {"frank=fl", "gina=gl", "!hal", "ivan=il", "jack=jl2", "joe=jl", "*=guest"};

std::string file_for(const std::string &mech, const char *const (&lines)[6]) {
    std::string text = "# local\n";
    for (const char *l : lines) text += mech + ":" + l + "\n";
    return text;
}
std::string file_for(const std::string &mech, const char *const (&lines)[7]) {
    std::string text = "other:joe=nobody\n";
    for (const char *l : lines) text += mech + ":" + l + "\n";
    return text;
}

// Sizes (as insert texts) of the identifier copies of a set of lines.
void identifier_sizes(const char *const *lines, size_t n, std::set<std::string> *sizes) {
    for (size_t i = 0; i < n; ++i) {
        std::string l = lines[i];
        if (l[0] == '!') {
            sizes->insert(std::to_string(l.size()));  // without the '!', with the NUL
            continue;
        }
        size_t eq = l.find('=');
        sizes->insert(std::to_string(eq + 1));
        sizes->insert(std::to_string(l.size() - eq));
    }
}

struct Answer {
    int32_t status;
    std::string local;  // "" for an empty buffer
    bool operator==(const Answer &o) const { return status == o.status && local == o.local; }
};
std::ostream &operator<<(std::ostream &os, const Answer &a) {
    return os << "{" << a.status << ", \"" << a.local << "\"}";
}

Answer map(const std::string &mech, const char *who) {
    idm_buffer local{};
    int32_t status = sec_idm_map_identity(mech.c_str(), who, &local);
    Answer a{status, local.value != nullptr ? local.value : ""};
    if (local.value != nullptr) {
        EXPECT_EQ(local.length, a.local.size() + 1);
    }
    std::free(local.value);
    return a;
}

enum Outcome {
    kReadFailed,     // the pass failed: the mechanism has no entries until a file changes
    kSetNotMade,     // the set was not made: the next call makes it and reads
    kRuleNotCached,  // the walk went on; the rule is translated again next time
    kNoResultCopy,   // the matching entry gave no name; the walk went on to "*"
};

class SweepMapping : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
    }
    void TearDown() override {
        idm_test_fail_alloc(0);
        oxtest::Test::TearDown();
    }
};

TEST_F(SweepMapping, EveryAllocationOfAPassThatReadsTwoFilesAndCachesRules) {
    std::set<std::string> identifiers;
    identifier_sizes(kLocalLines, 6, &identifiers);
    identifier_sizes(kGlobalLines, 7, &identifiers);
    const std::string set_sizes[] = {std::to_string(sizeof(idm_mapfile_set)), std::to_string(3 * sizeof(char *)),
                                     "28", "29", "32", std::to_string(3 * sizeof(uint32_t))};
    std::vector<Row> rows = {
        {"map file set", idm::kMsg654, "idm__native_get_mapfile_names", {std::begin(set_sizes), std::end(set_sizes)},
         6, 6, kSetNotMade},
        {"identifier copy", idm::kMsg658, "idm__read_mapfile_entries", identifiers, 23, 23, kReadFailed},
        {"entry list growth", idm::kMsg658, "idm_alloc_entries", {"400", "800"}, 23, 6, kReadFailed},
        {"rule cache growth", idm::kMsg654, "idm__native_cache_rule", {"480", "960"}, 6, 0, kRuleNotCached},
        {"copy of the local name", idm::kMsg654, "idm__native_get_mapping", {"3"}, 6, 0, kNoResultCopy},
    };
    const Answer right{0, "jl"};
    int64_t mtime = 100000;
    int steps = sweep::run([&](long n) {
        // A mechanism of its own per step: a fresh record, no set, no cache.
        const std::string mech = num("sw", n);
        EXPECT_EQ(sec_idm_register_translator(1, mech.c_str(), translate, cleanup), 0);
        oxtest::write_file(oxtest::kLocalMap, file_for(mech, kLocalLines), mtime += 10);
        oxtest::write_file(oxtest::kVarGlobalMap, file_for(mech, kGlobalLines), mtime);
        const int descriptors = oxtest::open_descriptors();
        oxtest::clear_errors();
        start_noting();

        idm_test_fail_alloc(n);
        const Answer got = map(mech, "joe");
        const bool fired = idm_test_alloc_fired() != 0;
        idm_test_fail_alloc(0);
        note_errors();

        std::vector<Error> failures;
        for (const Error &e : g_errors)
            if (e.msgno == idm::kMsg654 || e.msgno == idm::kMsg658) failures.push_back(e);
        EXPECT_EQ(mssx_locks_held(), 0);
        EXPECT_EQ(oxtest::open_descriptors(), descriptors);
        idm_translator *record = idm__native_find_translator(mech.c_str());
        EXPECT_NE(record, nullptr);
        if (record != nullptr) {
            EXPECT_TRUE(sweep::unlocked(&record->mutex));
        }
        EXPECT_TRUE(sweep::unlocked(&idm__native_state.mutex));
        if (!fired) {
            EXPECT_TRUE(sweep::no_leaks());
            EXPECT_EQ(got, right);
            EXPECT_TRUE(failures.empty());
            return false;
        }

        EXPECT_EQ(failures.size(), 1u) << "one report per failure";
        if (failures.empty()) return true;
        Row *row = sweep::row_of(rows, failures.back());
        if (row == nullptr) {
            ADD_FAILURE() << "no failure row for " << sweep::describe(failures.back());
            return true;
        }
        SCOPED_TRACE(row->label);
        ++row->hits;
        EXPECT_EQ(failures.back().status, row->recorded);
        // What this call answers, and what the next one (nothing changed) does.
        Answer now, next;
        switch (row->outcome) {
        case kSetNotMade:
            now = {6, ""};
            next = right;
            break;
        case kReadFailed:  // read again at the next request
            now = {row->returned, ""};
            next = right;
            break;
        case kRuleNotCached:
            now = right;
            next = right;
            break;
        case kNoResultCopy:
            now = {0, "guest"};
            next = right;
            break;
        }
        EXPECT_EQ(got, now);
        oxtest::clear_errors();
        EXPECT_EQ(map(mech, "joe"), next);
        // A change of a file brings every entry back.
        oxtest::set_mtime(oxtest::kLocalMap, mtime += 10);
        EXPECT_EQ(map(mech, "joe"), right);
        EXPECT_EQ(map(mech, "alice"), (Answer{0, "al"}));
        EXPECT_EQ(map(mech, "eve"), (Answer{0, ""}));
        EXPECT_EQ(mssx_locks_held(), 0);
        EXPECT_TRUE(sweep::no_leaks());
        return true;
    });
    RecordProperty("allocations", steps);
    EXPECT_GT(steps, 30);
    sweep::expect_all_hit(rows);
}

// A registration fails at either allocation: the list stays as it was, the
// mnemonic is not registered, and registering it again works.
TEST_F(SweepMapping, EveryAllocationOfARegistration) {
    ASSERT_EQ(sec_idm_register_translator(1, "first", translate, cleanup), 0);  // once-controls outside the count
    std::vector<Row> rows = {
        {"translator record", idm::kMsg654, "idm__native_register_translator",
         {std::to_string(sizeof(idm_translator))}, 6, 6, 0},
        {"mnemonic copy", idm::kMsg654, "idm__native_register_translator", {"12"}, 6, 6, 0},
    };
    const char kMnemonic[] = "mechanism_x";  // 11 characters
    int steps = sweep::run([&](long n) {
        const uint32_t count = idm__native_state.translator_count;
        oxtest::clear_errors();
        idm_test_fail_alloc(n);
        const int32_t status = sec_idm_register_translator(1, kMnemonic, translate, cleanup);
        const bool fired = idm_test_alloc_fired() != 0;
        idm_test_fail_alloc(0);
        EXPECT_TRUE(sweep::no_leaks());
        EXPECT_TRUE(sweep::unlocked(&idm__native_state.mutex));
        if (!fired) {
            EXPECT_EQ(status, 0);
            EXPECT_EQ(idm__native_state.translator_count, count + 1);
            return false;
        }
        Row *row = sweep::row_of(rows, oxtest::last_error());
        if (row == nullptr) {
            ADD_FAILURE() << "no failure row for " << sweep::describe(oxtest::last_error());
            return true;
        }
        ++row->hits;
        EXPECT_EQ(status, row->returned);
        EXPECT_EQ(oxtest::reports_since_clear(), 1u);
        EXPECT_EQ(idm__native_state.translator_count, count);
        idm_translator_routine t = nullptr;
        idm_cleanup_routine c = nullptr;
        EXPECT_EQ(_sec_idm_get_translator(kMnemonic, &t, &c), 0);
        EXPECT_EQ(t, nullptr) << "a failed registration left a record";
        // The list still works: a mapping for the first mechanism goes
        // through the native mutex and the list.
        idm_buffer local{};
        EXPECT_EQ(sec_idm_map_identity("first", "joe", &local), 0);
        std::free(local.value);
        return true;
    });
    EXPECT_EQ(steps, 2);
    sweep::expect_all_hit(rows);
    idm_translator_routine t = nullptr;
    idm_cleanup_routine c = nullptr;
    EXPECT_EQ(_sec_idm_get_translator(kMnemonic, &t, &c), 0);
    EXPECT_EQ(t, translate);
}

}  // namespace
