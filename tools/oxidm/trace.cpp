// oxidm trace [--levels L] COMMAND...: runs one of the command's own
// commands with the trace of "_SEI" on and prints every record decoded;
// oxidm trace decode FILE: decodes records the stand-in wrote to a file.
#include <fmt/core.h>

#include <cerrno>
#include <cstring>

#include "tool.h"

namespace oxidm_tool {

namespace {

struct TraceArgs {
    std::string levels = "Error=1,API=8,Mapping=8,Diag=1";
    std::vector<std::string> command;
    std::function<void(const Json &)> inner_text;  // the traced command's renderer
    std::vector<std::string> formatted;            // the records, one line each
};

Json records_of(const std::vector<TraceRecord> &records, TraceArgs &a) {
    for (const TraceRecord &t : records) a.formatted.push_back(format_record(t));
    return records_json(records);
}

Result run_decode(const std::vector<std::string> &args, TraceArgs &a) {
    Result r;
    if (args.size() != 1) {
        r.fail("usage", "trace decode: FILE (or -) is required, and nothing else");
        return r;
    }
    FILE *f = args[0] == "-" ? stdin : std::fopen(args[0].c_str(), "re");
    if (f == nullptr) {
        r.fail("trace decode " + args[0], std::strerror(errno));
        return r;
    }
    std::vector<TraceRecord> records = read_trace_file(f);
    if (f != stdin) std::fclose(f);
    r.json["records"] = records_of(records, a);
    return r;
}

Result run_trace(Options &o, TraceArgs &a) {
    Result r;
    if (a.command.empty()) {
        r.fail("usage", "trace: a COMMAND to run (or decode FILE) is required");
        return r;
    }
    if (a.command[0] == "decode") {
        std::vector<std::string> files;
        for (auto it = a.command.begin() + 1; it != a.command.end(); ++it)
            if (*it == "--json") o.json = true;
            else files.push_back(*it);
        return run_decode(files, a);
    }
    if (a.command[0] == "trace" || a.command[0] == "help") {
        r.fail("usage", "trace runs map, explain, groups, cluster, check or mechanisms");
        return r;
    }
    TraceLevels levels;
    if (!parse_levels(a.levels, levels)) {
        r.fail("usage", "trace: bad --levels text: " + a.levels);
        return r;
    }
    Options inner = o;
    inner.tracing = true;
    inner.trace_levels = levels;
    apply_levels(levels);
    size_t from = captured_count();
    Result in = run_inner(inner, a.command, a.inner_text);
    o.json = o.json || inner.json;
    r.exit = in.exit;
    r.errors = in.errors;
    r.json["command"] = a.command;
    r.json["result"] = std::move(in.json);
    r.json["records"] = records_of(captured_records(from), a);
    return r;
}

}  // namespace

void add_trace(CLI::App &app, Options &o, CommandList &out) {
    auto a = std::make_shared<TraceArgs>();
    CLI::App *sub = app.add_subcommand("trace", "run a command with tracing on and print the records");
    sub->footer(
        "Runs COMMAND with the trace of _SEI on and prints every record decoded; decode FILE|- reads records\n"
        "the stand-in wrote to OX_TR_FILE.  LEVELS: e.g. \"API=8,Diag=1\", \"all=1\" or five numbers (Error, API,\n"
        "Mapping, Milestone, Diag).  Exit status: that of COMMAND.");
    sub->add_option("--levels", a->levels, "trace levels of _SEI")->type_name("LEVELS");
    sub->add_option("COMMAND", a->command, "the command to run and its arguments, or decode FILE");
    sub->prefix_command();
    out.push_back({sub, [&o, a] { return run_trace(o, *a); }, [a](const Json &j) {
                       if (j.contains("result") && a->inner_text) a->inner_text(j["result"]);
                       if (j.contains("result"))
                           fmt::print("-- {} trace record{} of _SEI:\n", j["records"].size(),
                                      j["records"].size() == 1 ? "" : "s");
                       for (const std::string &line : a->formatted) fmt::print("{}\n", line);
                   }});
}

}  // namespace oxidm_tool
