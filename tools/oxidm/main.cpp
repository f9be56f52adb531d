// oxidm: the administrator's command for libox_idm.  Asks the shipped
// library the questions its callers ask (map, groups, cluster), shows why
// it answered as it did (explain, trace), checks and installs configuration
// files as the library reads them (check, install).  Every answer printed
// is the library's own; the command adds only wording.
//
// This file owns the command line: the options every command takes
// (accepted anywhere on the line), usage errors, help, and the rendering of
// a command's result as text or JSON.
#include <fmt/core.h>

#include <cstdio>

#include "rootns.h"
#include "tool.h"

namespace oxidm_tool {

namespace {

constexpr const char kDescription[] =
    "Asks libox_idm the questions its callers ask, explains its answers, and checks and installs its\n"
    "configuration files.";
constexpr const char kFooter[] =
    "Exit status: 0 an answer, 1 no answer (no mapping granted, host not listed, errors in a checked\n"
    "file), 2 an error or bad usage (the message on stderr; with --json in the document).";

void print_json(const Json &j) {
    fmt::print("{}\n", j.dump(-1, ' ', false, Json::error_handler_t::replace));
}

void add_global_options(CLI::App &app, Options &o) {
    app.add_flag("--json", o.json, "machine-readable output: one JSON document on stdout");
    app.add_option("--root", o.root,
                   "answer as if DIR/var/ox/cfg and DIR/opt/helvo/cfg were the live directories (a private "
                   "mount namespace; the host is not changed)")
        ->type_name("DIR");
    app.add_option("--plugin", o.plugins, "load a mechanism plug-in (repeatable; see oxidm(1))")
        ->type_name("PATH")
        ->allow_extra_args(false);
}

}  // namespace

void build_cli(CLI::App &app, Options &o, CommandList &out) {
    app.description(kDescription);
    app.footer(kFooter);
    app.require_subcommand(0, 1);
    add_global_options(app, o);
    add_map(app, o, out);
    add_explain(app, o, out);
    add_groups(app, o, out);
    add_cluster(app, o, out);
    add_check(app, o, out);
    add_install(app, o, out);
    add_trace(app, o, out);
    add_mechanisms(app, o, out);
    for (Command &c : out) c.app->fallthrough();
}

namespace {

// What one parse asked for.
struct Parsed {
    enum { kRun, kHelp, kUsage, kVersion, kNothing } what = kNothing;
    const Command *command = nullptr;
    std::string text;  // help or usage message
};

Parsed parse(CLI::App &app, CommandList &commands, std::vector<std::string> args, CLI::App *help_sub,
             std::string *help_topic, bool *version) {
    Parsed p;
    std::reverse(args.begin(), args.end());
    try {
        app.parse(args);
    } catch (const CLI::CallForHelp &) {
        p.what = Parsed::kHelp;
        CLI::App *at = &app;
        for (CLI::App *s = &app; !s->get_subcommands().empty();) at = s = s->get_subcommands().front();
        p.text = at->help();
        return p;
    } catch (const CLI::ParseError &e) {
        p.what = Parsed::kUsage;
        CLI::App *at = &app;
        for (CLI::App *s = &app; !s->get_subcommands().empty();) at = s = s->get_subcommands().front();
        p.text = fmt::format("{}{}", at == &app ? "" : at->get_name() + ": ", e.what());
        return p;
    }
    if (version && *version) {
        p.what = Parsed::kVersion;
        return p;
    }
    if (help_sub && help_sub->parsed()) {
        p.what = Parsed::kHelp;
        p.text = app.help();
        if (help_topic && !help_topic->empty()) {
            CLI::App *topic = nullptr;
            for (const Command &c : commands)
                if (c.app->get_name() == *help_topic || *help_topic == "help") topic = c.app;
            if (*help_topic == "help") topic = help_sub;
            if (topic == nullptr) {
                p.what = Parsed::kUsage;
                p.text = fmt::format("help: no command is named \"{}\"", *help_topic);
            } else {
                p.text = topic->help();
            }
        }
        return p;
    }
    for (const Command &c : commands)
        if (c.app->parsed()) {
            p.what = Parsed::kRun;
            p.command = &c;
            return p;
        }
    p.what = Parsed::kUsage;
    p.text = "a command is required";
    return p;
}

// The rendering of a result that is not a command's answer.
Result message_result(int exit, const char *key, const std::string &text) {
    Result r;
    r.exit = exit;
    r.json[key] = text;
    return r;
}

}  // namespace

Result run_inner(Options &o, const std::vector<std::string> &args, std::function<void(const Json &)> &text) {
    CLI::App app{"", "oxidm"};
    CommandList commands;
    build_cli(app, o, commands);
    Parsed p = parse(app, commands, args, nullptr, nullptr, nullptr);
    if (p.what == Parsed::kRun) {
        text = p.command->text;
        return p.command->run();
    }
    Result r;
    r.fail("usage", p.what == Parsed::kHelp ? "trace runs a command, not its help" : p.text);
    return r;
}

}  // namespace oxidm_tool

