// oxidm map MECH IDENTITY...: the local user each network identity maps to,
// as sec_idm_map_identity answers.
#include <fmt/core.h>

#include "oxidm_tracepoints.h"
#include "tool.h"

namespace oxidm_tool {

namespace {

struct MapArgs {
    std::string mechanism;
    std::vector<std::string> identities;
};

Result run_map(const Options &o, const MapArgs &a) {
    Result r;
    r.json["mechanism"] = a.mechanism;
    r.json["results"] = Json::array();
    // An empty text would reach the library only to come back as a bad
    // parameter with its address.
    if (a.mechanism.empty() || std::count(a.identities.begin(), a.identities.end(), "") > 0) {
        r.fail("usage", "map: MECH and IDENTITY must not be empty");
        return r;
    }
    if (std::string e = unreadable_config({kLocalMap, kVarGlobalMap, kOptGlobalMap}); !e.empty()) {
        r.fail("map", e);
        return r;
    }
    if (std::string e = register_watched(a.mechanism); !e.empty()) {
        r.fail("map", e);
        return r;
    }
    for (const std::string &identity : a.identities) {
        bool matched = false;
        Watch w;
        w.wants = [](int id) { return id == idm::trace::tp::kApplyMatched || id == idm::trace::tp::kApplyResult; };
        w.on_record = [&](const TraceRecord &t) {
            namespace tp = idm::trace::tp;
            if (t.id == tp::kApplyMatched || t.id == tp::kApplyResult) matched = true;
        };
        MapOutcome m = map_watched(o, a.mechanism, identity, false, std::move(w));
        Json one{{"identity", identity}, {"status", m.status}, {"granted", m.granted}};
        one["local"] = m.granted ? Json(m.local) : Json();
        if (m.granted) {
            one["decision"] = "mapped";
        } else if (m.status == 0) {
            one["decision"] = matched ? "denied" : "no match";
            r.at_least(kExitNoAnswer);
        } else {
            one["decision"] = "error";
            one["error"] = m.error;
            r.fail("map " + identity, m.error);
        }
        r.json["results"].push_back(std::move(one));
    }
    return r;
}

void text_map(const Json &j) {
    for (const Json &one : j["results"]) {
        std::string id = one["identity"], decision = one["decision"];
        if (decision == "mapped") fmt::print("{} -> {}\n", id, one["local"].get<std::string>());
        else if (decision != "error")
            fmt::print("{}: no local identity granted ({})\n", id,
                       decision == "denied" ? "a denial matched" : "no line matched");
    }
}

}  // namespace

void add_map(CLI::App &app, Options &o, CommandList &out) {
    auto a = std::make_shared<MapArgs>();
    CLI::App *sub = app.add_subcommand("map", "the local user each network identity maps to");
    sub->footer(
        "Maps each identity with sec_idm_map_identity; the first matching line of the map files decides.\n"
        "Exit status: 0 every identity maps to a user, 1 some is granted none, 2 an error.");
    sub->add_option("MECH", a->mechanism, "the mechanism's mnemonic (see oxidm mechanisms)")->required();
    sub->add_option("IDENTITY", a->identities, "network identities")->required();
    out.push_back({sub, [&o, a] { return run_map(o, *a); }, text_map});
}

}  // namespace oxidm_tool
