// Diagnostics layer of libox_idm: the statuses every routine returns, the
// numbered messages it reports them with, and the trace points.  Nothing
// here holds state; a failure is reported once, where it is detected, and
// the status is passed up unchanged from there.
#ifndef OXIDM_DIAG_H
#define OXIDM_DIAG_H

#include <cstddef>
#include <cstdint>

#include "ox_cu.h"
#include "oxidm.h"
#include "oxidm_trace.h"
#include "oxseclib_msg.h"

namespace idm {

// ---- statuses ----
//
// One enum for every status the library returns or acts on.  Those a caller
// or a plug-in sees carry the names of include/oxidm.h.
enum Status : int32_t {
    kOk = IDM_OK,
    kUnchanged = 1,                                  // map files unchanged; host not listed
    kBadParameter = IDM_E_BAD_PARAMETER,             // 2650-650 (also 2650-651 of the change test)
    kNoMemory = IDM_E_NO_MEMORY,                     // 2650-654, 2650-658
    kGroupsUnavailable = IDM_E_GROUPS,               // 2650-698, 2650-699, 2650-700
    kNodeFileInvalid = IDM_E_NODE_FILE,              // 2650-690, 2650-692, 2650-693, 2650-694
    kNoTranslator = IDM_E_NO_TRANSLATOR,             // 2650-660
    kInternal = IDM_E_INTERNAL,                      // 2650-651, 655, 657, 658, 661, 691
    kMapfileLocked = IDM_E_MAPFILE_LOCKED,           // 2650-656
    kTranslatorStop = IDM_TRANSLATOR_STOP,           // a translator ended the walk
    kMapfileInaccessible = IDM_E_MAPFILE_ACCESS,     // 2650-653, 2650-654
    kMapfileMissing = 37,                            // vanished before it was opened; no message
    kRuleInvalid = IDM_E_RULE,                       // 2650-662 to 2650-667; a translator's rejection
    kTranslatorRefused = IDM_TRANSLATOR_REFUSED,     // a translator refused an entry for good
};

// Results of the libox_mss file calls that the map file reader tells apart.
enum MssResult : int {
    kMssOk = 0,
    kMssNoMemory = 6,
    kMssAccessDenied = 12,
    kMssMissing = 21,
    kMssNotRegularFile = 22,
    kMssLockTimeout = 30,
};

// ---- error reporting ----

inline constexpr const char kCatalog[] = "oxseclib.cat";

// Records one failure with cu_set_error_1 and returns its status.  Inserts
// follow the message's positional conversions: const char* for %s, int for
// %d, and a pointer-sized value (see hex()) for the "0x%3$x" insert.
template <class... Inserts>
inline int32_t report(Status status, Msg msg, Inserts... inserts) {
    return cu_set_error_1(status, 0, kCatalog, 1, msg, cu_mesgtbl_oxseclib_msg[msg], inserts...);
}

// The offending parameter's value as the "0x%3$x" insert: always passed
// pointer-sized, so a receiver reading either width sees the low 32 bits.
inline const void *hex(uintptr_t value) { return reinterpret_cast<const void *>(value); }
template <class T>
inline const void *hex(T *p) { return p; }

// 2650-650 from an exported function.
inline int32_t report_bad_param(const char *function, int position, const void *value) {
    return report(kBadParameter, kMsg650, function, position, value);
}
// 2650-651 from an internal routine.
inline int32_t report_bad_internal_param(Status status, const char *function, int position, const void *value) {
    return report(status, kMsg651, function, position, value);
}
// 2650-654: allocation of `bytes` failed in `function`.
inline int32_t report_no_memory(const char *function, size_t bytes, Status status = kNoMemory) {
    return report(status, kMsg654, function, static_cast<int>(bytes));
}

}  // namespace idm

#endif
