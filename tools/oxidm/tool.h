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

#include "oxidm.h"
#include "tracefmt.h"

namespace oxidm_tool {

using Json = nlohmann::ordered_json;

// Exit statuses: an answer, no answer (no mapping granted, host not listed,
// errors in a checked file), an error (a message on stderr), bad usage.
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
// Each command's file adds its subcommand to `app`.
using CommandList = std::vector<Command>;
void add_map(CLI::App &app, Options &o, CommandList &out);
void add_explain(CLI::App &app, Options &o, CommandList &out);
void add_groups(CLI::App &app, Options &o, CommandList &out);
void add_cluster(CLI::App &app, Options &o, CommandList &out);
void add_check(CLI::App &app, Options &o, CommandList &out);
void add_install(CLI::App &app, Options &o, CommandList &out);
void add_trace(CLI::App &app, Options &o, CommandList &out);
void add_mechanisms(CLI::App &app, Options &o, CommandList &out);

// Builds the whole command line interface into `app`.
void build_cli(CLI::App &app, Options &o, CommandList &out);
// Parses args into a fresh interface and runs the chosen command (used by
// `oxidm trace`).  `usage` receives a usage error's text.
Result run_inner(Options &o, const std::vector<std::string> &args, std::function<void(const Json &)> &text);

// ---- the library's reports ----

// The current error of libox_cu (this thread), one line, or "".
std::string library_error();
void clear_library_error();
// "2650-666 libox_idm Failure: ..." reads "2650-666 ...".
std::string short_message(const std::string &text);

// ---- files ----

// Reads a whole regular file.  False with `error` ("PATH: reason") when the
// path is not a regular file or cannot be opened or read: never "empty".
bool read_file(const std::string &path, std::string &out, std::string &error);
// Whether `path` exists.  False with `error` when that cannot be told
// (a directory on the way cannot be searched, ...).
bool exists(const std::string &path, bool &present, std::string &error);

// ---- mechanisms ----

struct Mechanism {
    std::string mnemonic;
    std::string summary;  // one line: what its identities look like
    std::string source;   // "built in" or the plug-in's path
    idm_translator_routine translator;
    idm_cleanup_routine cleanup;
};
// Loads every --plugin once; false with `error` when one cannot be loaded.
bool load_plugins(const Options &o, std::string &error);
const std::vector<Mechanism> &mechanisms();
const Mechanism *find_mechanism(const std::string &mnemonic);

// The map files and the node information file, where the library looks.
inline constexpr const char *kLocalMap = "/var/ox/cfg/oxsec_map.local";
inline constexpr const char *kVarGlobalMap = "/var/ox/cfg/oxsec_map.global";
inline constexpr const char *kOptGlobalMap = "/opt/helvo/cfg/oxsec_map.global";
inline constexpr const char *kNodeInfo = "/var/ox/cfg/oxsec.nodeinfo";
// The first of `paths` whose existence cannot be told (a directory on the
// way cannot be searched), as an error text; "" when all can.  The library
// takes such a file for absent; the command says so instead.
std::string unreadable_config(std::initializer_list<const char *> paths);

// A text for the terminal: control characters escaped.
std::string printable(const std::string &s);

}  // namespace oxidm_tool

#endif
