// Checkers for map files and the node information file.  The verdict on
// every line, rule or statement comes from the library's own judges; the
// walk over the text copies the library's readers (pieces of at most 1023
// characters for map files; one text with an appended LF for the node
// information file), and the reasons and warnings are this module's words.
// Time is linear in the text's size.
#include "checker.h"

#include <arpa/inet.h>
#include <fmt/core.h>

#include <algorithm>
#include <climits>
#include <cstdint>
#include <cstring>
#include <map>
#include <string>
#include <unordered_map>
#include <unordered_set>

#include "ox_cu.h"
#include "oxidm_clmap.h"
#include "oxidm_natfile.h"
#include "oxidm_natmap.h"

namespace oxidm_tool::check {

namespace {

constexpr size_t kPieceMax = 1023;  // characters per read (1024-byte buffer)

bool blank(char c) { return c == ' ' || c == '\t'; }

std::string show(std::string_view s) {
    std::string out;
    for (unsigned char c : s) {
        if (c == '\r') out += "\\r";
        else if (c == '\t') out += "\\t";
        else if (c < 0x20 || c == 0x7f) out += "?";
        else out += static_cast<char>(c);
    }
    return out;
}


// Why the library found a selected line invalid (neither a denial nor an
// affirmative mapping), for a line with the comment already cut and no line
// feed.
std::string invalid_reason(std::string_view line, bool comment_cut) {
    size_t colon = line.find(':');
    size_t p = colon + 1;
    while (p < line.size() && blank(line[p])) ++p;
    if (p >= line.size()) return "nothing follows the mechanism selector";
    std::string_view rule = line.substr(p);
    if (rule[0] == '!') {
        if (line.find('=', colon) != std::string_view::npos)
            return "a denial ('!') must not contain '='";
        return "the denial names no network identifier";
    }
    size_t eq = rule.find('=');
    if (eq == std::string_view::npos)
        return comment_cut ? "the '=' stands after a '#', which starts a comment"
                           : "no '=': an affirmative rule is NETWORK_ID=LOCAL_ID";
    if (eq == 0) return "the network identifier before '=' is empty";
    return "the local identifier after '=' is empty";
}

// Text that the library reads past without using: between the network
// identifier and '=', and after the identifier that ends the rule.
void ignored_text(const idm::mapfile::LineVerdict &v, std::string_view line, size_t line_no,
                  std::vector<Finding> &out) {
    auto trailing = [&](std::string_view id) -> std::string_view {
        size_t end = static_cast<size_t>(id.data() + id.size() - line.data());
        std::string_view rest = line.substr(end);
        size_t a = 0;
        while (a < rest.size() && blank(rest[a])) ++a;
        rest = rest.substr(a);
        while (!rest.empty() && blank(rest.back())) rest.remove_suffix(1);
        return rest;
    };
    if (v.kind == idm::mapfile::LineKind::kAffirmative) {
        std::string_view between = trailing(v.network_id);
        size_t eq = between.find('=');
        between = between.substr(0, eq);
        while (!between.empty() && blank(between.back())) between.remove_suffix(1);
        if (!between.empty())
            out.push_back({line_no, Severity::kWarning, "ignored-text",
                           "text between the network identifier and '=' is ignored: \"" + show(between) + "\""});
        std::string_view after = trailing(v.local_id);
        if (!after.empty())
            out.push_back({line_no, Severity::kWarning, "ignored-text",
                           "text after the local identifier is ignored: \"" + show(after) + "\""});
    } else if (v.kind == idm::mapfile::LineKind::kDenial) {
        std::string_view after = trailing(v.network_id);
        if (!after.empty())
            out.push_back({line_no, Severity::kWarning, "ignored-text",
                           "text after the denied identifier is ignored: \"" + show(after) + "\""});
    }
}

bool same_ignoring_case(std::string_view a, std::string_view b) {
    if (a.size() != b.size()) return false;
    for (size_t i = 0; i < a.size(); ++i)
        if (std::tolower(static_cast<unsigned char>(a[i])) != std::tolower(static_cast<unsigned char>(b[i])))
            return false;
    return true;
}

std::string trim_blanks(std::string_view s) {
    while (!s.empty() && blank(s.front())) s.remove_prefix(1);
    while (!s.empty() && blank(s.back())) s.remove_suffix(1);
    return std::string(s);
}

}  // namespace

std::string one_line(const char *text) {
    std::string out;
    for (const char *p = text ? text : ""; *p; ++p)
        if (!std::isspace(static_cast<unsigned char>(*p))) out += *p;
        else if (!out.empty() && out.back() != ' ' && p[1] != '\0' && !std::isspace(static_cast<unsigned char>(p[1])))
            out += ' ';
    return out;
}

const char *severity_name(Severity s) {
    static constexpr const char *kNames[] = {"error", "warning", "note"};
    return kNames[static_cast<int>(s)];
}


namespace {

// Has the mechanism's translator make the entry's rule, and the library
// check it, as the mapping walk does.  Adds the verdict to `out`.
void judge_rule(const Translator &t, MapEntry &e, std::vector<Finding> &out) {
    std::string nid = e.network_id, local = e.local_id;
    idm_mapfile_entry entry{};
    entry.kind = e.kind == EntryKind::kDenial ? IDM_ENTRY_DENIAL : IDM_ENTRY_AFFIRMATIVE;
    entry.network_id = nid.data();
    entry.local_id = e.kind == EntryKind::kDenial ? nullptr : local.data();
    idm_rule rule{};
    idm_id id{};
    cux_clear_error();
    int32_t status = t.translate(&entry, nid.c_str(), &rule, &id);
    bool owned = status == IDM_OK || status == IDM_TRANSLATOR_STOP || status == IDM_TRANSLATOR_REJECT ||
                 status == IDM_TRANSLATOR_REFUSED;
    if (status == IDM_TRANSLATOR_REFUSED || status == IDM_TRANSLATOR_STOP) {
        out.push_back({e.line, Severity::kError, "refused-rule",
                       fmt::format("the {} translator {} this line (status {}): the library never applies it",
                                   e.mechanism, status == IDM_TRANSLATOR_STOP ? "stops the walk at" : "refuses",
                                   status)});
    } else if (!owned) {
        out.push_back({e.line, Severity::kWarning, "translator-status",
                       fmt::format("the {} translator answers status {} for this line: the library passes it over",
                                   e.mechanism, status)});
    } else if (rule.rgy_type == nullptr && rule.tokens == nullptr) {
        out.push_back({e.line, Severity::kError, "refused-rule",
                       fmt::format("the {} translator makes no rule of this line (status {})", e.mechanism, status)});
    } else if (idm__native_check_rule(&rule) != 0) {
        out.push_back({e.line, Severity::kError, "invalid-rule",
                       "the library rejects this rule: " + one_line(cux_error_text())});
    } else {
        e.usable = true;
        e.rgy_type = rule.rgy_type;
        e.rgy = rule.rgy;
        for (int32_t i = 0; i < rule.token_cnt; ++i) e.tokens.emplace_back(rule.tokens[i]);
        if (rule.mapping != nullptr && rule.mapping->value != nullptr && std::strcmp(rule.mapping->value, "*") == 0)
            e.name_token = static_cast<int32_t>(rule.rule_state >> 16);
    }
    if (owned) t.cleanup(&rule, &id);
    cux_clear_error();
}

// Every identity `inner` can match is matched by `outer`: proved with the
// library's matcher on inner's fields read as literal text (inner's '*' as
// a character).  Sound for rules the library accepts (at most one '*' per
// field): outer's text before and after its '*' holds no '*', so it lies
// wholly before or after inner's.
bool covers(const MapEntry &outer, const MapEntry &inner) {
    if (outer.rgy_type != inner.rgy_type || outer.tokens.size() != inner.tokens.size()) return false;
    if (!idm::wildcard_match(outer.rgy.c_str(), inner.rgy.c_str())) return false;
    for (size_t i = 0; i < outer.tokens.size(); ++i)
        if (!idm::wildcard_match(outer.tokens[i].c_str(), inner.tokens[i].c_str())) return false;
    return true;
}

bool literal(const MapEntry &e) {
    if (e.rgy.find('*') != std::string::npos) return false;
    for (const std::string &t : e.tokens)
        if (t.find('*') != std::string::npos) return false;
    return true;
}

std::string key_of(const MapEntry &e) {
    std::string k = e.mechanism + '\0' + e.rgy_type + '\0' + e.rgy;
    for (const std::string &t : e.tokens) k += '\0' + t;
    return k;
}

// Earlier usable entries, indexed so that the first one covering a later
// entry is found in bounded time: equal literal rules through a hash, rules
// with a wildcard (distinct ones only, per kind) compared one by one up to a
// budget per question.  Past the budget a covering rule may be missed (one
// is never claimed falsely); `truncated` counts such questions.
class CoverIndex {
  public:
    static constexpr size_t kBudget = 64;

