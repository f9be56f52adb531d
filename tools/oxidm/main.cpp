// oxidm: the administrator's command for libox_idm.  Asks the shipped
// library the questions its callers ask (map, groups, cluster), shows why
// it answered as it did (explain, trace), checks and installs configuration
// files as the library reads them (check, install).  Every answer printed
// is the library's own; the command adds only wording.
//
// This file owns the command line (options accepted anywhere, usage errors,
// help, the version) and renders a command's result as text or JSON.
#include <fmt/core.h>

#include <cstdio>

#include "rootns.h"
#include "tool.h"

namespace oxidm_tool {

namespace {

std::string dump(const Json &j) { return j.dump(-1, ' ', false, Json::error_handler_t::replace); }

// A command that only says something: help, the version, a usage error.
Command says(const char *key, std::string text, bool error = false) {
    auto run = [key, text, error] {
        Result r;
        if (error) r.fail("usage", text + " (see oxidm help)");
        else r.json[key] = text;
        return r;
    };
    return {nullptr, run, [key](const Json &j) {
                const std::string &t = j[key].get_ref<const std::string &>();
                fmt::print("{}{}", t, t.ends_with('\n') ? "" : "\n");
            }};
}

}  // namespace

void build_cli(CLI::App &app, Options &o, CommandList &out) {
    app.description("Asks libox_idm the questions its callers ask, explains its answers, and checks and installs\n"
                    "its configuration files.");
    app.footer("Exit status: 0 an answer, 1 no answer (no mapping granted, host not listed, errors in a checked\n"
               "file), 2 an error or bad usage (the message on stderr; with --json in the document).  See oxidm(1).");
    app.require_subcommand(0, 1);
    app.set_version_flag("--version", "oxidm " OXIDM_VERSION);
    app.add_flag("--json", o.json, "machine-readable output: one JSON document on stdout");
    app.add_option("--root", o.root, "answer as if DIR/var/ox/cfg and DIR/opt/helvo/cfg were the live directories")
        ->type_name("DIR");
    app.add_option("--plugin", o.plugins, "load a mechanism plug-in (repeatable)")->type_name("PATH")->allow_extra_args(false);
    for (auto add : {add_map, add_explain, add_groups, add_cluster, add_check, add_install, add_trace, add_mechanisms})
        add(app, o, out);
    auto topic = std::make_shared<std::string>();
    CLI::App *help = app.add_subcommand("help", "this text, or a command's");
    help->add_option("COMMAND", *topic, "the command to describe");
    out.push_back({help, [&app, topic] {
                       CLI::App *sub = &app;
                       if (!topic->empty()) try {
                               sub = app.get_subcommand(*topic);
                           } catch (const CLI::OptionNotFound &) {
                               sub = nullptr;
                           }
                       return (sub ? says("help", sub->help()) : says("", "help: no command \"" + *topic + "\"", true)).run();
                   },
                   [](const Json &j) { fmt::print("{}", j["help"].get<std::string>()); }});
    for (Command &c : out) c.app->fallthrough();
}

Command parse(CLI::App &app, const CommandList &commands, std::vector<std::string> args) {
    std::reverse(args.begin(), args.end());  // CLI11 takes them last first
    auto deepest = [&app] {
        CLI::App *at = &app;
        while (!at->get_subcommands().empty()) at = at->get_subcommands().front();
        return at;
    };
    try {
        app.parse(args);
    } catch (const CLI::CallForHelp &) {
        return says("help", deepest()->help());
    } catch (const CLI::CallForVersion &e) {
        return says("version", e.what());
    } catch (const CLI::ParseError &e) {
        return says("", fmt::format("{}{}", deepest() == &app ? "" : deepest()->get_name() + ": ", e.what()), true);
    }
    for (const Command &c : commands)
        if (c.app->parsed()) return c;
    return says("", "a command is required", true);
}

Result run_inner(Options &o, const std::vector<std::string> &args, std::function<void(const Json &)> &text) {
    CLI::App app{"", "oxidm"};
    CommandList commands;
    build_cli(app, o, commands);
    Command c = parse(app, commands, args);
    text = c.text;
    return c.run();
}

}  // namespace oxidm_tool

int main(int argc, char **argv) {
    using namespace oxidm_tool;
    Options o;
    CLI::App app{"", "oxidm"};
    CommandList commands;
    build_cli(app, o, commands);
    std::vector<std::string> args(argv + 1, argv + argc);
    Command c = parse(app, commands, args);
    // --version ends the parse where it stands: a --json after it counts too.
    o.json = o.json || std::find(args.begin(), std::find(args.begin(), args.end(), "--"), "--json") != args.end();
    Result r;
    std::string error;
    if (c.app != nullptr && !o.root.empty() && !c.own_root) error = enter_root(o.root);  // before any thread exists
    if (!error.empty()) r.fail("--root", error);
    else if (!load_plugins(o, error)) r.fail("--plugin", error);
    else r = c.run();
    if (o.json) {
        for (const auto &[what, message] : r.errors) r.json["errors"].push_back({{"what", what}, {"message", message}});
        r.json["exit_status"] = r.exit;
        std::string doc = dump(r.json);
        if (r.stream) {
            // The streamed array goes last: the document is closed after it.
            doc.pop_back();
            fmt::print("{},\"{}\":[", doc, r.stream_key);
            const char *comma = "";
            r.stream([&comma](const Json &element) { fmt::print("{}{}", std::exchange(comma, ","), dump(element)); });
            doc = "]}";
        }
        fmt::print("{}\n", doc);
    } else {
        if (c.text && !r.json.empty()) c.text(r.json);
        std::fflush(stdout);
        for (const auto &[what, message] : r.errors) fmt::print(stderr, "oxidm: {}: {}\n", what, message);
    }
    return r.exit;
}
