// The table of trace points walked once: a session of mapping, group and
// cluster calls (good and bad) runs under each setting of the five levels,
// and every record it leaves must be a row of the table, recorded at a level
// the row names (with all levels 0: nothing at all), with the row's record
// kind and item count; and across the settings every row that such a
// session can reach is reached.
#include <dlfcn.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <set>
#include <string>
#include <string_view>

#include "harness.h"
#include "oxidm_clmap.h"
#include "oxidm_natfile.h"
#include "oxidm_natmap.h"
#include "oxidm_state.h"
#include "oxidm_tracepoints.h"
#include "test_mpm.h"

// libox_tr as this program sees it: the real one, except that while
// g_clobber is set its registration leaves an error of its own behind, as a
// platform library may.
bool g_clobber = false;
extern "C" int tr_register_component_1(const char *component, unsigned char *levels, const tr_category_t *categories,
                                       int count) {
    using Register = int (*)(const char *, unsigned char *, const tr_category_t *, int);
    static const auto real = reinterpret_cast<Register>(dlsym(RTLD_NEXT, "tr_register_component_1"));
    if (g_clobber) cu_set_error_1(99, 0, "other.cat", 2, 3, "registration noise");
    return real(component, levels, categories, count);
}

extern std::atomic<int> g_fdopen_errno;  // test_natfile_files.cpp

namespace {

using idm::trace::kTracePoints;
using idm::trace::TracePoint;
namespace tp = idm::trace::tp;

// The entry's network identifier is the rule's only token, its local
// identifier the mapping; an identity "stop" ends the walk.
int32_t translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    if (std::string_view(network_id) == "stop") return IDM_TRANSLATOR_STOP;
    oxtest::fill_rule_and_id(entry, network_id, rule, id);
    return IDM_OK;
}
int32_t cleanup(idm_rule *rule, idm_id *id) { return oxtest::free_rule_and_id(rule, id); }

size_t item_count(const TracePoint &p) {
    return *p.items == '\0' ? 0 : 1 + static_cast<size_t>(std::count(p.items, p.items + std::strlen(p.items), ','));
}