    // The earliest entry (of `kind`, or of either kind when null) that covers `e`.
    const MapEntry *first_cover(const MapEntry &e, const EntryKind *kind) {
        Indexed best{nullptr, SIZE_MAX};
        for (int k = 0; k < 2; ++k) {
            if (kind && static_cast<int>(*kind) != k) continue;
            if (literal(e))
                if (auto it = literal_[k].find(key_of(e)); it != literal_[k].end() && it->second.order < best.order)
                    best = it->second;
            auto it = wild_[k].find(group_of(e));
            if (it == wild_[k].end()) continue;
            size_t tried = 0;
            for (const Indexed &c : it->second) {
                if (c.order > best.order) break;
                if (++tried > kBudget) {
                    ++truncated;
                    break;
                }
                if (covers(*c.e, e)) {
                    best = c;
                    break;
                }
            }
        }
        return best.e;
    }

    void add(const MapEntry &e, size_t order) {
        int k = static_cast<int>(e.kind);
        if (literal(e)) literal_[k].emplace(key_of(e), Indexed{&e, order});  // the first one stays
        else if (wild_keys_[k].insert(key_of(e)).second) wild_[k][group_of(e)].push_back({&e, order});
    }

    size_t truncated = 0;

  private:
    struct Indexed {
        const MapEntry *e;
        size_t order;
    };
    static std::string group_of(const MapEntry &e) {
        return e.mechanism + '\0' + e.rgy_type + '\0' + std::to_string(e.tokens.size());
    }
    std::unordered_map<std::string, Indexed> literal_[2];
    std::unordered_map<std::string, std::vector<Indexed>> wild_[2];
    std::unordered_set<std::string> wild_keys_[2];
};

std::string describe_entry(const MapEntry &e, bool earlier_file, const std::string &file) {
    return fmt::format("{} ({})", earlier_file ? fmt::format("{}:{}", file, e.line) : fmt::format("line {}", e.line),
                       e.kind == EntryKind::kDenial ? "!" + show(e.network_id)
                                                    : show(e.network_id) + "=" + show(e.local_id));
}

// Shadowed entries, and pass-through mappings that can yield a privileged
// account, for the entries of this file after those of earlier files.
void analyse(const MapContext &ctx, const std::vector<MapEntry> &entries, std::vector<Finding> &out) {
    CoverIndex index;
    std::unordered_set<const MapEntry *> from_earlier;
    size_t order = 0;
    if (ctx.earlier)
        for (const MapEntry &e : *ctx.earlier)
            if (e.usable) {
                index.add(e, order++);
                from_earlier.insert(&e);
            }
    const EntryKind denial = EntryKind::kDenial;
    for (const MapEntry &d : entries) {
        if (!d.usable) continue;
        if (const MapEntry *e = index.first_cover(d, nullptr)) {
            std::string by = describe_entry(*e, from_earlier.count(e) > 0, ctx.earlier_file);
            if (d.kind == EntryKind::kDenial && e->kind == EntryKind::kAffirmative)
                out.push_back({d.line, Severity::kWarning, "dead-denial",
                               "this denial can never take effect: " + by + " matches every identity it names first"});
            else if (d.kind == EntryKind::kDenial)
                out.push_back({d.line, Severity::kNote, "redundant-denial", "already denied by " + by});
            else
                out.push_back({d.line, Severity::kNote, "shadowed-entry",
                               "never used: " + by + " matches every identity it names first"});
        } else if (d.name_token > 0 && static_cast<size_t>(d.name_token) <= d.tokens.size()) {
            // A pass-through mapping: the identity's token becomes the local
            // name.  Which privileged accounts can it yield that no earlier
            // denial refuses first?
            std::string uid0, other;
            size_t others = 0;
            MapEntry probe = d;
            for (const Account &a : ctx.privileged) {
                if (!idm::wildcard_match(d.tokens[static_cast<size_t>(d.name_token) - 1].c_str(), a.name.c_str()))
                    continue;
                probe.tokens[static_cast<size_t>(d.name_token) - 1] = a.name;
                if (index.first_cover(probe, &denial) != nullptr) continue;
                if (a.uid == 0) uid0 += (uid0.empty() ? "" : ", ") + a.name;
                else if (others++ == 0) other = a.name;
            }
            // Names only of uid 0 and the lowest other account: the rest
            // differ from system to system.
            std::string yields = uid0.empty() ? "" : uid0 + " (uid 0)";
            if (others > 0)
                yields += fmt::format("{}{} below UID_MIN {}{}", yields.empty() ? "" : " and ",
                                      others == 1 ? "the account" : "accounts", ctx.uid_min,
                                      others == 1 ? " " + other : " such as " + other);
            if (!yields.empty())
                out.push_back({d.line, Severity::kWarning, "pass-through-privileged",
                               "the mapping \"*\" passes the identity's name through and can yield " + yields +
                                   ": no earlier denial refuses it"});
        }
        index.add(d, order++);
    }
    if (index.truncated > 0)
        out.push_back({0, Severity::kNote, "cover-budget",
                       fmt::format("{} entries were compared with the first {} distinct wildcard rules of their kind "
                                   "only: an earlier rule that shadows them may go unmentioned",
                                   index.truncated, CoverIndex::kBudget)});
}

}  // namespace

MapfileReport check_mapfile_text(std::string_view text, const MapContext &ctx) {
    using idm::mapfile::LineKind;
    MapfileReport report;
    const std::string *mechanism = ctx.mechanism;
    const std::vector<std::string> *known = ctx.known;
    size_t pos = 0, line_no = 1;
    bool continuing = false;  // this piece continues the previous one's line
    while (pos < text.size()) {
        // One read: up to 1023 characters, or through the first line feed.
        size_t limit = std::min(text.size(), pos + kPieceMax);
        size_t lf = text.substr(pos, limit - pos).find('\n');
        size_t end = lf != std::string_view::npos ? pos + lf + 1 : limit;
        std::string_view piece = text.substr(pos, end - pos);
        pos = end;
        bool ends_line = !piece.empty() && piece.back() == '\n';
        size_t this_line = line_no;
        auto add = [&](Severity s, const char *code, std::string message) {
            report.findings.push_back({this_line, s, code, std::move(message)});
        };
        if (!continuing && !ends_line && piece.size() == kPieceMax && pos < text.size())
            add(Severity::kWarning, "long-line",
                "longer than 1023 characters: the library reads it as several lines, each judged on its own");
        if (ends_line) ++line_no;
        continuing = !ends_line;
        // The parser sees the piece as a C string: up to its first NUL.
        std::string_view seen = piece.substr(0, piece.find('\0'));
        if (seen.size() != piece.size() && piece.find_first_not_of(std::string_view("\0\n", 2)) != std::string_view::npos)
            add(Severity::kWarning, "nul-byte", "holds a NUL byte: the library reads the line only up to it");
        std::string_view body = seen;
        if (size_t nl = body.find('\n'); nl != std::string_view::npos) body = body.substr(0, nl);
        size_t hash = body.find('#');
        bool comment_cut = hash != std::string_view::npos && body.find('=', hash) != std::string_view::npos;
        body = body.substr(0, hash);
        size_t first = 0;
        while (first < body.size() && blank(body[first])) ++first;
        if (first == body.size()) continue;  // empty, blank or comment only
        size_t colon = body.find(':', first);
        if (colon == std::string_view::npos) {
            add(Severity::kWarning, "no-selector", "no ':' after a mechanism name: every mechanism ignores this line");
            continue;
        }
        std::string selector(body.substr(first, colon - first));
        std::string mech = mechanism ? *mechanism : selector;
        if (mechanism && selector != *mechanism) {
            if (same_ignoring_case(trim_blanks(selector), *mechanism))
                add(Severity::kWarning, "selector-mismatch",
                    fmt::format("selector \"{}\" is not \"{}\" (case and blanks count): ignored for {}", show(selector),
                                *mechanism, *mechanism));
            else
                add(Severity::kNote, "other-mechanism",
                    "a line of mechanism \"" + show(selector) + "\": ignored for " + *mechanism);
            continue;
        }
        if (selector.empty()) {
            add(Severity::kWarning, "empty-selector", "empty mechanism selector: no mechanism reads this line");
            continue;
        }
        if (!mechanism && known && std::find(known->begin(), known->end(), selector) == known->end()) {
            auto like = std::find_if(known->begin(), known->end(), [&](const std::string &k) {
                return same_ignoring_case(trim_blanks(selector), k);
            });
            if (like != known->end())
                add(Severity::kWarning, "selector-mismatch",
                    fmt::format("selector \"{}\" is not \"{}\" (case and blanks count): mechanism {} ignores it",
                                show(selector), *like, *like));
            else
                add(Severity::kNote, "unknown-mechanism", "no known mechanism is named \"" + show(selector) + "\"");
        } else if (!mechanism && (blank(selector.back()) || trim_blanks(selector) != selector))
            add(Severity::kWarning, "selector-blank",
                "selector \"" + show(selector) + "\" ends in a blank: it selects no mechanism whose name lacks it");

        idm::mapfile::LineVerdict v = idm::mapfile::judge_line(mech, piece.substr(0, seen.size()));
        if (v.kind == LineKind::kSkipped) continue;  // cannot happen for a matching selector
        if (v.kind == LineKind::kInvalid) {
            add(Severity::kError, "invalid-rule", "invalid rule, ignored by the library: " + invalid_reason(body, comment_cut));
            continue;
        }
        MapEntry e{this_line, mech, v.kind == LineKind::kDenial ? EntryKind::kDenial : EntryKind::kAffirmative,
                   std::string(v.network_id), std::string(v.local_id)};
        ignored_text(v, body, this_line, report.findings);
        std::string_view last = e.kind == EntryKind::kDenial ? std::string_view(e.network_id)
                                                             : std::string_view(e.local_id);
        if (!last.empty() && last.back() == '\r')
            add(Severity::kWarning, "carriage-return", "ends in a carriage return, which becomes part of the identifier");
        const Translator *t = ctx.translator_for ? ctx.translator_for(mech) : nullptr;
        if (t != nullptr) judge_rule(*t, e, report.findings);
        else if (std::find(report.parsed_only.begin(), report.parsed_only.end(), mech) == report.parsed_only.end())
            report.parsed_only.push_back(mech);
        report.entries.push_back(std::move(e));
    }
    report.lines = line_no - 1 + (continuing ? 1 : 0);

    // Entries that grant a uid-0 account to a wildcard identifier.
    for (const MapEntry &e : report.entries) {
        if (e.kind != EntryKind::kAffirmative || e.network_id.find('*') == std::string::npos) continue;
        for (const Account &a : ctx.privileged)
            if (a.uid == 0 && a.name == e.local_id)
                report.findings.push_back({e.line, Severity::kWarning, "wildcard-root",
                                           "the wildcard identifier \"" + show(e.network_id) + "\" maps to \"" +
                                               show(e.local_id) + "\", an account with uid 0"});
    }
    analyse(ctx, report.entries, report.findings);
    std::stable_sort(report.findings.begin(), report.findings.end(),
                     [](const Finding &a, const Finding &b) { return a.line < b.line; });
    return report;
}

namespace {

// Offsets of line starts, for turning a view into its line number.
struct LineIndex {
    std::vector<size_t> starts{0};
    explicit LineIndex(std::string_view text) {
        for (size_t i = 0; i < text.size(); ++i)
            if (text[i] == '\n') starts.push_back(i + 1);
    }
    size_t line_of(size_t offset) const {
        return static_cast<size_t>(std::upper_bound(starts.begin(), starts.end(), offset) - starts.begin());
    }
};

// Collects the parse's values per record, as the loader's working lists do.
struct Collector {
    std::string_view text;
    const LineIndex *index;
    bool keep;  // store hosts (the first, authoritative parse only)
    std::vector<std::string_view> values[3];
    std::vector<NodeHost> hosts;
    std::map<std::pair<bool, std::string>, size_t> seen;  // key -> line first listed
    std::vector<Finding> *findings;
    size_t records = 0;
    // The loader's bound on tree record bytes, and what the records so far
    // cost (keys and cluster names as C strings: up to a NUL).
    size_t budget = SIZE_MAX, spent = 0;

