// Every trace point of component "_SEI": one row each, the only place where a
// trace id is written as a number.  The library records by these names, the
// oxidm tool reads decisions back by them and decodes records with their item
// names, and the test suite walks the table.  The ids are part of the
// component's interface: never renumber a row.
//
// A row: name, id, category, the levels that record it, routine, what it
// marks, its data items (", "-separated; a name starting with '#' is an
// 8-byte count or time rather than an address; no items: a bare id).
// Levels: kL1, kL2, kL8 test the category's level for that value; kAny is any
// non-zero level; kOrDiag also records while the Diag category is on.  The
// Error category stands for "Error or Diag on", as the library tests it.
#ifndef OXIDM_TRACEPOINTS_H
#define OXIDM_TRACEPOINTS_H

#include <cstddef>
#include <cstdint>

// clang-format off
#define OXIDM_TRACE_POINTS(X) \
    X(kRoutineEndName,          2, kApi, kL1, "idm__trace_routine_end", "end of routine", "routine") \
    X(kRoutineEndData,          3, kApi, kL8, "idm__trace_routine_end", "end of routine", "routine, status") \
    X(kReadMapfilesEntry,       4, kApi, kL1 | kL8, "idm__native_read_mapfiles", "entry", "") \
    X(kReadMapfilesExit,        5, kApi, kL1, "idm__native_read_mapfiles", "exit", "") \
    X(kReadMapfilesBadArg,      6, kError, kAny, "idm__native_read_mapfiles", "bad argument", "position, value") \
    X(kReadMapfilesArgs,        8, kApi, kL8 | kOrDiag, "idm__native_read_mapfiles", "arguments", \
      "mechanism, set location, set, count location, count, array location, array") \
    X(kReadMapfilesParsing,     9, kDiag, kAny, "idm__native_read_mapfiles", "Diag: file about to be parsed", "path") \
    X(kReadMapfilesExitData,   12, kApi, kL8, "idm__native_read_mapfiles", "exit data", \
      "status, set location, set, count location, count, array location") \
    X(kMapfileNamesEntry,      13, kApi, kL1, "idm__native_get_mapfile_names", "entry", "") \
    X(kMapfileNamesEntryData,  15, kApi, kL8, "idm__native_get_mapfile_names", "entry data", "set_out, *set_out") \
    X(kMapfileNamesExit,       16, kApi, kL1 | kL8, "idm__native_get_mapfile_names", "exit", "") \
    X(kMapfileNamesFile,       17, kApi, kL8, "idm__native_get_mapfile_names", "exit data: file of the set", "index, path") \
    X(kMapfileNamesBadArg,     21, kError, kAny, "idm__native_get_mapfile_names", "bad argument", "position, value") \
    X(kMapfileNamesNoMemory,   22, kError, kAny, "idm__native_get_mapfile_names", "allocation failure", "site, bytes") \
    X(kReadyEntry,             24, kApi, kL1, "idm__ready_mapfile", "entry", "") \
    X(kReadyEntryData,         26, kApi, kL8, "idm__ready_mapfile", "entry data", "path, descriptor location, stream location") \
    X(kReadyExit,              27, kApi, kL1, "idm__ready_mapfile", "exit", "") \
    X(kReadyExitData,          29, kApi, kL8, "idm__ready_mapfile", "exit data", "status, path, descriptor, stream") \
    X(kReadyOpened,            30, kDiag, kAny, "idm__ready_mapfile", "Diag: sec__open_file", "path, result, descriptor") \
    X(kReadyLocked,            31, kDiag, kAny, "idm__ready_mapfile", "Diag: sec__readlock_file", "path, result") \
    X(kReadyStream,            32, kDiag, kAny, "idm__ready_mapfile", "Diag: stream opened", "") \
    X(kReadyNoStream,          34, kDiag, kAny, "idm__ready_mapfile", "Diag: stream not opened", "path, errno, stream") \
    X(kReadyBadArg,            35, kError, kAny, "idm__ready_mapfile", "bad argument", "position") \
    X(kParseEntry,             36, kApi, kL1, "idm__parse_mapfile", "entry", "") \
    X(kParseEntryData,         38, kApi, kL8, "idm__parse_mapfile", "entry data", "stream, count location, count, array location") \
    X(kParseExit,              39, kApi, kL1, "idm__parse_mapfile", "exit", "") \
    X(kParseExitData,          40, kApi, kL8, "idm__parse_mapfile", "exit data", "status, count, array location") \
    X(kParseFile,              42, kDiag, kAny, "idm__parse_mapfile", "Diag: reading file", "path, mechanism") \
    X(kParseLine,              43, kDiag, kAny, "idm__parse_mapfile", "Diag: line as read", "line") \
    X(kParseEmptyLine,         44, kDiag, kAny, "idm__parse_mapfile", "Diag: empty line", "") \
    X(kParseSkippedLine,       45, kDiag, kAny, "idm__parse_mapfile", "Diag: line skipped (blank, comment or other mechanism)", "") \
    X(kParseEnd,               46, kDiag, kAny, "idm__parse_mapfile", "Diag: reading ended", "") \
    X(kParseBadArg,            47, kError, kAny, "idm__parse_mapfile", "bad argument", "position, value") \
    X(kEntriesEntry,           48, kApi, kL1, "idm__read_mapfile_entries", "entry", "") \
    X(kEntriesEntryData,       50, kApi, kL8, "idm__read_mapfile_entries", "entry data", "line, count, array location") \
    X(kEntriesExit,            51, kApi, kL1, "idm__read_mapfile_entries", "exit", "") \
    X(kEntriesExitData,        53, kApi, kL8, "idm__read_mapfile_entries", "exit data", "status, array location") \
    X(kEntriesGrow,            55, kDiag, kAny, "idm__alloc_entries", "Diag: entry array grows", "count, bytes") \
    X(kEntriesInvalidLine,     56, kDiag, kAny, "idm__read_mapfile_entries", "Diag: invalid line ignored", "") \
    X(kEntriesNewEntry,        58, kDiag, kAny, "idm__read_mapfile_entries", "Diag: new entry", "#read_time, kind, network_id, local_id") \
    X(kEntriesBadArg,          59, kError, kAny, "idm__read_mapfile_entries", "bad argument", "position, value") \
    X(kEntriesGrowFailed,      61, kError, kAny, "idm__alloc_entries", "allocation failure", "bytes") \
    X(kEntriesNoNetworkCopy,   62, kError, kAny, "idm__read_mapfile_entries", "allocation failure: network identifier", "bytes") \
    X(kEntriesNoLocalCopy,     65, kError, kAny, "idm__read_mapfile_entries", "allocation failure: local identifier", "bytes") \
    X(kTestFileEntry,          67, kApi, kL1 | kL8, "idm__native_test_mapfiles_v1", "entry", "") \
    X(kTestFileAppeared,       68, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: file appeared", "path") \
    X(kTestFileAppearedInUse,  69, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: appeared file selected", "path") \
    X(kTestFileSameSecond,     70, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: parsed in the second of its change, read again", "path") \
    X(kTestFileSuperseded,     71, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: superseded", "path, superseded by") \
    X(kTestFileStillPresent,   72, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: still present", "path") \
    X(kTestFileSelected,       73, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: selected", "path") \
    X(kTestFileTimeChanged,    74, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: modification time changed", "path") \
    X(kTestFileUnchanged,      75, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: unchanged (or still absent)", "path") \
    X(kTestFileRemoved,        76, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: removed", "path") \
    X(kTestFileUnsuperseded,   77, kDiag, kAny, "idm__native_test_mapfiles_v1", "Diag: superseding file removed, read again", "path") \
    X(kTestFileExit,           78, kApi, kL1, "idm__native_test_mapfiles_v1", "exit", "") \
    X(kTestFileExitData,       79, kApi, kL8, "idm__native_test_mapfiles_v1", "exit data", "result") \
    X(kTestFilesEntry,         80, kApi, kL1 | kL8, "idm__native_test_mapfiles", "entry", "") \
    X(kTestFilesBadArg,        81, kError, kAny, "idm__native_test_mapfiles", "bad argument", "position, value") \
    X(kTestFilesBadVersion,    82, kError, kAny, "idm__native_test_mapfiles", "layout version not 1", "version") \
    X(kTestFilesState,         83, kDiag, kAny, "idm__native_test_mapfiles", "Diag: file state", \
      "index, path, present, in use, removed, reread, mtime, read_time") \
    X(kTestFilesExit,          84, kApi, kL1, "idm__native_test_mapfiles", "exit", "") \
    X(kTestFilesExitData,      85, kApi, kL8, "idm__native_test_mapfiles", "exit data", "result") \
    X(kMapfileReleased,        87, kDiag, kAny, "idm__thread_cleanup_mapfile", "Diag: open file released", "path, descriptor, stream") \
    X(kRegisterEntry,          88, kApi, kL1, "sec_idm_register_translator", "entry", "") \
    X(kRegisterEntryData,      90, kApi, kL8, "sec_idm_register_translator", "entry data", "mapping type, mnemonic, translator, cleanup") \
    X(kRegisterExit,           91, kApi, kL1, "sec_idm_register_translator", "exit", "") \
    X(kRegisterExitData,       92, kApi, kL8, "sec_idm_register_translator", "exit data", "status, state word 0, translator count") \
    X(kMapEntry,               93, kApi, kL1, "sec_idm_map_identity", "entry", "") \
    X(kMapEntryData,           95, kApi, kL8, "sec_idm_map_identity", "entry data", "mnemonic, network identity, result buffer") \
    X(kMapExit,                96, kApi, kL1, "sec_idm_map_identity", "exit", "") \
    X(kMapExitData,            97, kApi, kL8, "sec_idm_map_identity", "exit data", "status, state word 0") \
    X(kGroupsEntry,            98, kApi, kL1, "sec_idm_get_groups", "entry", "") \
    X(kGroupsEntryData,       100, kApi, kL8, "sec_idm_get_groups", "entry data", "user buffer, count location, list location") \
    X(kGroupsExit,            101, kApi, kL1, "sec_idm_get_groups", "exit", "") \
    X(kGroupsExitData,        102, kApi, kL8, "sec_idm_get_groups", "exit data", "status") \
    X(kNativeRegisterEntry,   103, kApi, kL1, "idm__native_register_translator", "entry", "") \
    X(kNativeRegisterEntryData, 105, kApi, kL8, "idm__native_register_translator", "entry data", "mnemonic, translator, cleanup") \
    X(kNativeRegisterExit,    106, kApi, kL1, "idm__native_register_translator", "exit", "") \
    X(kNativeRegisterExitData, 107, kApi, kL8, "idm__native_register_translator", "exit data", "status") \
    X(kNativeMapEntry,        108, kApi, kL1, "idm__native_map_identity", "entry", "") \
    X(kNativeMapEntryData,    110, kApi, kL8, "idm__native_map_identity", "entry data", "mnemonic, network identity, result buffer") \
    X(kNativeMapExit,         111, kApi, kL1, "idm__native_map_identity", "exit", "") \
    X(kNativeMapExitData,     112, kApi, kL8, "idm__native_map_identity", "exit data", "status") \
    X(kNativeGroupsEntry,     113, kApi, kL1, "idm__native_get_groups", "entry", "") \
    X(kNativeGroupsEntryData, 115, kApi, kL8, "idm__native_get_groups", "entry data", "user buffer, count location, list location") \
    X(kNativeGroupsExit,      116, kApi, kL1, "idm__native_get_groups", "exit", "") \
    X(kNativeGroupsExitData,  117, kApi, kL8, "idm__native_get_groups", "exit data", "status") \
    X(kCheckRuleEntry,        118, kApi, kL1, "idm__native_check_rule", "entry", "") \
    X(kCheckRuleEntryData,    120, kApi, kL8, "idm__native_check_rule", "entry data", "rule") \
    X(kCheckRuleExit,         121, kApi, kL1, "idm__native_check_rule", "exit", "") \
    X(kCheckRuleExitData,     122, kApi, kL8, "idm__native_check_rule", "exit data", "status") \
    X(kCheckIdEntry,          123, kApi, kL1, "idm__native_check_id", "entry", "") \
    X(kCheckIdEntryData,      125, kApi, kL8, "idm__native_check_id", "entry data", "id") \
    X(kCheckIdExit,           126, kApi, kL1, "idm__native_check_id", "exit", "") \
    X(kCheckIdExitData,       127, kApi, kL8, "idm__native_check_id", "exit data", "status") \
    X(kApplyEntry,            128, kApi, kL1, "idm__native_apply_rule", "entry", "") \
    X(kApplyEntryData,        130, kApi, kL8, "idm__native_apply_rule", "entry data", "rule, id, result") \
    X(kApplyMatched,          131, kMapping, kL2 | kL8, "idm__native_apply_rule", "Mapping: rule and id matched", \
      "rule rgy_type, rule rgy, rule token_cnt, rule tokens, id rgy_type, id rgy, id token_cnt, id tokens") \
    X(kApplyResult,           133, kMapping, kL2 | kL8, "idm__native_apply_rule", "Mapping: result", "local identity") \
    X(kApplyExit,             134, kApi, kL1, "idm__native_apply_rule", "exit", "") \
    X(kApplyExitData,         135, kApi, kL8, "idm__native_apply_rule", "exit data", "status") \
    X(kDumpRule,              136, kApi, kL8, "idm__trace_native_rule", "rule", "rule_state, rgy_type, rgy, token_cnt") \
    X(kDumpId,                137, kApi, kL8, "idm__trace_native_id", "id", "rgy_type, rgy, token_cnt") \
    X(kDumpRuleMapping,       138, kApi, kL8, "idm__trace_native_rule", "rule mapping", "length, value") \
    X(kDumpToken,             139, kApi, kL8, "idm__trace_native_rule/id", "token", "position, token") \
    X(kActiveEntry,           140, kApi, kL1, "sec_is_in_active_cluster", "entry", "") \
    X(kActiveEntryData,       141, kApi, kL8, "sec_is_in_active_cluster", "entry data", "host") \
    X(kActiveExit,            142, kApi, kL1, "sec_is_in_active_cluster", "exit", "") \
    X(kActiveExitData,        143, kApi, kL8, "sec_is_in_active_cluster", "exit data", "answer") \
    X(kAnyEntry,              144, kApi, kL1, "sec_is_in_any_cluster", "entry", "") \
    X(kAnyEntryData,          145, kApi, kL8, "sec_is_in_any_cluster", "entry data", "host") \
    X(kAnyExit,               146, kApi, kL1, "sec_is_in_any_cluster", "exit", "") \
    X(kAnyExitData,           147, kApi, kL8, "sec_is_in_any_cluster", "exit data", "answer") \
    X(kClmapInitEntry,        148, kApi, kL1 | kL8, "sec__idm_clmap_init", "entry", "") \
    X(kClmapInitExit,         149, kApi, kL1 | kL8, "sec__idm_clmap_init", "exit", "") \
    X(kNamesEntry,            150, kApi, kL1, "sec__get_cluster_names", "entry", "") \
    X(kNamesEntryData,        151, kApi, kL8, "sec__get_cluster_names", "entry data", "host") \
    X(kNamesExit,             152, kApi, kL1, "sec__get_cluster_names", "exit", "") \
    X(kNamesExitData,         153, kApi, kL8, "sec__get_cluster_names", "exit data", "result") \
    X(kNodeFileStart,         154, kApi, kAny, "idm__read_clmap_file", "start", "") \
    X(kNodeFileParsing,       155, kDiag, kAny, "idm__construct_clcfg", "Diag: parsing", "text, #length") \
    X(kNodeRecordIncomplete,  157, kError, kAny, "idm__construct_clcfg", "error: host record incomplete", "") \
    X(kNodeRecordComplete,    158, kDiag, kAny, "idm__construct_clcfg", "Diag: host record complete", "") \
    X(kNodeRecordName,        159, kDiag, kAny, "idm__construct_clcfg", "Diag: name", "index, value") \
    X(kNodeRecordAddress,     160, kDiag, kAny, "idm__construct_clcfg", "Diag: address", "index, value") \
    X(kNodeRecordCluster,     161, kDiag, kAny, "idm__construct_clcfg", "Diag: cluster", "index, value") \
    X(kNodeNoTreeRecord,      162, kDiag, kAny, "idm__construct_clcfg", "Diag: tree record not made", "attribute, value") \
    X(kNodeNoMemory,          163, kError, kAny, "idm__construct_clcfg", "allocation failure", "site, #bytes") \
    X(kNodeNoColon,           164, kError, kAny, "idm__construct_clcfg", "error: NODE without \":\"", "") \
    X(kNameMisplaced,         165, kError, kAny, "idm__construct_clcfg", "error: NAME outside a host record, or repeated", "") \
    X(kNameNoColon,           166, kError, kAny, "idm__construct_clcfg", "error: NAME without \":\"", "") \
    X(kAddressMisplaced,      167, kError, kAny, "idm__construct_clcfg", "error: ADDRESS outside a host record, or repeated", "") \
    X(kAddressNoColon,        168, kError, kAny, "idm__construct_clcfg", "error: ADDRESS without \":\"", "") \
    X(kClusterMisplaced,      169, kError, kAny, "idm__construct_clcfg", "error: CLUSTER outside a host record, or repeated", "") \
    X(kClusterNoColon,        170, kError, kAny, "idm__construct_clcfg", "error: CLUSTER without \":\"", "") \
    X(kNoKeyword,             171, kError, kAny, "idm__construct_clcfg", "error: statement without a keyword", "") \
    X(kTreeInsertFailed,      172, kError, kAny, "idm__construct_clcfg", "error: tree insertion failed", "attribute") \
    X(kNodeFileEnd,           173, kApi, kAny, "idm__read_clmap_file", "end", "status")
// clang-format on

namespace idm::trace {

enum Category : int { kError = 0, kApi = 1, kMapping = 2, kMilestone = 3, kDiag = 4 };
inline constexpr const char *kCategoryNames[5] = {"Error", "API", "Mapping", "Milestone", "Diag"};

// The levels of its category at which a point is recorded.
enum Levels : uint8_t { kL1 = 0x1, kL2 = 0x2, kL8 = 0x4, kAny = 0x8, kOrDiag = 0x10 };

// A trace id by name: tp::kMapEntry is 93.
namespace tp {
enum Id : int {
#define OXIDM_TP_ENUM(name, id, ...) name = id,
    OXIDM_TRACE_POINTS(OXIDM_TP_ENUM)
#undef OXIDM_TP_ENUM
};
}  // namespace tp

struct TracePoint {
    tp::Id id;
    const char *name;  // the enumerator's name without its 'k'
    Category category;
    uint8_t levels;
    const char *routine;
    const char *what;
    const char *items;  // ", "-separated; "" for a bare id
};

inline constexpr TracePoint kTracePoints[] = {
#define OXIDM_TP_ROW(name, id, category, levels, routine, what, items) \
    {tp::name, &#name[1], category, static_cast<uint8_t>(levels), routine, what, items},
    OXIDM_TRACE_POINTS(OXIDM_TP_ROW)
#undef OXIDM_TP_ROW
};

// The row of an id, or null when the library has no such point.
constexpr const TracePoint *find_point(int id) {
    for (const TracePoint &p : kTracePoints)
        if (p.id == id) return &p;
    return nullptr;
}

// Every id stands once, and every row names a level that records it.
constexpr bool table_is_sound() {
    for (size_t i = 0; i < sizeof kTracePoints / sizeof kTracePoints[0]; ++i) {
        if (kTracePoints[i].levels == 0) return false;
        for (size_t j = 0; j < i; ++j)
            if (kTracePoints[j].id == kTracePoints[i].id) return false;
    }
    return true;
}
static_assert(table_is_sound(), "a trace id stands twice, or a row names no level");

// Whether a point is recorded at these levels of the five categories.
constexpr bool recorded_at(const TracePoint &p, const unsigned char (&levels)[5]) {
    const unsigned char l = p.category == kError ? (levels[kError] | levels[kDiag]) : levels[p.category];
    if (l == 0) return (p.levels & kOrDiag) != 0 && levels[kDiag] != 0;
    if ((p.levels & kAny) != 0 || ((p.levels & kOrDiag) != 0 && levels[kDiag] != 0)) return true;
    return ((p.levels & kL1) != 0 && l == 1) || ((p.levels & kL2) != 0 && l == 2) || ((p.levels & kL8) != 0 && l == 8);
}

// The four points of a routine traced with the entry and exit pattern: the
// entry at API level 1, its data at level 8, the exit likewise.  A routine
// that records a bare id at both levels names that id twice.
struct ApiIds {
    tp::Id entry, entry_data, exit, exit_data;
};

}  // namespace idm::trace

#endif
