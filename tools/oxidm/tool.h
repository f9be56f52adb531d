// Shared pieces of the oxidm command.  Every command builds one Result (a
// JSON document, the exit status, the errors met) from the library's
// answers; main renders it either as that document (--json) or as text
// through the command's own renderer.  Nothing prints while a command runs.
#ifndef OXIDM_TOOL_TOOL_H
#define OXIDM_TOOL_TOOL_H

#include <CLI/CLI.hpp>
#include <functional>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "checker.h"
#include "oxidm.h"
#include "tracefmt.h"

namespace oxidm_tool {

using Json = nlohmann::ordered_json;

// Exit statuses: an answer, no answer (no mapping granted, host not listed,
// errors in a checked file), an error or bad usage (a message on stderr).
enum Exit : int { kExitAnswer = 0, kExitNoAnswer = 1, kExitError = 2 };

struct Result {
    int exit = kExitAnswer;
    Json json = Json::object();
    // "WHAT: TEXT" pairs: on stderr as text, under "errors" in JSON.
    std::vector<std::pair<std::string, std::string>> errors;
    // A long array rendered one element at a time after `json` under
    // `stream_key`, so that no document of it is held whole in memory.
    std::string stream_key;
    std::function<void(const std::function<void(const Json &)> &)> stream;
    void fail(const std::string &what, const std::string &text) {
        errors.emplace_back(what, text);
        exit = kExitError;
    }
    void at_least(int e) { exit = std::max(exit, e); }
};

// Options every command takes, wherever they stand on the line.
struct Options {
    bool json = false;
    std::string root;                  // --root DIR
    std::vector<std::string> plugins;  // --plugin PATH...
    bool tracing = false;              // inside `oxidm trace`
    TraceLevels trace_levels;          // levels chosen by `oxidm trace`
};

// One command: its CLI11 subcommand, what runs it, how its result reads.
struct Command {
    CLI::App *app = nullptr;
    std::function<Result()> run;
    std::function<void(const Json &)> text;  // renders the result on stdout
    bool own_root = false;                   // handles --root itself (no namespace)
};
using CommandList = std::vector<Command>;
// Each command's file adds its subcommand.
void add_map(CLI::App &app, Options &o, CommandList &out);
void add_explain(CLI::App &app, Options &o, CommandList &out);
void add_groups(CLI::App &app, Options &o, CommandList &out);
void add_cluster(CLI::App &app, Options &o, CommandList &out);
void add_check(CLI::App &app, Options &o, CommandList &out);
void add_install(CLI::App &app, Options &o, CommandList &out);
void add_trace(CLI::App &app, Options &o, CommandList &out);
void add_mechanisms(CLI::App &app, Options &o, CommandList &out);
// Parses args into a fresh interface and runs the chosen command (`oxidm
// trace`); `text` receives the command's renderer.
Result run_inner(Options &o, const std::vector<std::string> &args, std::function<void(const Json &)> &text);

// ---- the library's reports and files ----

// The current error of libox_cu (this thread) on one line, or "".
std::string library_error();
void clear_library_error();
// "2650-666 libox_idm Failure: ..." reads "2650-666 ...".
std::string short_message(const std::string &text);
// A text for the terminal: control characters escaped.
std::string printable(const std::string &s);

inline constexpr const char *kLocalMap = "/var/ox/cfg/oxsec_map.local";
inline constexpr const char *kVarGlobalMap = "/var/ox/cfg/oxsec_map.global";
inline constexpr const char *kOptGlobalMap = "/opt/helvo/cfg/oxsec_map.global";
inline constexpr const char *kNodeInfo = "/var/ox/cfg/oxsec.nodeinfo";
// Reads a whole regular file; false with `error` ("PATH: reason") when the
// path is not one or cannot be opened or read: never "empty".
bool read_file(const std::string &path, std::string &out, std::string &error);
// Whether `path` exists; false with `error` when that cannot be told (a
// directory on the way cannot be searched).  The library takes such a file
// for absent; the command says so instead.
bool exists(const std::string &path, bool &present, std::string &error);
// The first of `paths` whose existence cannot be told, as an error, or "".
std::string unreadable_config(std::initializer_list<const char *> paths);

// ---- mechanisms ----

struct Mechanism {
    std::string mnemonic, summary;  // summary: what its identities look like
    std::string source;             // "built in" or the plug-in's path
    check::Translator routines;
};
// Loads every --plugin (see mpm/oxmpm_plugin.h); false with `error`.
bool load_plugins(const Options &o, std::string &error);
const std::vector<Mechanism> &mechanisms();
// The latest loaded of that mnemonic, or null.
const Mechanism *find_mechanism(const std::string &mnemonic);

// ---- one mapping request, watched (map, explain) ----
// The mechanism's routines are registered through wrappers that call them
// unchanged and tell the watch of every translator call; the library's
// trace records stream to it as they are written (none is kept), so a walk
// over any number of lines is seen whole.

struct TranslatorCall {
    bool has_entry = false;
    std::string network_id;
    int32_t status = 0;
    // The error reported since the previous call returned (while the
    // previous entry was handled), or 0 and "".
    int msgno_before = 0;
    std::string message_before;
};
struct Watch {
    bool (*wants)(int id) = nullptr;  // the record ids on_record is shown (null: all)
    std::function<void(const TraceRecord &)> on_record;
    std::function<void(const TranslatorCall &)> on_call_start;  // every earlier record delivered
    std::function<void(const TranslatorCall &)> on_call_end;    // with the status
};
struct MapOutcome {
    int32_t status = 0;
    bool granted = false;
    std::string local, error;
    int msgno_after = 0;  // the error reported after the last translator call
    std::string message_after;
};
// Registers the mechanism's watched routines; "" or the error.
std::string register_watched(const std::string &mnemonic);
// Maps one identity with the trace levels explain needs (`full`) or only the
// match points.
MapOutcome map_watched(const Options &o, const std::string &mnemonic, const std::string &identity, bool full,
                       Watch watch);

// ---- one configuration file checked (check, install) ----
// The checker's verdicts plus what needs the system: owner and mode of the
// file, of every directory above it and of a symbolic link's target, the
// accounts below UID_MIN, the known mechanisms' translators.

struct Checked {
    std::string path;
    bool map = true;
    check::MapfileReport map_report;
    check::NodeinfoReport node_report;
    std::vector<check::Finding> findings;  // all, in line order
    size_t count(check::Severity s) const;
};
// `mechanism`: only its lines; `earlier`: entries of the file the library
// reads first, named `earlier_file`.
Checked check_map_text(const std::string &path, const std::string &text, const std::string *mechanism,
                       const std::vector<check::MapEntry> *earlier = nullptr, const std::string &earlier_file = "");
Checked check_node_text(const std::string &path, const std::string &text);
void permission_findings(const std::string &path, std::vector<check::Finding> &out);
Json checked_json(const Checked &c);
void checked_text(const Json &j);

}  // namespace oxidm_tool

#endif
