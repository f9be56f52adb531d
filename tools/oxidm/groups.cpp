// oxidm groups USER...: a local user's groups as sec_idm_get_groups answers.
#include <fmt/core.h>

#include <cstdlib>

#include "tool.h"

namespace oxidm_tool {

namespace {

Result run_groups(const std::vector<std::string> &users) {
    Result r;
    r.json["users"] = Json::array();
    for (const std::string &user : users) {
        idm_buffer ubuf{static_cast<uint32_t>(user.size() + 1), const_cast<char *>(user.c_str())};
        uint32_t count = 0;
        idm_buffer *groups = nullptr;
        clear_library_error();
        int32_t status = sec_idm_get_groups(&ubuf, &count, &groups);
        Json one{{"user", user}, {"status", status}};
        if (status == 0) {
            one["groups"] = Json::array();
            for (uint32_t i = 0; i < count; ++i) {
                one["groups"].push_back(groups[i].value ? groups[i].value : "");
                std::free(groups[i].value);
            }
        } else {
            std::string error = library_error();
            one["groups"] = nullptr;
            one["error"] = error;
            r.fail("groups " + user, error.empty() ? fmt::format("status {}", status) : error);
        }
        std::free(groups);
        r.json["users"].push_back(std::move(one));
    }
    return r;
}

void text_groups(const Json &j) {
    for (const Json &u : j["users"]) {
        if (u["groups"].is_null()) continue;
        std::string line = u["user"].get<std::string>() + ":";
        for (const Json &g : u["groups"]) line += " " + g.get<std::string>();
        if (u["groups"].empty()) line += " (no groups)";
        fmt::print("{}\n", line);
    }
}

}  // namespace

void add_groups(CLI::App &app, Options &, CommandList &out) {
    auto users = std::make_shared<std::vector<std::string>>();
    CLI::App *sub = app.add_subcommand("groups", "a local user's groups, primary group first");
    sub->footer(
        "The groups as sec_idm_get_groups lists them.  Exit status: 0 all users found, 2 an error.");
    sub->add_option("USER", *users, "local user names")->required();
    out.push_back({sub, [users] { return run_groups(*users); }, text_groups});
}

}  // namespace oxidm_tool
