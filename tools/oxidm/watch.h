// One mapping request through the shipped library, watched (map, explain).
//
// The command registers the mechanism's routines through a thin pair of
// wrappers that call the plug-in's own routines unchanged and note, at every
// translator call, which error was current.  The library's trace records
// are streamed to a consumer as they are written (none is kept), so a walk
// over any number of lines is seen whole.
#ifndef OXIDM_TOOL_WATCH_H
#define OXIDM_TOOL_WATCH_H

#include <functional>
#include <string>

#include "tool.h"

namespace oxidm_tool {

// What the watch tells the consumer at a translator call.
struct TranslatorCall {
    bool has_entry = false;
    std::string network_id, local_id;
    int32_t status = 0;
    // The library's error reported since the previous call returned (while
    // the previous entry was handled), or an empty text.
    int msgno_before = 0;
    std::string message_before;
};

struct Watch {
    // The ids on_record is shown (null: all).
    bool (*wants)(int id) = nullptr;
    // Called with each trace record, in order.
    std::function<void(const TraceRecord &)> on_record;
    // Called before each translator call (every earlier record delivered).
    std::function<void(const TranslatorCall &)> on_call_start;
    // Called after it with its status.
    std::function<void(const TranslatorCall &)> on_call_end;
};

struct MapOutcome {
    int32_t status = 0;
    bool granted = false;
    std::string local;
    std::string error;
    // The error reported after the last translator call, or "".
    int msgno_after = 0;
    std::string message_after;
};

// Registers the mechanism's watched routines; "" or the error.
std::string register_watched(const std::string &mnemonic);
// Maps one identity with tracing set for `full` detail (explain) or only the
// match points (map); every record and call goes to `watch`.
MapOutcome map_watched(const Options &o, const std::string &mnemonic, const std::string &identity, bool full,
                       Watch watch);

}  // namespace oxidm_tool

#endif