// Every routine the table names, on its good and its failure paths.  Each
// session's files get times of their own, so that every session reads them.
void session(int64_t mtime) {
    oxtest::write_file(oxtest::kLocalMap,
                       "t:!mallory\n"
                       "t:*=guest   # everyone else\n"
                       "t:broken line\n"
                       "other:joe=joe\n"
                       "\n",
                       mtime);
    auto map = [](const char *who, const char *mechanism = "t") {
        idm_buffer local{};
        sec_idm_map_identity(mechanism, who, &local);
        std::free(local.value);
    };
    idm_buffer local{};
    sec_idm_register_translator(IDM_MAPPING_NATIVE, "t", translate, cleanup);
    for (const char *who : {"joe", "mallory", "stop"}) map(who);
    map("joe", "none");  // no translator
    sec_idm_map_identity(nullptr, "joe", &local);
    sec_idm_register_translator(2, "t", translate, cleanup);

    idm_buffer user{5, const_cast<char *>("root")};
    uint32_t count = 0;
    idm_buffer *groups = nullptr;
    if (sec_idm_get_groups(&user, &count, &groups) == 0) {
        for (uint32_t i = 0; i < count; ++i) std::free(groups[i].value);
        std::free(groups);
    }
    sec_idm_get_groups(nullptr, &count, &groups);

    // The global files appear, supersede each other and go; the local file
    // changes within the second it is read in.
    oxtest::write_file(oxtest::kOptGlobalMap, "t:*=opt\n", mtime);
    map("joe");
    oxtest::write_file(oxtest::kVarGlobalMap, "t:*=var\n", mtime);
    map("joe");
    oxtest::remove_file(oxtest::kVarGlobalMap);
    map("joe");
    oxtest::write_file(oxtest::kLocalMap, "t:joe=joe\n");
    map("joe");
    map("joe");
    g_fdopen_errno = EMFILE;  // no stream for a file that is open
    oxtest::write_file(oxtest::kLocalMap, "t:joe=joe\n", mtime + 1);
    map("joe");
    g_fdopen_errno = 0;

    oxtest::write_file(oxtest::kNodeInfo,
                       "NODE:\n NAME: a.example a\n ADDRESS: 10.0.0.1\n CLUSTER: c1 c2\n", mtime);
    cux_set_active_cluster("c1");
    sec_is_in_any_cluster("a.example");
    sec_is_in_active_cluster("10.0.0.1");
    // One fault of the node file each: every error point of the parser.
    for (const char *text : {"NAME: outside\n", "NODE\n", "NODE:\nNAME a\n", "NODE:\nNAME: a\nADDRESS: 1\nADDRESS: 2\n",
                             "NODE:\nNAME: a\nADDRESS 1\n", "NODE:\nNAME: a\nADDRESS: 1\nCLUSTER: c\nCLUSTER: d\n",
                             "NODE:\nNAME: a\nADDRESS: 1\nCLUSTER c\n", "bogus\n", "NODE:\nNAME: a\nNODE:\n"}) {
        oxtest::write_file(oxtest::kNodeInfo, text, ++mtime);
        sec_is_in_any_cluster("a.example");
    }

    // Internal routines' argument checks and the routine-end point.
    int32_t n = 0;
    idm_mapfile_entry *entries = nullptr;
    idm_mapfile_set *set = nullptr;
    idm__native_get_mapfile_names(&set);
    idm__native_release_cachef(set);
    idm__native_get_mapfile_names(nullptr);
    idm__parse_mapfile(nullptr, "p", stdin, &n, &entries);
    idm__read_mapfile_entries(nullptr, &n, &entries);
    idm__native_read_mapfiles(nullptr, nullptr, &n, &entries);
    idm__native_test_mapfiles(nullptr);
    idm__trace_routine_end("routine", 5);

    // Allocation failures, through the seam of the internal build: each block
    // of a map file set, the copies of a line and the entry array, and the
    // early blocks of a cluster load.
    for (long nth = 1; nth <= 8; ++nth) {
        idm_test_fail_alloc(nth);
        set = nullptr;
        idm__native_get_mapfile_names(&set);
        idm__native_release_cachef(set);
    }
    for (long nth = 1; nth <= 3; ++nth) {
        idm_test_fail_alloc(nth);
        idm__read_mapfile_entries("t:a=b", &n, &entries);
    }
    idm__native_release_entry_list(n, entries);
    for (long nth = 1; nth <= 6; ++nth) {
        oxtest::write_file(oxtest::kNodeInfo, "NODE:\n NAME: b\n ADDRESS: 10.0.0.2\n CLUSTER: c\n", mtime + 100 + nth);
        idm_test_fail_alloc(nth);
        sec_is_in_any_cluster("b");
    }
    idm_test_fail_alloc(0);
}

struct Setting {
    const char *label;
    unsigned char levels[5];  // Error, API, Mapping, Milestone, Diag
};
constexpr Setting kSettings[] = {
    {"API 1", {0, 1, 0, 0, 0}},      {"API 8", {0, 8, 0, 0, 0}},       {"API 2", {0, 2, 0, 0, 0}},
    {"Error 1", {1, 0, 0, 0, 0}},    {"Diag 1", {0, 0, 0, 0, 1}},      {"Mapping 2", {0, 0, 2, 0, 0}},
    {"Mapping 8", {0, 0, 8, 0, 0}},  {"Milestone 8", {0, 0, 0, 8, 0}}, {"all 8", {8, 8, 8, 8, 8}},
    {"all 0: nothing at all", {0, 0, 0, 0, 0}},
};

