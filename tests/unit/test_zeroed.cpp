// Texts that held an identity or a path are zeroed before they are freed.
//
// Two views.  Through idm_test_on_secret_free, which idm::free_secret and
// idm::free_zeroed call with each block after zeroing it: every such block
// is all zero bytes, and the library really routes its frees there (the
// identifiers of a known number of entries, the three paths of a map file
// set, a mapping result, the group lookup's work buffers, the entries of a
// pass that failed).  And, under the address sanitizer, through its free
// hook, which sees every block freed in the process: while the library maps
// identities from a file, no freed block holds any identity of that file or
// the map file's path.
#include <pwd.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"
#include "oxidm_natmap.h"

#if defined(__SANITIZE_ADDRESS__)
// The sanitizer allocator's interface (not every compiler installs its
// header).
extern "C" {
int __sanitizer_install_malloc_and_free_hooks(void (*malloc_hook)(const volatile void *, size_t),
                                              void (*free_hook)(const volatile void *));
int __sanitizer_get_ownership(const volatile void *p);
size_t __sanitizer_get_allocated_size(const volatile void *p);
}
#endif

namespace {

struct Freed {
    const void *p;
    size_t n;
    bool zero;
};
std::mutex g_mutex;
std::vector<Freed> g_freed;

void on_secret_free(const void *p, size_t n) {
    const auto *b = static_cast<const unsigned char *>(p);
    bool zero = true;
    for (size_t i = 0; i < n; ++i) zero = zero && b[i] == 0;
    std::lock_guard<std::mutex> lock(g_mutex);
    g_freed.push_back({p, n, zero});
}

std::vector<Freed> take_freed() {
    std::lock_guard<std::mutex> lock(g_mutex);
    std::vector<Freed> out;
    out.swap(g_freed);
    return out;
}

// A translator that copies no identity: the rule points into the entry,
// the id at the caller's text; only arrays of pointers are allocated.
int32_t translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    static char type[] = "zr", rgy[] = "R";
    if (entry != nullptr) {
        rule->rgy_type = type;
        rule->rgy = rgy;
        rule->token_cnt = 1;
        rule->tokens = static_cast<char **>(std::malloc(sizeof(char *)));
        rule->tokens[0] = entry->network_id;
        if (entry->local_id != nullptr) {
            rule->mapping = static_cast<idm_buffer *>(std::malloc(sizeof(idm_buffer)));
            rule->mapping->value = entry->local_id;
            rule->mapping->length = static_cast<uint32_t>(std::strlen(entry->local_id) + 1);
        }
    }
    id->rgy_type = type;
    id->rgy = rgy;
    id->token_cnt = 1;
    id->tokens = static_cast<char **>(std::malloc(sizeof(char *)));
    id->tokens[0] = const_cast<char *>(network_id);
    return 0;
}
int32_t cleanup(idm_rule *rule, idm_id *id) {
    if (rule != nullptr) {
        std::free(rule->tokens);
        std::free(rule->mapping);
    }
    if (id != nullptr) std::free(id->tokens);
    return 0;
}

// Five affirmative entries and two denials; "zsecretJ0" matches the first.
const char kFile[] =
    "zr:zsecretJ0=zsecretL0\n"
    "zr:!zsecretD1\n"
    "zr:zsecretJ2=zsecretL2\n"
    "zr:zsecretJ3  =  zsecretL3 more\n"
    "zr: ! zsecretD4\n"
    "zr:zsecretJ5=zsecretL5\n"
    "zr:zsecretJ6=zsecretL6\n";
constexpr size_t kIdentifiers = 5 * 2 + 2;

class Zeroed : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        take_freed();
        idm_test_on_secret_free(on_secret_free);
    }
    void TearDown() override {
        idm_test_on_secret_free(nullptr);
        idm_test_fail_alloc(0);
        oxtest::Test::TearDown();
    }
};

