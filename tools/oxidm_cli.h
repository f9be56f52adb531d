// Shared pieces of the oxidm command: the context every subcommand gets,
// exit statuses, and the error text of the libox_cu stand-in.
#ifndef OXIDM_TOOL_CLI_H
#define OXIDM_TOOL_CLI_H

#include <string>
#include <vector>

#include "oxidm_tracefmt.h"

namespace oxidm_tool {

// Exit statuses: an answer, no answer (no mapping granted, host not
// listed), an error (the library's message on stderr), or bad usage.
enum Exit : int { kExitAnswer = 0, kExitNoAnswer = 1, kExitError = 2 };

struct Context {
    bool json = false;
    std::string root;          // --root DIR, or empty
    bool tracing = false;      // inside `oxidm trace`
    TraceLevels trace_levels;  // levels chosen by `oxidm trace`
};

using Args = std::vector<std::string>;

// The current error of libox_cu (this thread) as one trimmed text, or "".
std::string library_error();
// Forgets the current error before a call whose reports are looked at.
void clear_library_error();
// "oxidm: WHAT: TEXT" on stderr.
void complain(const std::string &what, const std::string &text);
// True when args hold -h or --help (before a "--").
bool wants_help(const Args &args);
// Removes --json from args (sets ctx.json); returns the rest.
Args take_json(Context &ctx, const Args &args);

int cmd_map(Context &ctx, const Args &args);
int cmd_explain(Context &ctx, const Args &args);
int cmd_groups(Context &ctx, const Args &args);
int cmd_cluster(Context &ctx, const Args &args);
int cmd_check(Context &ctx, const Args &args);
int cmd_trace(Context &ctx, const Args &args);
int run_subcommand(Context &ctx, const Args &args);

}  // namespace oxidm_tool

#endif