// Points no session above reaches: a set of a foreign layout version, a
// file released by a cancelled pass, tree records that cannot be made or
// inserted.
const std::set<int> kUnreached = {
    tp::kReadyBadArg, tp::kTestFilesBadVersion, tp::kMapfileReleased, tp::kNodeNoTreeRecord,
    tp::kTreeInsertFailed,
};

class TracePoints : public oxtest::Test {};

TEST_F(TracePoints, EveryRecordIsARowOfTheTableAtItsLevelsAndEveryRowIsReached) {
    OXTEST_REQUIRE_NAMESPACE();
    std::set<int> seen;
    int64_t mtime = 1000;
    for (const Setting &s : kSettings) {
        SCOPED_TRACE(s.label);
        oxtest::set_trace_levels(s.levels[0], s.levels[1], s.levels[2], s.levels[3], s.levels[4]);
        session(mtime += 10);
        for (const oxtest::TraceRecord &r : oxtest::trace_records()) {
            const TracePoint *p = idm::trace::find_point(r.id);
            ASSERT_NE(p, nullptr) << "id " << r.id << " is not in the table";
            EXPECT_TRUE(idm::trace::recorded_at(*p, s.levels)) << p->name << " recorded at a level it does not name";
            const size_t items = item_count(*p);
            if (p->id == tp::kRoutineEndName) EXPECT_EQ(r.kind, TRX_STRINGS);
            else EXPECT_EQ(r.kind, items == 0 ? TRX_ID : TRX_DATA) << p->name;
            EXPECT_EQ(r.items.size(), items) << p->name;
            seen.insert(r.id);
        }
        oxtest::reset_trace();
    }
    for (const TracePoint &p : kTracePoints)
        EXPECT_NE(seen.count(p.id) + kUnreached.count(p.id), 0u) << p.name << " was never recorded";
}

// The first trace point registers the component once, with the five
// categories by number, and the error pending before it is current after it.
TEST_F(TracePoints, RegistrationKeepsThePendingErrorAndNamesTheCategories) {
    ASSERT_EQ(trx_registrations("_SEI"), 0);
    cu_set_error_1(idm::kNodeFileInvalid, 0, "oxseclib.cat", 1, idm::kMsg690, cu_mesgtbl_oxseclib_msg[idm::kMsg690]);
    g_clobber = true;
    EXPECT_EQ(idm__trace_routine_end("", 0), 0);
    g_clobber = false;
    idm__trace_routine_end(nullptr, 0);
    EXPECT_EQ(trx_registrations("_SEI"), 1);
    EXPECT_TRUE(oxtest::reported(idm::kNodeFileInvalid, idm::kMsg690, {}));
    for (int c = 0; c < 5; ++c) EXPECT_STREQ(trx_category_name("_SEI", c), idm::trace::kCategoryNames[c]);
}

// The end of a routine: its name as a text at API level 1, name and status
// as data at level 8, nothing at other levels or without a name.
TEST_F(TracePoints, RoutineEndRecordsTheNameAndTheStatus) {
    struct Row {
        unsigned char api;
        const char *name;
        int kind;  // 0: nothing recorded
    } rows[] = {{1, "idm__x", TRX_STRINGS}, {8, "idm__x", TRX_DATA}, {2, "idm__x", 0}, {8, "", 0}, {8, nullptr, 0}};
    for (const Row &r : rows) {
        oxtest::reset_trace();
        oxtest::set_trace_levels(0, r.api, 0, 0, 0);
        idm__trace_routine_end(r.name, -5);
        const auto records = oxtest::trace_records();
        ASSERT_EQ(records.size(), r.kind == 0 ? 0u : 1u) << int(r.api);
        if (r.kind == 0) continue;
        EXPECT_EQ(records[0].kind, r.kind);
        EXPECT_EQ(records[0].items[0], std::string("idm__x", 7));
        if (r.kind == TRX_DATA) {
            EXPECT_EQ(records[0].i32(1), -5);
            EXPECT_EQ(records[0].items[1].size(), 4u);
        }
    }
}

}  // namespace