// Each pointer of `wanted` was freed through the hook exactly once, zeroed
// over its text and its NUL.
void expect_routed(const std::vector<Freed> &freed, const std::map<const void *, size_t> &wanted) {
    for (const auto &[p, n] : wanted) {
        int seen = 0;
        for (const Freed &f : freed) {
            if (f.p != p) continue;
            ++seen;
            EXPECT_EQ(f.n, n);
        }
        EXPECT_EQ(seen, 1) << "a block that held a text was not freed through the zeroing routines";
    }
    for (const Freed &f : freed) EXPECT_TRUE(f.zero) << "a block of " << f.n << " bytes was freed unzeroed";
}

TEST_F(Zeroed, IdentifiersOfReplacedEntriesAndTheMappingResult) {
    OXTEST_REQUIRE_NAMESPACE();
    ASSERT_EQ(sec_idm_register_translator(1, "zr", translate, cleanup), 0);
    oxtest::write_file(oxtest::kLocalMap, kFile, 1000);
    idm_buffer local{};
    ASSERT_EQ(sec_idm_map_identity("zr", "zsecretJ0", &local), 0);
    ASSERT_STREQ(local.value, "zsecretL0");

    // The identifiers the record holds now.
    idm_translator *record = idm__native_find_translator("zr");
    ASSERT_NE(record, nullptr);
    ASSERT_EQ(record->entry_count, 7);
    std::map<const void *, size_t> identifiers;
    for (int32_t i = 0; i < record->entry_count; ++i) {
        const idm_mapfile_entry &e = record->entries[i];
        identifiers[e.network_id] = std::strlen(e.network_id) + 1;
        if (e.local_id != nullptr) identifiers[e.local_id] = std::strlen(e.local_id) + 1;
    }
    ASSERT_EQ(identifiers.size(), kIdentifiers);
    take_freed();

    // The file changes: the next mapping releases every old identifier.
    oxtest::write_file(oxtest::kLocalMap, kFile, 2000);
    idm_buffer again{};
    ASSERT_EQ(sec_idm_map_identity("zr", "zsecretJ0", &again), 0);
    std::vector<Freed> freed = take_freed();
    EXPECT_EQ(freed.size(), kIdentifiers);
    expect_routed(freed, identifiers);

    // The mapping result, released as the library releases a buffer.
    const void *value = local.value;
    idm__release_buffer(&local);
    freed = take_freed();
    expect_routed(freed, {{value, std::strlen("zsecretL0") + 1}});
    std::free(again.value);
}

TEST_F(Zeroed, PathsOfAMapFileSet) {
    idm_mapfile_set *set = nullptr;
    ASSERT_EQ(idm__native_get_mapfile_names(&set), 0);
    std::map<const void *, size_t> paths;
    for (int32_t i = 0; i < set->count; ++i) paths[set->names[i]] = std::strlen(set->names[i]) + 1;
    take_freed();
    idm__native_release_cachef(set);
    std::vector<Freed> freed = take_freed();
    // Three paths, the names array and the three per-file arrays.
    EXPECT_EQ(freed.size(), 7u);
    expect_routed(freed, paths);
}

TEST_F(Zeroed, EntriesOfAPassThatFailed) {
    OXTEST_REQUIRE_NAMESPACE();
    oxtest::write_file(oxtest::kLocalMap, kFile, 1000);
    idm_mapfile_set *set = nullptr;
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    // The set (8 allocations), then the list and the identifiers of four
    // lines (2 + 1 + 1 + 2 + 2): the next copy, in the fifth line, fails.
    idm_test_fail_alloc(8 + 8 + 1);
    EXPECT_EQ(idm__native_read_mapfiles("zr", &set, &count, &entries), 23);
    EXPECT_TRUE(idm_test_alloc_fired());
    idm_test_fail_alloc(0);
    std::vector<Freed> freed = take_freed();
    EXPECT_EQ(freed.size(), 7u) << "the identifiers of the four entries parsed before the failure";
    for (const Freed &f : freed) EXPECT_TRUE(f.zero);
    EXPECT_EQ(count, 0);
    idm__native_release_cachef(set);
}

