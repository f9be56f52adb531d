// oxidm: the administrator's command for libox_idm.  Asks the shipped
// library the questions its callers ask (map, groups, cluster), shows why
// it answered as it did (explain, trace), and checks configuration files as
// the library would read them (check).  Every answer printed is the
// library's own; the command adds only wording.
#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>

#include "ox_cu.h"
#include "ox_tr.h"
#include "oxidm.h"
#include "oxidm_cli.h"
#include "oxidm_json.h"
#include "oxidm_rootns.h"
#include "oxidm_tracefmt.h"
#include "oxidm_tracepoints.h"

namespace oxidm_tool {

namespace {

constexpr const char kUsage[] =
    "usage: oxidm [--root DIR] [--json] COMMAND [ARGS...]\n"
    "\n"
    "Asks libox_idm the questions its callers ask, and explains its answers.\n"
    "\n"
    "commands:\n"
    "  map MECH IDENTITY...         the local user each network identity maps to\n"
    "  explain MECH IDENTITY        which map file line decided, and why earlier lines did not\n"
    "  groups USER...               a local user's groups, primary group first\n"
    "  cluster any|active HOST...   whether hosts are in a known cluster / the active cluster\n"
    "  check mapfile FILE [--mech MECH]\n"
    "  check nodeinfo FILE          every line the library would ignore or reject, and warnings\n"
    "  check [config]               every file the library would read now, in its order\n"
    "  trace [--levels L] COMMAND...   run a command with tracing on and print the records\n"
    "  trace decode FILE            decode a trace file written through OX_TR_FILE\n"
    "  mechanisms                   the sample mechanisms this command knows\n"
    "  help [COMMAND]               this text, or a command's\n"
    "\n"
    "options:\n"
    "  --root DIR   answer as if DIR/var/ox/cfg and DIR/opt/helvo/cfg were the live\n"
    "               directories (a private mount namespace; the host is not changed)\n"
    "  --json       machine-readable output (also accepted after the command)\n"
    "  --version    print the version\n"
    "\n"
    "exit status: 0 answer, 1 no answer (no mapping granted, host not listed,\n"
    "errors in a checked file), 2 error (the library's message on stderr).\n";

constexpr const char kGroupsHelp[] =
    "usage: oxidm groups [--json] USER...\n"
    "\n"
    "Lists each local user's groups as sec_idm_get_groups answers: the primary\n"
    "group first, then every group whose member list names the user, in the\n"
    "order of the group database.\n"
    "\n"
    "exit status: 0 all users found, 2 an error (unknown user: 2650-698).\n";

constexpr const char kClusterHelp[] =
    "usage: oxidm cluster [--json] any|active HOST...\n"
    "\n"
    "any:    sec_is_in_any_cluster: is the host (name or address text, compared\n"
    "        exactly) listed in /var/ox/cfg/oxsec.nodeinfo?\n"
    "active: sec_is_in_active_cluster: is it listed in the active cluster, whose\n"
    "        name libox_cu reads from /var/ox/cfg/active_cluster?\n"
    "\n"
    "answers: 1 yes, 0 listed but not in the active cluster, -1 not listed (or\n"
    "the file could not be loaded: then the library's message is shown).\n"
    "\n"
    "exit status: 0 every answer is 1, 1 some host is not in, 2 an error.\n";

constexpr const char kTraceHelp[] =
    "usage: oxidm trace [--levels LEVELS] [--json] COMMAND [ARGS...]\n"
    "       oxidm trace decode [--json] FILE|-\n"
    "\n"
    "Runs COMMAND (map, explain, groups, cluster) with the trace of component\n"
    "_SEI switched on through the libox_tr stand-in, then prints every record:\n"
    "its id, the routine that wrote it, and its items decoded.  COMMAND's own\n"
    "output comes first (on stderr with --json, where stdout holds the records).\n"
    "\n"
    "LEVELS: per category, e.g. \"API=8,Mapping=8,Diag=1\" (the default,\n"
    "with Error=1), \"all=1\", or five numbers in the order Error, API, Mapping,\n"
    "Milestone, Diag.  map and explain raise the levels they need themselves.\n"
    "\n"
    "decode: reads records that the stand-in wrote to OX_TR_FILE (for instance\n"
    "OX_TR_FILE=/tmp/t OX_TR_LEVELS=_SEI:API=8 some-program) and prints them\n"
    "the same way.\n"
    "\n"
    "exit status: that of COMMAND; decode: 0, or 2 when FILE cannot be read.\n";

void print_usage(FILE *f) { std::fputs(kUsage, f); }

}  // namespace

std::string library_error() {
    if (!cux_error_pending()) return "";
    const char *t = cux_error_text();
    std::string s = t ? t : "";
    // Messages end in a line feed and may carry tabs for their inserts.
    while (!s.empty() && (s.back() == '\n' || s.back() == ' ' || s.back() == '\t')) s.pop_back();
    return s;
}

void clear_library_error() { cux_clear_error(); }

void complain(const std::string &what, const std::string &text) {
    std::fprintf(stderr, "oxidm: %s: %s\n", what.c_str(), text.c_str());
}

bool wants_help(const Args &args) {
    for (const std::string &a : args) {
        if (a == "--") return false;
        if (a == "-h" || a == "--help") return true;
    }
    return false;
}

Args take_json(Context &ctx, const Args &args) {
    Args rest;
    bool after_dashes = false;
    for (const std::string &a : args) {
        if (!after_dashes && a == "--") {
            after_dashes = true;
            continue;
        }
        if (!after_dashes && a == "--json") ctx.json = true;
        else rest.push_back(a);
    }
    return rest;
}

// ---- groups ----

int cmd_groups(Context &ctx, const Args &in) {
    if (wants_help(in)) {
        std::fputs(kGroupsHelp, stdout);
        return 0;
    }
    Args args = take_json(ctx, in);
    if (args.empty()) {
        std::fputs(kGroupsHelp, stderr);
        return kExitError;
    }
    int worst = kExitAnswer;
    Json json;
    json.begin_object().begin_array("users");
    for (const std::string &user : args) {
        idm_buffer ubuf{static_cast<uint32_t>(user.size() + 1), const_cast<char *>(user.c_str())};
        uint32_t count = 0;
        idm_buffer *groups = nullptr;
        clear_library_error();
        int32_t status = sec_idm_get_groups(&ubuf, &count, &groups);
        std::string error = status != 0 ? library_error() : "";
        json.begin_object().str("user", user).num("status", status);
        if (status == 0) {
            json.begin_array("groups");
            std::string line = user + ":";
            for (uint32_t i = 0; i < count; ++i) {
                const char *g = groups[i].value ? groups[i].value : "";
                json.str({}, g);
                line += " ";
                line += g;
                std::free(groups[i].value);
            }
            json.end_array();
            if (count == 0) line += " (no groups)";
            if (!ctx.json) std::printf("%s\n", line.c_str());
        } else {
            json.null("groups").str("error", error);
            complain("groups " + user, error.empty() ? "status " + std::to_string(status) : error);
            worst = kExitError;
        }
        std::free(groups);
        json.end_object();
    }
    json.end_array().end_object();
    if (ctx.json) json.print();
    return worst;
}

// ---- cluster ----

// Trace point of the node file's load step, with the load's status.
constexpr int kLoadEndPoint = idm::trace::tp::kNodeFileEnd;

// True when a load step recorded since record `from` ended with a failure.
bool load_failed_since(size_t from) {
    for (size_t i = trx_count(); i-- > from;) {
        int id = 0, kind = 0, items = 0;
        if (trx_record(i, &id, &kind, &items) != 0 || id != kLoadEndPoint || items < 1) continue;
        size_t length = 0;
        const void *item = trx_item(i, 0, &length);
        int32_t status = 0;
        if (item != nullptr && length == sizeof status) std::memcpy(&status, item, sizeof status);
        return status != 0;
    }
    return false;
}

int cmd_cluster(Context &ctx, const Args &in) {
    if (wants_help(in)) {
        std::fputs(kClusterHelp, stdout);
        return 0;
    }
    Args args = take_json(ctx, in);
    if (args.size() < 2 || (args[0] != "any" && args[0] != "active")) {
        std::fputs(kClusterHelp, stderr);
        return kExitError;
    }
    bool active = args[0] == "active";
    std::string active_name;
    bool active_known = true;
    if (active) {
        cu_cluster_info_t info{};
        active_known = cu_get_cluster_info_1(&info) == 0;
        if (active_known) active_name.assign(info.cluster_name, strnlen(info.cluster_name, sizeof info.cluster_name));
    }
    // The load step's trace points (kNodeFileStart, kNodeFileEnd) are written
    // at any API level but 0; level 2 writes no others.
    if ((ctx.tracing ? ctx.trace_levels.level[1] : 0) == 0) trx_set_level("_SEI", 1, 2);
    int worst = kExitAnswer;
    Json json;
    json.begin_object().str("query", args[0]);
    if (active) {
        if (active_known) json.str("active_cluster", active_name);
        else json.null("active_cluster");
    }
    json.begin_array("results");
    for (size_t i = 1; i < args.size(); ++i) {
        const std::string &host = args[i];
        clear_library_error();
        const size_t records_before = trx_count();
        int32_t answer = active ? sec_is_in_active_cluster(host.c_str()) : sec_is_in_any_cluster(host.c_str());
        // A load that succeeds leaves a 2650-690 behind (the end of each
        // value list), so the pending error alone does not tell "not listed"
        // from a failed load: the load's own trace point gives its status.
        std::string error = answer == -1 && load_failed_since(records_before) ? library_error() : "";
        std::string meaning;
        int exit = kExitAnswer;
        if (answer == 1) {
            meaning = active ? "in the active cluster " + active_name : "listed in a cluster";
        } else if (answer == 0) {
            meaning = active ? "listed, but not in the active cluster " + active_name : "listed without a cluster";
            exit = kExitNoAnswer;
        } else if (!error.empty()) {
            meaning = "no answer: the node information file could not be loaded";
            exit = kExitError;
        } else if (active && !active_known) {
            meaning = "no answer: no active cluster is known on this node";
            exit = kExitError;
        } else {
            meaning = "not listed";
            exit = kExitNoAnswer;
        }
        if (exit > worst) worst = exit;
        json.begin_object().str("host", host).num("answer", answer).str("meaning", meaning);
        if (!error.empty()) json.str("error", error);
        json.end_object();
        if (!ctx.json) std::printf("%s: %d (%s)\n", host.c_str(), answer, meaning.c_str());
        if (!error.empty()) complain("cluster " + host, error);
        else if (exit == kExitError) complain("cluster " + host, "libox_cu knows no active cluster (" CU_ACTIVE_CLUSTER_FILE ")");
    }
    json.end_array().end_object();
    if (ctx.json) json.print();
    return worst;
}

// ---- trace ----

namespace {

int trace_decode(Context &ctx, const Args &args) {
    if (args.size() != 1) {
        std::fputs(kTraceHelp, stderr);
        return kExitError;
    }
    FILE *f = args[0] == "-" ? stdin : std::fopen(args[0].c_str(), "re");
    if (f == nullptr) {
        complain("trace decode " + args[0], std::strerror(errno));
        return kExitError;
    }
    std::vector<TraceRecord> records = read_trace_file(f);
    if (f != stdin) std::fclose(f);
    if (ctx.json) {
        Json json;
        json.begin_object();
        records_json(records, json);
        json.end_object().print();
    } else {
        for (const TraceRecord &r : records) std::printf("%s\n", format_record(r).c_str());
    }
    return kExitAnswer;
}

}  // namespace

int cmd_trace(Context &ctx, const Args &in) {
    if (in.empty() || (in[0] != "decode" && wants_help(Args(in.begin(), in.begin() + 1))) ||
        (in[0] == "decode" && wants_help(in))) {
        std::fputs(kTraceHelp, in.empty() ? stderr : stdout);
        return in.empty() ? kExitError : 0;
    }
    // Options of `trace` itself stand before the command.
    size_t i = 0;
    TraceLevels levels;
    parse_levels("Error=1,API=8,Mapping=8,Diag=1", levels);
    bool json = ctx.json;
    for (; i < in.size(); ++i) {
        if (in[i] == "--json") {
            json = true;
        } else if (in[i] == "--levels" && i + 1 < in.size()) {
            if (!parse_levels(in[++i], levels)) {
                complain("trace", "bad --levels text: " + in[i]);
                return kExitError;
            }
        } else if (in[i].rfind("--levels=", 0) == 0) {
            if (!parse_levels(in[i].substr(9), levels)) {
                complain("trace", "bad --levels text: " + in[i]);
                return kExitError;
            }
        } else if (in[i] == "-h" || in[i] == "--help") {
            std::fputs(kTraceHelp, stdout);
            return 0;
        } else {
            break;
        }
    }
    Args rest(in.begin() + static_cast<long>(i), in.end());
    if (rest.empty()) {
        std::fputs(kTraceHelp, stderr);
        return kExitError;
    }
    if (rest[0] == "decode") {
        ctx.json = json;
        return trace_decode(ctx, Args(rest.begin() + 1, rest.end()));
    }
    if (rest[0] == "trace") {
        complain("trace", "trace cannot trace itself");
        return kExitError;
    }
    Context inner = ctx;
    inner.tracing = true;
    inner.trace_levels = levels;
    apply_levels(levels);
    size_t from = captured_count();
    int saved_stdout = -1;
    if (json) {
        // The records own stdout; the command's own output goes to stderr.
        std::fflush(stdout);
        saved_stdout = dup(STDOUT_FILENO);
        dup2(STDERR_FILENO, STDOUT_FILENO);
    }
    int status = run_subcommand(inner, rest);
    std::fflush(stdout);
    if (saved_stdout >= 0) {
        dup2(saved_stdout, STDOUT_FILENO);
        close(saved_stdout);
    }
    std::vector<TraceRecord> records = captured_records(from);
    if (json) {
        Json out;
        out.begin_object().begin_array("command");
        for (const std::string &a : rest) out.str({}, a);
        out.end_array().num("exit_status", status);
        records_json(records, out);
        out.end_object().print();
    } else {
        std::printf("-- %zu trace record%s of _SEI:\n", records.size(), records.size() == 1 ? "" : "s");
        for (const TraceRecord &r : records) std::printf("%s\n", format_record(r).c_str());
    }
    return status;
}

int cmd_mechanisms(Context &ctx, const Args &args);

int run_subcommand(Context &ctx, const Args &args) {
    const std::string &name = args[0];
    Args rest(args.begin() + 1, args.end());
    if (name == "map") return cmd_map(ctx, rest);
    if (name == "explain") return cmd_explain(ctx, rest);
    if (name == "groups") return cmd_groups(ctx, rest);
    if (name == "cluster") return cmd_cluster(ctx, rest);
    if (name == "check") return cmd_check(ctx, rest);
    if (name == "trace") return cmd_trace(ctx, rest);
    if (name == "mechanisms") return cmd_mechanisms(ctx, rest);
    if (name == "help") {
        if (rest.empty()) {
            print_usage(stdout);
            return 0;
        }
        Args h{rest[0], "--help"};
        return run_subcommand(ctx, h);
    }
    complain(name, "unknown command (see oxidm --help)");
    return kExitError;
}

}  // namespace oxidm_tool

int main(int argc, char **argv) {
    using namespace oxidm_tool;
    Context ctx;
    int i = 1;
    for (; i < argc; ++i) {
        std::string_view a = argv[i];
        if (a == "--json") {
            ctx.json = true;
        } else if (a == "--root" && i + 1 < argc) {
            ctx.root = argv[++i];
        } else if (a.rfind("--root=", 0) == 0) {
            ctx.root = std::string(a.substr(7));
        } else if (a == "-h" || a == "--help") {
            print_usage(stdout);
            return 0;
        } else if (a == "--version") {
            std::printf("oxidm %s\n", OXIDM_VERSION);
            return 0;
        } else if (!a.empty() && a[0] == '-') {
            complain(std::string(a), "unknown option (see oxidm --help)");
            return kExitError;
        } else {
            break;
        }
    }
    if (i >= argc) {
        print_usage(stderr);
        return kExitError;
    }
    Args args(argv + i, argv + argc);
    if (!ctx.root.empty() && !wants_help(args)) {
        // Before the library runs, and before any thread exists.
        if (std::string e = enter_root(ctx.root); !e.empty()) {
            complain("--root", e);
            return kExitError;
        }
    }
    return run_subcommand(ctx, args);
}
