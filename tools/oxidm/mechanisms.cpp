// oxidm mechanisms: the mechanisms this command knows, built in or loaded
// with --plugin.
#include <fmt/core.h>

#include "tool.h"

namespace oxidm_tool {

void add_mechanisms(CLI::App &app, Options &, CommandList &out) {
    CLI::App *sub = app.add_subcommand("mechanisms", "the mechanisms this command knows");
    sub->footer(
        "Built in, or loaded with --plugin PATH.");
    auto run = [] {
        Result r;
        r.json["mechanisms"] = Json::array();
        for (const Mechanism &m : mechanisms())
            r.json["mechanisms"].push_back({{"mnemonic", m.mnemonic}, {"identities", m.summary}, {"from", m.source}});
        return r;
    };
    auto text = [](const Json &j) {
        for (const Json &m : j["mechanisms"])
            fmt::print("{:<10} {}{}\n", m["mnemonic"].get<std::string>(), m["identities"].get<std::string>(),
                       m["from"] == "built in" ? "" : " (" + m["from"].get<std::string>() + ")");
    };
    out.push_back({sub, run, text});
}

}  // namespace oxidm_tool