TEST_F(Zeroed, WorkBuffersOfAGroupLookup) {
    const passwd *root = getpwuid(0);
    if (root == nullptr) GTEST_SKIP() << "no user 0 in this system's database";
    const std::string name = root->pw_name;
    const long pw = sysconf(_SC_GETPW_R_SIZE_MAX), gr = sysconf(_SC_GETGR_R_SIZE_MAX);
    if (pw <= 0 || gr <= 0) GTEST_SKIP() << "no suggested buffer sizes";
    idm_buffer user{static_cast<uint32_t>(name.size() + 1), const_cast<char *>(name.c_str())};
    uint32_t count = 0;
    idm_buffer *groups = nullptr;
    ASSERT_EQ(sec_idm_get_groups(&user, &count, &groups), 0);
    for (uint32_t i = 0; i < count; ++i) std::free(groups[i].value);
    std::free(groups);
    std::vector<Freed> freed = take_freed();
    // The user buffer (twice the suggested size), the primary group's buffer
    // and the scan buffer, each zeroed whole.
    std::multiset<size_t> sizes;
    for (const Freed &f : freed) {
        sizes.insert(f.n);
        EXPECT_TRUE(f.zero);
    }
    EXPECT_EQ(sizes, (std::multiset<size_t>{static_cast<size_t>(2 * pw), static_cast<size_t>(gr),
                                             static_cast<size_t>(gr)}));
}

// ---- every block freed in the process, under the address sanitizer ----

#if defined(__SANITIZE_ADDRESS__)
// The free hook runs inside the allocator: it must not allocate.  It keeps
// the first offending block's size and a copy of its start.
std::atomic<bool> g_watch{false};
std::atomic<int> g_offending{0};
size_t g_offending_size = 0;
char g_offending_text[96];
const char *const kMarkers[] = {"zsecret", "oxsec_map", "/var/ox/cfg"};

void watch_free(const volatile void *ptr) {
    if (!g_watch.load(std::memory_order_relaxed) || ptr == nullptr) return;
    const void *p = const_cast<const void *>(ptr);
    if (__sanitizer_get_ownership(p) == 0) return;
    const size_t n = __sanitizer_get_allocated_size(p);
    const char *b = static_cast<const char *>(p);
    for (const char *marker : kMarkers) {
        const size_t m = std::strlen(marker);
        if (n >= m && memmem(b, n, marker, m) != nullptr) {
            if (g_offending.fetch_add(1) == 0) {
                g_offending_size = n;
                const size_t copy = n < sizeof g_offending_text - 1 ? n : sizeof g_offending_text - 1;
                for (size_t i = 0; i < copy; ++i) g_offending_text[i] = b[i] >= 0x20 && b[i] < 0x7f ? b[i] : '.';
                g_offending_text[copy] = '\0';
            }
            return;
        }
    }
}
void ignore_malloc(const volatile void *, size_t) {}
#endif

TEST_F(Zeroed, NoFreedBlockHoldsAnIdentityOrAPathWhileMapping) {
#if !defined(__SANITIZE_ADDRESS__)
    GTEST_SKIP() << "needs the address sanitizer's free hook";
#else
    OXTEST_REQUIRE_NAMESPACE();
    ASSERT_EQ(sec_idm_register_translator(1, "zr", translate, cleanup), 0);
    const std::string first(kFile), second = std::string(kFile) + "zr:zsecretJ7=zsecretL7\n";
    oxtest::write_file(oxtest::kLocalMap, first, 1000);
    ASSERT_NE(__sanitizer_install_malloc_and_free_hooks(ignore_malloc, watch_free), 0);

    // Read the file, then read a new version (the old entries go), then
    // release the results: every free of these calls is watched.
    idm_buffer a{}, b{};
    g_watch.store(true);
    const int32_t s1 = sec_idm_map_identity("zr", "zsecretJ0", &a);
    g_watch.store(false);
    oxtest::write_file(oxtest::kLocalMap, second, 2000);
    g_watch.store(true);
    const int32_t s2 = sec_idm_map_identity("zr", "zsecretJ0", &b);
    idm__release_buffer(&a);
    idm__release_buffer(&b);
    g_watch.store(false);

    EXPECT_EQ(s1, 0);
    EXPECT_EQ(s2, 0);
    EXPECT_TRUE(oxtest::nothing_reported()) << "a report would copy identities into the error facility";
    EXPECT_EQ(g_offending.load(), 0) << "a freed block of " << g_offending_size
                                     << " bytes still held an identity or a path: \"" << g_offending_text << "\"";
#endif
}

}  // namespace
