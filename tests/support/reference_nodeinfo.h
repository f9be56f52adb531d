// A second, deliberately plain parser of node information text, written
// straight from the file format, against which the library's parser and the
// trees its loader builds are checked (unit tests and the fuzz target).
// Statements begin after whitespace; '#' there starts a comment line;
// NODE/NAME/ADDRESS/CLUSTER are matched by case-blind prefix and need a ':'
// later on the same line; NODE opens a record (more statements may follow
// on its line); an attribute takes the rest of its line as values split at
// blanks, trimmed of whitespace, empty ones dropped; an attribute once per
// record; a record needs a cluster and a name or an address.
#ifndef OXIDM_TEST_REFERENCE_NODEINFO_H
#define OXIDM_TEST_REFERENCE_NODEINFO_H

#include <algorithm>
#include <cctype>
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

inline bool space(char c) { return std::isspace(static_cast<unsigned char>(c)) != 0; }

// The text is judged as if it ended with an LF.
inline Result parse(std::string_view text) {
    static constexpr std::string_view kAttrs[3] = {"NAME", "ADDRESS", "CLUSTER"};
    Result out;
    bool open = false;
    size_t open_at = 0;
    int given[3] = {0, 0, 0};
    auto starts = [&](size_t at, std::string_view keyword) {
        for (size_t i = 0; i < keyword.size(); ++i)
            if (at + i >= text.size() || std::toupper(static_cast<unsigned char>(text[at + i])) != keyword[i])
                return false;
        return true;
    };
    auto fail = [&](int point, size_t at) {
        out.status = 21;
        out.point = point;
        out.line = 1 + static_cast<size_t>(std::count(text.begin(), text.begin() + at, '\n'));
        return out;
    };
    size_t pos = 0;
    while (pos < text.size()) {
        const size_t end = std::min(text.find('\n', pos), text.size());
        const std::string_view line = text.substr(0, end);
        if (space(text[pos])) {
            ++pos;
        } else if (text[pos] == '#') {
            pos = end + 1;
        } else if (starts(pos, "NODE")) {
            if (open && (given[2] == 0 || given[0] + given[1] == 0)) return fail(157, open_at);
            if (open) out.events.push_back({true, -1, {}});
            const size_t colon = line.find(':', pos + 4);
            if (colon == std::string_view::npos) return fail(164, pos);
            open = true;
            open_at = pos;
            given[0] = given[1] = given[2] = 0;
            pos = colon + 1;
        } else {
            int a = 0;
            while (a < 3 && !starts(pos, kAttrs[a])) ++a;
            if (a == 3) return fail(171, pos);
            if (!open || given[a] != 0) return fail(165 + 2 * a, pos);  // 165, 167, 169
            const size_t colon = line.find(':', pos + kAttrs[a].size());
            if (colon == std::string_view::npos) return fail(166 + 2 * a, pos);
            for (size_t at = colon + 1; at <= end;) {
                const size_t blank = std::min(line.find(' ', at), end);
                std::string_view v = text.substr(at, blank - at);
                while (!v.empty() && space(v.front())) v.remove_prefix(1);
                while (!v.empty() && space(v.back())) v.remove_suffix(1);
                if (!v.empty()) out.events.push_back({false, a, std::string(v)}), ++given[a];
                at = blank + 1;
            }
            pos = end;
        }
    }
    if (open && (given[2] == 0 || given[0] + given[1] == 0)) return fail(157, open_at);
    if (open) out.events.push_back({true, -1, {}});
    return out;
}

// The library's parser, seen through the same events.
inline int32_t add_value(void *c, idm::clmap::Attr a, std::string_view v) {
    return static_cast<Result *>(c)->events.push_back({false, a, std::string(v)}), 0;
}
inline int32_t add_record(void *c) { return static_cast<Result *>(c)->events.push_back({true, -1, {}}), 0; }
inline Result library_parse(std::string_view text) {
    Result out;
    const idm::clmap::ParseResult r = idm::clmap::parse(text, {&out, add_value, add_record});
    out.status = r.status, out.point = r.point, out.line = r.status != 0 ? r.line : 0;
    return out;
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
        if (sec__rst_array(tree, &array, &n) != 0) out->emplace("<no memory>", std::vector<std::string>{});
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