int main(int argc, char **argv) {
    using namespace oxidm_tool;
    Options o;
    CLI::App app{"", "oxidm"};
    CommandList commands;
    build_cli(app, o, commands);
    bool version = false;
    app.add_flag("--version", version, "print the version");
    std::string help_topic;
    CLI::App *help = app.add_subcommand("help", "this text, or a command's");
    help->add_option("COMMAND", help_topic, "the command to describe");
    help->fallthrough();

    std::vector<std::string> args(argv + 1, argv + argc);
    Parsed p = parse(app, commands, args, help, &help_topic, &version);
    Result r;
    std::function<void(const Json &)> text;
    switch (p.what) {
        case Parsed::kVersion:
            r = message_result(kExitAnswer, "version", OXIDM_VERSION);
            text = [](const Json &j) { fmt::print("oxidm {}\n", j["version"].get<std::string>()); };
            break;
        case Parsed::kHelp:
            r = message_result(kExitAnswer, "help", p.text);
            text = [](const Json &j) { fmt::print("{}", j["help"].get<std::string>()); };
            break;
        case Parsed::kUsage:
        case Parsed::kNothing:
            r.fail("usage", p.text + " (see oxidm help)");
            break;
        case Parsed::kRun: {
            std::string error;
            if (!o.root.empty() && !p.command->own_root) error = enter_root(o.root);  // before any thread exists
            if (!error.empty()) {
                r.fail("--root", error);
            } else if (!load_plugins(o, error)) {
                r.fail("--plugin", error);
            } else {
                r = p.command->run();
                text = p.command->text;
            }
            break;
        }
    }
    if (o.json) {
        if (!r.errors.empty()) {
            Json errors = Json::array();
            for (const auto &[what, message] : r.errors) errors.push_back({{"what", what}, {"message", message}});
            r.json["errors"] = std::move(errors);
        }
        r.json["exit_status"] = r.exit;
        if (!r.stream) {
            print_json(r.json);
        } else {
            std::string head = r.json.dump(-1, ' ', false, Json::error_handler_t::replace);
            head.pop_back();  // the closing brace
            fmt::print("{},\"{}\":[", head, r.stream_key);
            bool first = true;
            r.stream([&first](const Json &element) {
                fmt::print("{}{}", first ? "" : ",", element.dump(-1, ' ', false, Json::error_handler_t::replace));
                first = false;
            });
            fmt::print("]}}\n");
        }
    } else {
        if (text && (r.exit != kExitError || r.json.size() > 0)) text(r.json);
        std::fflush(stdout);
        for (const auto &[what, message] : r.errors) fmt::print(stderr, "oxidm: {}: {}\n", what, message);
    }
    return r.exit;
}
