// Node information text through the pure parser and through the loader that
// rebuilds the two trees.
//
// Input: the file's bytes.
//
// Properties beyond "no crash":
//   - idm::clmap::parse hands over exactly the values and records, and
//     fails at exactly the trace point, that a reference parser written here
//     from the file format finds (statements, keywords by case-blind prefix,
//     ':' on the same line, blank-separated values trimmed of whitespace,
//     record completeness, attributes once per record);
//   - a text without its final LF is judged as if it had one;
//   - every value is non-empty, holds no blank or LF, and neither begins
//     nor ends with whitespace;
//   - after idm__construct_clcfg on the same text, the trees hold exactly
//     the names and addresses of the records, each with the clusters of the
//     first record that lists it; after a failure both trees are empty.
#include <cctype>
#include <map>
#include <string>
#include <vector>

#include "fuzz_common.h"
#include "oxidm_clmap.h"
#include "oxidm_state.h"

namespace {

using idm::clmap::Attr;

struct Event {
    bool record;  // true: a record is complete; false: a value
    int attr;
    std::string value;
    bool operator==(const Event &o) const { return record == o.record && attr == o.attr && value == o.value; }
};
struct Outcome {
    int32_t status = 0;
    int point = 0;
    std::vector<Event> events;
};

int32_t on_value(void *context, Attr attr, std::string_view value) {
    static_cast<Outcome *>(context)->events.push_back({false, attr, std::string(value)});
    return 0;
}
int32_t on_record(void *context) {
    static_cast<Outcome *>(context)->events.push_back({true, -1, {}});
    return 0;
}

Outcome library_parse(std::string_view text) {
    Outcome out;
    const idm::clmap::ParseSink sink{&out, on_value, on_record};
    idm::clmap::ParseResult r = idm::clmap::parse(text, sink);
    out.status = r.status;
    out.point = r.point;
    return out;
}

bool space(char c) { return std::isspace(static_cast<unsigned char>(c)) != 0; }

// The reference parser; `text` ends with an LF.
Outcome reference_parse(std::string_view text) {
    Outcome out;
    bool open = false;
    int given[3] = {0, 0, 0};
    auto complete = [&] { return given[2] != 0 && (given[0] != 0 || given[1] != 0); };
    auto line_end = [&](size_t from) {
        size_t lf = text.find('\n', from);
        return lf == std::string_view::npos ? text.size() : lf;
    };
    auto starts = [&](size_t at, std::string_view keyword) {
        if (text.size() - at < keyword.size()) return false;
        for (size_t i = 0; i < keyword.size(); ++i) {
            unsigned char c = static_cast<unsigned char>(text[at + i]);
            if (c >= 'a' && c <= 'z') c = static_cast<unsigned char>(c - 'a' + 'A');
            if (c != static_cast<unsigned char>(keyword[i])) return false;
        }
        return true;
    };
    auto fail = [&](int point) {
        out.status = 21;
        out.point = point;
        return out;
    };
    struct AttrKeyword {
        std::string_view text;
        int attr, not_allowed, no_colon;
    };
    static constexpr AttrKeyword kAttrs[] = {
        {"NAME", 0, 165, 166}, {"ADDRESS", 1, 167, 168}, {"CLUSTER", 2, 169, 170}};

    size_t pos = 0;
    while (pos < text.size()) {
        if (space(text[pos])) {
            ++pos;
            continue;
        }
        if (text[pos] == '#') {
            pos = line_end(pos) + 1;
            continue;
        }
        const size_t end = line_end(pos);
        if (starts(pos, "NODE")) {
            if (open) {
                if (!complete()) return fail(157);
                out.events.push_back({true, -1, {}});
            }
            size_t colon = text.substr(0, end).find(':', pos + 4);
            if (colon == std::string_view::npos) return fail(164);
            open = true;
            given[0] = given[1] = given[2] = 0;
            pos = colon + 1;
            continue;
        }
        const AttrKeyword *k = nullptr;
        for (const AttrKeyword &a : kAttrs)
            if (starts(pos, a.text)) {
                k = &a;
                break;
            }
        if (k == nullptr) return fail(171);
        if (!open || given[k->attr] != 0) return fail(k->not_allowed);
        size_t colon = text.substr(0, end).find(':', pos + k->text.size());
        if (colon == std::string_view::npos) return fail(k->no_colon);
        // Values: the rest of the line split at blanks, each trimmed of
        // whitespace, empty ones dropped.
        std::string_view values = text.substr(colon + 1, end - colon - 1);
        size_t at = 0;
        while (at <= values.size()) {
            size_t blank = values.find(' ', at);
            if (blank == std::string_view::npos) blank = values.size();
            std::string_view v = values.substr(at, blank - at);
            while (!v.empty() && space(v.front())) v.remove_prefix(1);
            while (!v.empty() && space(v.back())) v.remove_suffix(1);
            if (!v.empty()) {
                out.events.push_back({false, k->attr, std::string(v)});
                ++given[k->attr];
            }
            at = blank + 1;
        }
        pos = end;
    }
    if (open) {
        if (!complete()) return fail(157);
        out.events.push_back({true, -1, {}});
    }
    return out;
}

void check_values(const Outcome &o) {
    for (const Event &e : o.events) {
        if (e.record) continue;
        FUZZ_CHECK(!e.value.empty(), e.value);
        FUZZ_CHECK(e.value.find_first_of(" \n") == std::string::npos, e.value);
        FUZZ_CHECK(!space(e.value.front()) && !space(e.value.back()), e.value);
    }
}

// Expected tree contents: key -> clusters of the first record listing it.
// The trees hold C strings: a value with a NUL byte is stored up to it.
using Contents = std::map<std::string, std::vector<std::string>>;
void expected_trees(const Outcome &o, Contents *names, Contents *addresses) {
    std::vector<std::string> values[3];
    for (const Event &e : o.events) {
        if (!e.record) {
            values[e.attr].push_back(fuzz::c_text(e.value));
            continue;
        }
        for (const std::string &n : values[0]) names->emplace(n, values[2]);
        for (const std::string &a : values[1]) addresses->emplace(a, values[2]);
        for (auto &v : values) v.clear();
    }
}

void check_tree(rst_tree *tree, const Contents &expected) {
    FUZZ_CHECK(tree->rst_node_cnt == expected.size(), std::to_string(tree->rst_node_cnt));
    for (const auto &[key, clusters] : expected) {
        idm_clnode probe{const_cast<char *>(key.c_str()), nullptr, 0};
        void *item = &probe;
        FUZZ_CHECK(sec__rst_find(tree, &item) == 1, key);
        const auto *node = static_cast<const idm_clnode *>(item);
        FUZZ_CHECK(node->count == static_cast<int32_t>(clusters.size()), key);
        for (size_t i = 0; i < clusters.size(); ++i) FUZZ_CHECK(clusters[i] == node->clusters[i], key);
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    static bool once = [] {
        pthread_once(&idm__init_once_block, idm__state_init);
        return true;
    }();
    (void)once;
    fuzz::trace_for(size);
    const std::string_view input(reinterpret_cast<const char *>(data), size);
    const std::string text = std::string(input) + '\n';

    const Outcome lib = library_parse(input);
    const Outcome lib_lf = library_parse(text);
    const Outcome ref = reference_parse(text);
    FUZZ_CHECK(lib.status == ref.status && lib.point == ref.point, std::to_string(lib.point));
    FUZZ_CHECK(lib.events == ref.events, "event streams differ");
    FUZZ_CHECK(lib_lf.status == lib.status && lib_lf.point == lib.point && lib_lf.events == lib.events,
               "final LF changes the verdict");
    check_values(lib);

    idm::clmap::MapHold hold(&idmutex);
    const int32_t status = idm__construct_clcfg(hold, text.data(), text.size());
    if (status == 0) {
        FUZZ_CHECK(ref.status == 0, "loaded an invalid text");
        Contents names, addresses;
        expected_trees(ref, &names, &addresses);
        check_tree(&nametree, names);
        check_tree(&iptree, addresses);
    } else {
        // 21: invalid text; 6: the record budget of a hostile file.
        FUZZ_CHECK(status == 21 || status == 6, std::to_string(status));
        FUZZ_CHECK(status != 21 || ref.status == 21, "rejected a valid text");
        FUZZ_CHECK(nametree.rst_node_cnt == 0 && iptree.rst_node_cnt == 0, "partial trees after a failure");
    }
    return 0;
}
