// Node information text seen from outside: the values and records the
// library's parser hands over (given a text followed in memory by more), the two trees the loader should build from
// them, and the trees it did build (unit tests and the fuzz target).
#ifndef OXIDM_TEST_REFERENCE_NODEINFO_H
#define OXIDM_TEST_REFERENCE_NODEINFO_H

#include <cstdlib>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "oxidm_clmap.h"
#include "oxidm_state.h"

namespace refnode {

struct Event {
    bool record;  // a record is complete; otherwise one value of `attr`
    int attr;
    std::string value;
    bool operator==(const Event &) const = default;
};
struct Result {
    int32_t status = 0;  // 21: invalid at trace point `point`, statement on `line`
    int point = 0;
    size_t line = 0;
    std::vector<Event> events;
    bool operator==(const Result &) const = default;
};

inline Result library_parse(std::string_view text) {
    Result out;
    const idm::clmap::ParseSink sink{
        &out,
        [](void *c, idm::clmap::Attr a, std::string_view v) {
            return static_cast<Result *>(c)->events.push_back({false, a, std::string(v)}), 0;
        },
        [](void *c) { return static_cast<Result *>(c)->events.push_back({true, -1, {}}), 0; }};
    const std::string padded = std::string(text) + ":\n";  // the parser must not look past the end of its text
    const idm::clmap::ParseResult r = idm::clmap::parse(std::string_view(padded).substr(0, text.size()), sink);
    out.status = r.status, out.point = r.point, out.line = r.status != 0 ? r.line : 0;
    return out;
}

// Rebuilds both trees from `text` as the loader does.
inline int32_t construct(const std::string &text) {
    idm::clmap::MapHold hold(&idmutex);
    return idm__construct_clcfg(hold, text.data(), text.size());
}

// The two trees, names and addresses: each key with the clusters of the
// first record listing it.
using Tree = std::map<std::string, std::vector<std::string>>;
using Trees = std::pair<Tree, Tree>;

// What the loader should build from a parse: C strings (cut at a NUL);
// nothing unless the text is valid.
inline Trees expected_trees(const Result &r) {
    Trees trees;
    std::vector<std::string> values[3];
    for (const Event &e : r.events) {
        if (!e.record) {
            values[e.attr].push_back(e.value.substr(0, e.value.find('\0')));
            continue;
        }
        for (const std::string &n : values[0]) trees.first.emplace(n, values[2]);
        for (const std::string &a : values[1]) trees.second.emplace(a, values[2]);
        for (auto &v : values) v.clear();
    }
    return r.status == 0 ? trees : Trees{};
}

// What nametree and iptree hold.
inline Trees library_trees() {
    Trees trees;
    for (auto [tree, out] : {std::pair{&nametree, &trees.first}, {&iptree, &trees.second}}) {
        void **array = nullptr;
        uint32_t n = 0;
        sec__rst_array(tree, &array, &n);
        for (uint32_t i = 0; i < n; ++i) {
            const auto *node = static_cast<const idm_clnode *>(array[i]);
            (*out)[node->key].assign(node->clusters, node->clusters + node->count);
        }
        std::free(array);
    }
    return trees;
}

// "key=c1,c2 key2=c3 | address=c1": keys in strcmp order.
inline std::string format(const Trees &trees) {
    std::string s;
    for (const Tree *t : {&trees.first, &trees.second}) {
        s += t == &trees.second ? " |" : "";
        for (const auto &[key, clusters] : *t) {
            s += (s.empty() ? "" : " ") + key + "=";
            for (size_t i = 0; i < clusters.size(); ++i) s += (i ? "," : "") + clusters[i];
        }
    }
    return s;
}

}  // namespace refnode

#endif
