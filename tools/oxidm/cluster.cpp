// oxidm cluster any|active HOST...: the cluster membership queries.
#include <fmt/core.h>

#include <cstring>

#include "ox_cu.h"
#include "ox_tr.h"
#include "oxidm_tracepoints.h"
#include "tool.h"

namespace oxidm_tool {

namespace {

struct ClusterArgs {
    std::string query;
    std::vector<std::string> hosts;
};

Result run_cluster(const Options &o, const ClusterArgs &a) {
    Result r;
    bool active = a.query == "active";
    r.json["query"] = a.query;
    std::string active_name;
    bool active_known = true;
    if (active) {
        cu_cluster_info_t info{};
        active_known = cu_get_cluster_info_1(&info) == 0;
        if (active_known) active_name.assign(info.cluster_name, strnlen(info.cluster_name, sizeof info.cluster_name));
        r.json["active_cluster"] = active_known ? Json(active_name) : Json();
    }
    r.json["results"] = Json::array();
    if (std::string e = unreadable_config({kNodeInfo}); !e.empty()) {
        r.fail("cluster", e);
        return r;
    }
    // The load step's trace points are written at any API level but 0;
    // level 2 writes no others.
    if ((o.tracing ? o.trace_levels.level[1] : 0) == 0) trx_set_level("_SEI", 1, 2);
    for (const std::string &host : a.hosts) {
        clear_library_error();
        // A load that succeeds leaves a 2650-690 behind (the end of each
        // value list), so the pending error alone does not tell "not listed"
        // from a failed load: the load's own end point gives its status.
        bool load_failed = false;
        stream_records(
            [&](const TraceRecord &t) {
                if (t.id == idm::trace::tp::kNodeFileEnd && !t.items.empty()) load_failed = t.i32(0) != 0;
            },
            !o.tracing);
        int32_t answer = active ? sec_is_in_active_cluster(host.c_str()) : sec_is_in_any_cluster(host.c_str());
        drain_records();
        stream_records(nullptr, false);
        std::string error = answer == -1 && load_failed ? library_error() : "";
        std::string meaning;
        if (answer == 1) {
            meaning = active ? "in the active cluster " + active_name : "listed in a cluster";
        } else if (answer == 0) {
            meaning = active ? "listed, but not in the active cluster " + active_name : "listed without a cluster";
            r.at_least(kExitNoAnswer);
        } else if (!error.empty()) {
            meaning = "no answer: the node information file could not be loaded";
            r.fail("cluster " + host, error);
        } else if (active && !active_known) {
            meaning = "no answer: no active cluster is known on this node";
            r.fail("cluster " + host, "libox_cu knows no active cluster (" CU_ACTIVE_CLUSTER_FILE ")");
        } else {
            meaning = "not listed";
            r.at_least(kExitNoAnswer);
        }
        Json one{{"host", host}, {"answer", answer}, {"meaning", meaning}};
        if (!error.empty()) one["error"] = error;
        r.json["results"].push_back(std::move(one));
    }
    return r;
}

void text_cluster(const Json &j) {
    for (const Json &one : j["results"])
        fmt::print("{}: {} ({})\n", one["host"].get<std::string>(), one["answer"].get<int>(),
                   one["meaning"].get<std::string>());
}

}  // namespace

void add_cluster(CLI::App &app, Options &o, CommandList &out) {
    auto a = std::make_shared<ClusterArgs>();
    CLI::App *sub = app.add_subcommand("cluster", "whether hosts are in a known cluster / the active cluster");
    sub->footer(
        "Answers: 1 yes, 0 listed but not in the active cluster, -1 not listed (or the file could not be\n"
        "loaded).  Exit status: 0 every answer is 1, 1 some host is not in, 2 an error.");
    sub->add_option("QUERY", a->query, "any or active")->required()->check(CLI::IsMember({"any", "active"}));
    sub->add_option("HOST", a->hosts, "host names or address texts")->required();
    out.push_back({sub, [&o, a] { return run_cluster(o, *a); }, text_cluster});
}

}  // namespace oxidm_tool