    static int32_t on_value(void *c, idm::clmap::Attr attr, std::string_view v) {
        auto *self = static_cast<Collector *>(c);
        self->values[attr].push_back(v);
        return 0;
    }
    static int32_t on_record(void *c) {
        auto *self = static_cast<Collector *>(c);
        return self->within_budget() ? (self->store(), 0) : kOverBudget;
    }
    static constexpr int32_t kOverBudget = 6;  // the loader's status: no memory (2650-654)
    static size_t c_length(std::string_view v) { return std::min(v.size(), v.find('\0')); }

    bool within_budget() {
        size_t cluster_bytes = 0;
        for (std::string_view c : values[idm::clmap::kClusters]) cluster_bytes += sizeof(char *) + c_length(c) + 1;
        for (int a = idm::clmap::kNames; a <= idm::clmap::kAddresses; ++a)
            for (std::string_view v : values[a]) {
                size_t need = sizeof(idm_clnode) + c_length(v) + 1 + cluster_bytes;
                if (need > budget - spent) return false;
                spent += need;
            }
        return true;
    }
    size_t line_of(std::string_view v) const { return index->line_of(static_cast<size_t>(v.data() - text.data())); }

    void store() {
        ++records;
        std::vector<std::string> clusters;
        for (std::string_view c : values[idm::clmap::kClusters]) clusters.emplace_back(c);
        for (int a = idm::clmap::kNames; a <= idm::clmap::kAddresses; ++a) {
            bool address = a == idm::clmap::kAddresses;
            for (std::string_view v : values[a]) {
                size_t line = line_of(v);
                auto [it, fresh] = seen.emplace(std::make_pair(address, std::string(v)), line);
                unsigned char buf[16];
                std::string s(v);
                if (!fresh)
                    findings->push_back({line, Severity::kWarning, "host-repeated",
                                         fmt::format("{} \"{}\" is already listed at line {}: the first record's "
                                                     "clusters are used", address ? "address" : "host name", show(v),
                                                     it->second)});
                else if (!address && (inet_pton(AF_INET, s.c_str(), buf) == 1 || inet_pton(AF_INET6, s.c_str(), buf) == 1))
                    findings->push_back({line, Severity::kWarning, "name-is-address",
                                         fmt::format("NAME value \"{}\" reads as an address: queries for it search "
                                                     "only the ADDRESS values, so it is never found", show(v))});
                if (!fresh) continue;
                if (keep) hosts.push_back({std::string(v), address, clusters, line});
            }
        }
        for (auto &list : values) list.clear();
    }
};

const char *point_reason(idm::trace::tp::Id point) {
    namespace tp = idm::trace::tp;
    switch (point) {
        case tp::kNodeRecordIncomplete: return "host record incomplete: it needs a CLUSTER value and a NAME or ADDRESS value";
        case tp::kNodeNoColon: return "NODE without ':' on its line";
        case tp::kNameMisplaced: return "NAME outside a host record (no NODE before it), or a second NAME line with values";
        case tp::kNameNoColon: return "NAME without ':' on its line";
        case tp::kAddressMisplaced: return "ADDRESS outside a host record (no NODE before it), or a second ADDRESS line with values";
        case tp::kAddressNoColon: return "ADDRESS without ':' on its line";
        case tp::kClusterMisplaced: return "CLUSTER outside a host record (no NODE before it), or a second CLUSTER line with values";
        case tp::kClusterNoColon: return "CLUSTER without ':' on its line";
        case tp::kNoKeyword: return "the statement begins with none of NODE, NAME, ADDRESS, CLUSTER";
        default: return "invalid entry";
    }
}

// Offset of the first line after `line` (1-based) whose statement is NODE.
size_t next_node_statement(std::string_view text, const LineIndex &index, size_t line) {
    for (size_t l = line; l < index.starts.size(); ++l) {
        size_t p = index.starts[l];
        while (p < text.size() && text[p] != '\n' && std::isspace(static_cast<unsigned char>(text[p]))) ++p;
        if (p < text.size() && idm::clmap::keyword_of(text.substr(p)) == idm::clmap::Keyword::kNode) return p;
    }
    return std::string_view::npos;
}

// Statements whose keyword is longer than its name ("Nodes", "NAMES ="):
// accepted by the library, worth a note.
void keyword_notes(std::string_view text, const LineIndex &index, std::vector<Finding> &out) {
    using idm::clmap::Keyword;
    static constexpr std::string_view kWords[] = {"", "NODE", "NAME", "ADDRESS", "CLUSTER"};
    auto trim = [](std::string_view v) {
        while (!v.empty() && std::isspace(static_cast<unsigned char>(v.front()))) v.remove_prefix(1);
        while (!v.empty() && std::isspace(static_cast<unsigned char>(v.back()))) v.remove_suffix(1);
        return v;
    };
    for (size_t l = 0; l < index.starts.size(); ++l) {
        std::string_view stmt = trim(text.substr(index.starts[l], text.find('\n', index.starts[l]) - index.starts[l]));
        Keyword k = stmt.empty() || stmt[0] == '#' ? Keyword::kNone : idm::clmap::keyword_of(stmt);
        size_t colon = stmt.find(':');
        if (k == Keyword::kNone || colon == std::string_view::npos) continue;
        std::string_view word = kWords[static_cast<int>(k)], head = trim(stmt.substr(0, colon));
        if (!same_ignoring_case(head, word))
            out.push_back({l + 1, Severity::kNote, "keyword-prefix",
                           fmt::format("\"{}\" is read as the keyword {} (only its first {} characters count)",
                                       show(head), word, word.size())});
        std::string_view list = stmt.substr(colon + 1);
        size_t hash = list.find('#');
        if (k != Keyword::kNode && hash != std::string_view::npos && (hash == 0 || blank(list[hash - 1])))
            out.push_back({l + 1, Severity::kWarning, "hash-value",
                           "'#' after ':' is not a comment: it and what follows are stored as values"});
        if (k != Keyword::kNode && trim(list).find('\t') != std::string_view::npos)
            out.push_back({l + 1, Severity::kWarning, "tab-in-value", "a tab does not separate values: it is kept inside one"});
    }
}

}  // namespace

NodeinfoReport check_nodeinfo_text(std::string_view raw) {
    NodeinfoReport report;
    // The loader appends an LF; judge exactly that text.
    std::string text(raw);
    text += '\n';
    LineIndex index(text);
    report.lines = static_cast<size_t>(std::count(raw.begin(), raw.end(), '\n')) +
                   (!raw.empty() && raw.back() != '\n' ? 1 : 0);
    std::vector<Finding> warnings;

    for (size_t at = raw.find('\0'); at != std::string_view::npos; at = raw.find('\0', raw.find('\n', at)))
        warnings.push_back({index.line_of(at), Severity::kWarning, "nul-byte",
                            "holds a NUL byte: the library keeps names as C strings, so a value holding it is cut "
                            "there"});

    Collector first{text, &index, true, {}, {}, {}, &warnings, 0};
    first.budget = text.size() * idm::clmap::kRecordBytesPerTextByte + idm::clmap::kRecordBytesAllowance;
    idm::clmap::ParseSink sink{&first, &Collector::on_value, &Collector::on_record};
    idm::clmap::ParseResult r = idm::clmap::parse(text, sink);
    report.records = first.records;
    if (r.status == 0) {
        report.hosts = std::move(first.hosts);
    } else if (r.status == Collector::kOverBudget) {
        r.line = std::min(r.line, std::max<size_t>(report.lines, 1));  // the end of the text, past its last LF
        report.loads = false;
        report.first_error_line = r.line;
        report.findings.push_back(
            {r.line, Severity::kError, "memory-bound",
             fmt::format("the host record ending here takes the file's tree records past the library's bound "
                         "({} bytes for this file: a copy of the cluster list per name and address): the library "
                         "loads nothing (2650-654)",
                         first.budget)});
    } else {
        report.loads = false;
        report.first_error_line = r.line;
        report.findings.push_back({r.line, Severity::kError, "invalid-statement",
                                   std::string(point_reason(r.point)) +
                                       " (2650-690: the library loads nothing from this file)"});
        // Further errors: resume at the next NODE statement after the fault.
        size_t line = r.line;
        for (int guard = 0; guard < 100000; ++guard) {
            size_t from = next_node_statement(text, index, line);
            if (from == std::string_view::npos) break;
            std::string_view rest = std::string_view(text).substr(from);
            Collector more{text, &index, false, {}, {}, {}, &warnings, 0};
            idm::clmap::ParseSink more_sink{&more, &Collector::on_value, &Collector::on_record};
            idm::clmap::ParseResult m = idm::clmap::parse(rest, more_sink);
            if (m.status == 0) break;
            size_t abs_line = index.line_of(from + m.offset);
            report.findings.push_back({abs_line, Severity::kError, "invalid-statement",
                                       std::string(point_reason(m.point)) + " (found after resuming at line " +
                                           std::to_string(index.line_of(from)) + ")"});
            if (abs_line <= line) break;
            line = abs_line;
        }
    }
    keyword_notes(text, index, warnings);
    if (report.loads && report.hosts.empty())
        warnings.push_back({0, Severity::kNote, "no-hosts", "lists no host: every cluster query answers -1"});
    report.findings.insert(report.findings.end(), warnings.begin(), warnings.end());
    std::stable_sort(report.findings.begin(), report.findings.end(),
                     [](const Finding &a, const Finding &b) { return a.line < b.line; });
    return report;
}

}  // namespace oxidm_tool::check
