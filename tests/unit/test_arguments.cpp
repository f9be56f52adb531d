// The argument checks of every routine that has them, in one table: the
// exported functions (and the token matcher) refuse a bad argument as a bad
// parameter with 2650-650, the internal routines as an internal failure with
// 2650-651 (the change test: a bad parameter, answering "unchanged"), naming
// the routine, the position of the first bad argument and its value; nothing
// the caller passed is written.
#include <cstdio>
#include <string>

#include "harness.h"
#include "oxidm_clmap.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"
#include "oxidm_natmap.h"

namespace {

int32_t tr(const idm_mapfile_entry *, const char *, idm_rule *, idm_id *) { return 0; }
int32_t cl(idm_rule *, idm_id *) { return 0; }

char kEmpty[] = "", kRoot[] = "root";
idm_buffer g_out{77, kRoot}, g_user{5, kRoot}, g_no_length{0, kRoot}, g_no_value{5, nullptr};
uint32_t g_count = 99;
idm_buffer *g_groups = &g_out;
idm_translator_routine g_tr;
int32_t g_n, g_negative = -1, g_fd = -7;
FILE *g_stream;
idm_mapfile_entry g_entry{}, *g_entries, *g_stray = &g_entry;
idm_mapfile_set *g_set, g_hollow{};  // g_hollow: a set without arrays
char *g_clusters[1];
idm_clnode *g_node;

uintptr_t at(const void *p) { return reinterpret_cast<uintptr_t>(p); }
template <class T> T *ok(int k, int position, T *good) { return k <= position ? nullptr : good; }

// Each row calls its routine for each position k from `first` to `last` with
// the arguments from position k on bad (null unless the row says otherwise):
// the first bad one is named, with `value`.
TEST(Arguments, EveryCheckedRoutineNamesTheFirstBadArgument) {
    ASSERT_EQ(idm__native_get_mapfile_names(&g_set), 0);
    const int k650 = idm::kMsg650, k651 = idm::kMsg651;
    const int32_t kBad = idm::kBadParameter, kInt = idm::kInternal;
    struct Row { const char *routine; int32_t (*call)(int k); int first, last; int32_t rc, status; int msgno; uintptr_t value; };
    const Row rows[] = {
        {"sec_idm_register_translator", [](int) { return sec_idm_register_translator(2, "m", tr, cl); }, 1, 1, kBad, kBad, k650, 2},
        {"sec_idm_register_translator", [](int) { return sec_idm_register_translator(-1, nullptr, nullptr, nullptr); }, 1, 1, kBad, kBad, k650, 0xffffffff},
        {"sec_idm_register_translator", [](int k) { return sec_idm_register_translator(1, ok(k, 2, "m"), ok(k, 3, tr), nullptr); }, 2, 4, kBad, kBad, k650, 0},
        {"sec_idm_register_translator", [](int) { return sec_idm_register_translator(1, kEmpty, tr, cl); }, 2, 2, kBad, kBad, k650, at(kEmpty)},
        {"sec_idm_map_identity", [](int k) { return sec_idm_map_identity(ok(k, 1, "m"), ok(k, 2, "id"), nullptr); }, 1, 3, kBad, kBad, k650, 0},
        {"sec_idm_map_identity", [](int) { return sec_idm_map_identity(kEmpty, "id", &g_out); }, 1, 1, kBad, kBad, k650, at(kEmpty)},
        {"sec_idm_map_identity", [](int) { return sec_idm_map_identity("m", kEmpty, &g_out); }, 2, 2, kBad, kBad, k650, at(kEmpty)},
        {"sec_idm_get_groups", [](int k) { return sec_idm_get_groups(ok(k, 1, &g_user), ok(k, 2, &g_count), nullptr); }, 1, 3, kBad, kBad, k650, 0},
        {"sec_idm_get_groups", [](int) { return sec_idm_get_groups(&g_no_length, &g_count, &g_groups); }, 1, 1, kBad, kBad, k650, at(&g_no_length)},
        {"sec_idm_get_groups", [](int) { return sec_idm_get_groups(&g_no_value, &g_count, &g_groups); }, 1, 1, kBad, kBad, k650, at(&g_no_value)},
        {"_sec_idm_get_translator", [](int k) { return _sec_idm_get_translator("m", ok(k, 2, &g_tr), nullptr); }, 2, 3, kBad, 0, 0, 0},
        {"idm__native_match_token", [](int k) { return idm__native_match_token(ok(k, 1, "*"), nullptr); }, 1, 2, kBad, kBad, k650, 0},
        {"idm__native_match_token", [](int) { return idm__native_match_token(kEmpty, kEmpty); }, 1, 1, kBad, kBad, k650, at(kEmpty)},
        {"idm__native_match_token", [](int) { return idm__native_match_token("*", kEmpty); }, 2, 2, kBad, kBad, k650, at(kEmpty)},
        {"idm__native_get_mapfile_names", [](int) { return idm__native_get_mapfile_names(nullptr); }, 1, 1, kInt, kInt, k651, 0},
        {"idm__ready_mapfile", [](int k) { return idm__ready_mapfile(ok(k, 1, "/x"), ok(k, 2, &g_fd), nullptr); }, 1, 3, kInt, kInt, k651, 0},
        {"idm__ready_mapfile", [](int) { return idm__ready_mapfile(kEmpty, &g_fd, &g_stream); }, 1, 1, kInt, kInt, k651, at(kEmpty)},
        {"idm__parse_mapfile", [](int k) { return idm__parse_mapfile(ok(k, 1, "m"), ok(k, 2, "/p"), ok(k, 3, stdin), ok(k, 4, &g_n), nullptr); }, 1, 5, kInt, kInt, k651, 0},
        {"idm__parse_mapfile", [](int) { return idm__parse_mapfile(kEmpty, "/p", stdin, &g_n, &g_entries); }, 1, 1, kInt, kInt, k651, at(kEmpty)},
        {"idm__parse_mapfile", [](int) { return idm__parse_mapfile("m", kEmpty, stdin, &g_n, &g_entries); }, 2, 2, kInt, kInt, k651, at(kEmpty)},
        {"idm__read_mapfile_entries", [](int k) { return idm__read_mapfile_entries(ok(k, 1, "m:a=b"), ok(k, 2, &g_n), nullptr); }, 1, 3, kInt, kInt, k651, 0},
        {"idm__read_mapfile_entries", [](int) { return idm__read_mapfile_entries(kEmpty, &g_n, &g_entries); }, 1, 1, kInt, kInt, k651, at(kEmpty)},
        {"idm__read_mapfile_entries", [](int) { return idm__read_mapfile_entries("m:a=b", &g_negative, &g_entries); }, 2, 2, kInt, kInt, k651, 0xffffffff},
        {"idm__read_mapfile_entries", [](int) { return idm__read_mapfile_entries("m:a=b", &g_n, &g_stray); }, 3, 3, kInt, kInt, k651, at(&g_stray)},
        {"idm__alloc_entries", [](int) { return idm__alloc_entries(-1, nullptr); }, 1, 1, kInt, kInt, k651, 0xffffffff},
        {"idm__alloc_entries", [](int) { return idm__alloc_entries(0, nullptr); }, 2, 2, kInt, kInt, k651, 0},
        {"idm__native_read_mapfiles", [](int k) { return idm__native_read_mapfiles(ok(k, 1, "m"), ok(k, 2, &g_set), ok(k, 3, &g_n), nullptr); }, 1, 4, kInt, kInt, k651, 0},
        {"idm__native_read_mapfiles", [](int) { return idm__native_read_mapfiles(kEmpty, &g_set, &g_n, &g_entries); }, 1, 1, kInt, kInt, k651, at(kEmpty)},
        {"idm__native_test_mapfiles", [](int) { return idm__native_test_mapfiles(nullptr); }, 1, 1, idm::kUnchanged, kBad, k651, 0},
        {"idm__native_test_mapfiles_v1", [](int) { return idm__native_test_mapfiles_v1(nullptr, -1, -2); }, 1, 1, kInt, kInt, k651, 0},
        {"idm__native_test_mapfiles_v1", [](int) { return idm__native_test_mapfiles_v1(&g_hollow, 0, -1); }, 1, 1, kInt, kInt, k651, at(&g_hollow)},
        {"idm__native_test_mapfiles_v1", [](int) { return idm__native_test_mapfiles_v1(g_set, -1, -2); }, 2, 2, kInt, kInt, k651, 0xffffffff},
        {"idm__native_test_mapfiles_v1", [](int) { return idm__native_test_mapfiles_v1(g_set, 3, -1); }, 2, 2, kInt, kInt, k651, 3},
        {"idm__native_test_mapfiles_v1", [](int) { return idm__native_test_mapfiles_v1(g_set, 0, -2); }, 3, 3, kInt, kInt, k651, 0xfffffffe},
        {"idm__native_test_mapfiles_v1", [](int) { return idm__native_test_mapfiles_v1(g_set, 0, 3); }, 3, 3, kInt, kInt, k651, 3},
        {"idm__native_test_mapfiles_v1", [](int) { return idm__native_test_mapfiles_v1(g_set, 1, 1); }, 3, 3, kInt, kInt, k651, 1},
        {"idm__extract_attr_value", [](int k) { return idm__extract_attr_value(ok(k, 1, "x"), ok(k, 2, &g_n), nullptr, ';'); }, 1, 3, kInt, kInt, k651, 0},
        {"idm__getnode", [](int) { return idm__getnode(nullptr, nullptr, -1, nullptr); }, 4, 4, kInt, kInt, k651, 0},
        {"idm__getnode", [](int) { return idm__getnode(nullptr, nullptr, -1, &g_node); }, 1, 1, kInt, kInt, k651, 0},
        {"idm__getnode", [](int) { return idm__getnode("k", g_clusters, -1, &g_node); }, 3, 3, kInt, kInt, k651, 0xffffffff},
        {"idm__getnode", [](int) { return idm__getnode("k", nullptr, 1, &g_node); }, 3, 3, kInt, kInt, k651, 1},
    };
    for (const Row &r : rows)
        for (int k = r.first; k <= r.last; ++k) {
            oxtest::clear_errors();
            char value[16];
            std::snprintf(value, sizeof value, "%x", static_cast<unsigned>(r.value));
            EXPECT_EQ(r.call(k), r.rc) << r.routine << " " << k;
            EXPECT_TRUE(r.msgno == 0 ? oxtest::nothing_reported()
                                     : oxtest::reported(r.status, r.msgno, {r.routine, std::to_string(k), value})) << k;
            EXPECT_EQ(oxtest::reports_since_clear(), r.msgno != 0 ? 1u : 0u) << r.routine << " " << k;
        }
    EXPECT_TRUE(g_out.length == 77 && g_out.value == kRoot && g_count == 99 && g_groups == &g_out);
    EXPECT_TRUE(g_n == 0 && g_entries == nullptr && g_fd == -7 && g_stream == nullptr && g_tr == nullptr);
    idm__native_release_cachef(g_set);
}

}  // namespace
