// Blocks that held an identity or a path are zeroed before they are freed:
// the library routes every such block through the zeroing free (whose hook
// sees each one), and each is all zero there.
#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"
#include "oxidm_natmap.h"

namespace {

using Blocks = std::vector<std::pair<const void *, size_t>>;
std::mutex g_mutex;
Blocks g_freed;  // blocks that were all zero
int g_unzeroed = 0;

void on_secret_free(const void *p, size_t n) {
    const auto *b = static_cast<const unsigned char *>(p);
    std::lock_guard<std::mutex> lock(g_mutex);
    if (std::any_of(b, b + n, [](unsigned char c) { return c != 0; })) ++g_unzeroed;
    else g_freed.emplace_back(p, n);
}

// The texts of `wanted` (pointer -> length with the NUL) were freed zeroed
// through the hook, and nothing else but `others` more blocks.
void expect_routed(const Blocks &wanted, size_t others = 0) {
    std::lock_guard<std::mutex> lock(g_mutex);
    for (const auto &[p, n] : wanted)
        EXPECT_EQ(std::count(g_freed.begin(), g_freed.end(), std::make_pair(p, n)), 1) << "a text not freed zeroed, or twice";
    EXPECT_EQ(g_freed.size(), wanted.size() + others);
    EXPECT_EQ(g_unzeroed, 0);
    g_freed.clear();
}

// A translator that copies no identity (the rule and id point into the
// entry and the caller's text), so every identity block is the library's.
int32_t translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    static char type[] = "zr", rgy[] = "R";
    if (entry != nullptr) {
        *rule = idm_rule{0, type, rgy, 1, static_cast<char **>(std::malloc(sizeof(char *))), nullptr};
        rule->tokens[0] = entry->network_id;
        if (entry->local_id != nullptr)
            rule->mapping = new idm_buffer{static_cast<uint32_t>(std::strlen(entry->local_id) + 1), entry->local_id};
    }
    *id = idm_id{type, rgy, 1, static_cast<char **>(std::malloc(sizeof(char *)))};
    id->tokens[0] = const_cast<char *>(network_id);
    return 0;
}
int32_t cleanup(idm_rule *rule, idm_id *id) {
    if (rule != nullptr) {
        std::free(rule->tokens);
        delete rule->mapping;
    }
    if (id != nullptr) std::free(id->tokens);
    return 0;
}

// Five affirmative entries and two denials: twelve identifiers.
const char kFile[] = "zr:zsecretJ0=zsecretL0\nzr:!zsecretD1\nzr:zsecretJ2=zsecretL2\nzr:zsecretJ3  =  zsecretL3 more\n"
                     "zr: ! zsecretD4\nzr:zsecretJ5=zsecretL5\nzr:zsecretJ6=zsecretL6\n";

class Zeroed : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        idm_test_on_secret_free(on_secret_free);
        ASSERT_EQ(sec_idm_register_translator(1, "zr", translate, cleanup), 0);
        oxtest::write_file(oxtest::kLocalMap, kFile, 1000);
    }
    void TearDown() override {
        idm_test_on_secret_free(nullptr);
        oxtest::Test::TearDown();
    }
};

TEST_F(Zeroed, IdentifiersPathsResultsAndGroupBuffers) {
    idm_buffer local{};
    ASSERT_EQ(sec_idm_map_identity("zr", "zsecretJ0", &local), 0);
    ASSERT_STREQ(local.value, "zsecretL0");
    const idm_translator *record = idm__native_find_translator("zr");
    ASSERT_EQ(record->entry_count, 7);
    Blocks texts;
    for (int32_t i = 0; i < record->entry_count; ++i)
        for (const char *t : {record->entries[i].network_id, record->entries[i].local_id})
            if (t != nullptr) texts.emplace_back(t, std::strlen(t) + 1);
    ASSERT_EQ(texts.size(), 12u);
    expect_routed({});

    // The file changes: the next mapping releases every old identifier.
    oxtest::write_file(oxtest::kLocalMap, kFile, 2000);
    idm_buffer again{};
    ASSERT_EQ(sec_idm_map_identity("zr", "zsecretJ0", &again), 0);
    expect_routed(texts);
    // The mapping result, released as the library releases a buffer.
    texts = {{local.value, 10}, {again.value, 10}};
    idm__release_buffer(&local);
    idm__release_buffer(&again);
    expect_routed(texts);

    // A map file set: three paths, the names array and three per-file arrays.
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    texts.clear();
    for (int32_t i = 0; i < set->count; ++i) texts.emplace_back(set->names[i], std::strlen(set->names[i]) + 1);
    idm__native_release_cachef(set);
    expect_routed(texts, 4);

    // A group lookup: the user buffer (twice the suggested size), the primary
    // group's and the scan buffer, each zeroed whole.
    const passwd *root = getpwuid(0);
    const long pw = sysconf(_SC_GETPW_R_SIZE_MAX), gr = sysconf(_SC_GETGR_R_SIZE_MAX);
    if (root == nullptr || pw <= 0 || gr <= 0) GTEST_SKIP() << "no user 0 or no suggested buffer sizes";
    const std::string name = root->pw_name;
    idm_buffer user{static_cast<uint32_t>(name.size() + 1), const_cast<char *>(name.c_str())};
    uint32_t count = 0;
    idm_buffer *groups = nullptr;
    ASSERT_EQ(sec_idm_get_groups(&user, &count, &groups), 0);
    for (uint32_t i = 0; i < count; ++i) std::free(groups[i].value);
    std::free(groups);
    std::multiset<size_t> sizes;
    for (const auto &[p, n] : g_freed) sizes.insert(n);
    EXPECT_EQ(sizes, (std::multiset<size_t>{size_t(2 * pw), size_t(gr), size_t(gr)}));
    EXPECT_EQ(g_unzeroed, 0);
}

}  // namespace
