// oxidm explain MECH IDENTITY: maps as `map` does and shows how the library
// got there.  The parser's Diag records (file state, file, line as read,
// invalid line, new entry) give each entry its file and line; the records
// written between two translator calls belong to one entry (the check of
// its rule and of the id, the application and its result).  Records are
// consumed as they are written, so any number of lines is explained.
#include <fmt/core.h>

#include "oxidm_tracepoints.h"
#include "tool.h"

namespace oxidm_tool {

namespace {

namespace tp = idm::trace::tp;

// One line the parser reported: an invalid line or an entry.  Kept small:
// a file of millions of lines is explained whole.
struct Line {
    uint32_t file = 0;  // index into Explanation::file_names
    bool invalid = false, denial = false;
    size_t number = 0;
    std::string text;  // as read, without its line feed
};

// What the records between two translator calls say about one entry.
struct Verdict {
    int32_t status = 0;                              // the translator's
    int check_rule = -1, check_id = -1, apply = -1;  // statuses, -1 when not run
    bool matched = false;
    std::string result;     // local identity from the match, "" for none
    std::string rule_text;  // from the rule dump
    int msgno = 0;
    std::string message;  // reported while this entry was handled
};

// Builds the explanation from the records as they come.
struct Explanation {
    Json files = Json::array();
    std::vector<std::string> file_names;
    std::vector<Line> lines;         // invalid lines and entries, in file order
    std::vector<size_t> entry_line;  // entry index -> index into lines
    std::vector<std::string> entry_id;  // entry index -> network id, until its call is seen
    std::vector<Verdict> verdicts;   // one per translator call
    bool aligned = true;             // call k of the walk is entry k
    std::string id_text;             // the identity as the translator made it

    // Parse position.
    size_t next_number = 1;
    Line current;
    // Dump being read.
    enum { kNone, kRule, kId } dumping = kNone;
    std::string rgy_type, rgy, mapping;
    bool has_mapping = false;
    std::vector<std::string> tokens;

    void finish_dump() {
        if (dumping != kNone && !verdicts.empty()) {
            std::string s = fmt::format("type \"{}\", registry \"{}\", tokens (", rgy_type, rgy);
            for (size_t i = 0; i < tokens.size(); ++i) s += fmt::format("{}\"{}\"", i ? ", " : "", tokens[i]);
            s += ")";
            if (dumping == kRule)
                verdicts.back().rule_text = s + (has_mapping ? ", grants \"" + mapping + "\"" : ", grants nothing");
            else if (id_text.empty())
                id_text = s;
        }
        dumping = kNone;
        tokens.clear();
        has_mapping = false;
    }

    void parse_record(const TraceRecord &r) {
        if (r.id == tp::kTestFilesState && r.items.size() >= 4) {
            Json f{{"path", r.text(1)}, {"present", r.i32(2) != 0}, {"read", r.i32(3) != 0}};
            auto known = std::find_if(files.begin(), files.end(), [&f](const Json &k) { return k["path"] == f["path"]; });
            if (known != files.end()) *known = f;
            else files.push_back(std::move(f));
        } else if (r.id == tp::kParseFile) {
            file_names.push_back(r.text(0));
            next_number = 1;
        } else if (r.id == tp::kParseLine) {
            // A piece of at most 1023 characters; a line goes on while its
            // pieces end without a line feed.
            std::string t = r.text(0);
            bool lf = !t.empty() && t.back() == '\n';
            if (lf) t.pop_back();
            current = Line{static_cast<uint32_t>(file_names.empty() ? 0 : file_names.size() - 1), false, false,
                           next_number, std::move(t)};
            if (lf || current.text.size() < 1023) ++next_number;
        } else if (r.id == tp::kEntriesInvalidLine || r.id == tp::kEntriesNewEntry) {
            if (r.id == tp::kEntriesNewEntry) {
                entry_line.push_back(lines.size());
                entry_id.push_back(r.text(2));
            }
            lines.push_back(current);
            lines.back().invalid = r.id == tp::kEntriesInvalidLine;
            lines.back().denial = r.id == tp::kEntriesNewEntry && r.text(1).rfind("Denial", 0) == 0;
        }
    }

    void walk_record(const TraceRecord &r) {
        if (verdicts.empty()) return;
        Verdict &v = verdicts.back();
        auto dump = [&](decltype(dumping) what, size_t at) {
            finish_dump();
            dumping = what;
            rgy_type = r.text(at);
            rgy = r.text(at + 1);
        };
        switch (r.id) {
            case tp::kDumpRule: dump(kRule, 1); break;
            case tp::kDumpId: dump(kId, 0); break;
            case tp::kDumpToken: if (dumping != kNone) tokens.push_back(r.text(1)); break;
            case tp::kDumpRuleMapping: has_mapping = true, mapping = r.text(1); break;
            case tp::kCheckRuleExitData: finish_dump(), v.check_rule = r.i32(0); break;
            case tp::kCheckIdExitData: finish_dump(), v.check_id = r.i32(0); break;
            case tp::kApplyMatched: v.matched = true; break;
            case tp::kApplyResult: v.matched = true, v.result = r.text(0) == "[null]" ? "" : r.text(0); break;
            case tp::kApplyExitData: finish_dump(), v.apply = r.i32(0), v.matched = v.matched || v.apply == 0; break;
            default: break;
        }
    }

    void call_start(const TranslatorCall &c) {
        finish_dump();
        if (!verdicts.empty()) {
            verdicts.back().msgno = c.msgno_before;
            verdicts.back().message = c.message_before;
        }
        // In a fresh process translator call k of the walk is entry k (no
        // rule is cached yet); the entries' identifiers must agree.
        size_t k = verdicts.size();
        aligned = aligned && c.has_entry && k < entry_id.size() && entry_id[k] == c.network_id;
        if (k < entry_id.size()) std::string().swap(entry_id[k]);
        verdicts.emplace_back();
    }
};

std::string describe(const Verdict &v, bool denial) {
    std::string what;
    switch (v.status) {
        case IDM_OK: break;
        case IDM_TRANSLATOR_STOP: what = "the translator stopped the walk"; break;
        case IDM_TRANSLATOR_REJECT: what = "the translator rejected the identity or the line"; break;
        case IDM_TRANSLATOR_REFUSED: what = "the translator refused the line"; break;
        default: return fmt::format("the translator answered status {}: the line is passed over this time", v.status);
    }
    if (!what.empty())
        what += fmt::format(" (status {}){}", v.status,
                            v.status == IDM_TRANSLATOR_REFUSED ? ": not tried again until the map files change" : "");
    else if (v.matched) return denial ? "matches: a denial, no local identity granted" : "matches: maps to \"" + v.result + "\"";
    else if (v.check_rule > 0) what = "invalid rule";
    else if (v.check_id > 0) what = "invalid id";
    else if (v.apply < 0) return "passed over: its rule was found unusable before";
    else what = "no match";
    return v.message.empty() ? what : what + ": " + short_message(v.message);
}

struct ExplainArgs {
    std::string mechanism, identity;
    Explanation x;     // the result's lines, rendered one at a time
    long decided = -1;  // entry that ended the walk with a match
};

bool explain_wants(int id) {
    static constexpr tp::Id kRead[] = {tp::kTestFilesState, tp::kParseFile, tp::kParseLine, tp::kEntriesInvalidLine,
                                       tp::kEntriesNewEntry, tp::kDumpRule, tp::kDumpId, tp::kDumpToken,
                                       tp::kDumpRuleMapping, tp::kCheckRuleExitData, tp::kCheckIdExitData,
                                       tp::kApplyMatched, tp::kApplyResult, tp::kApplyExitData};
    return std::find(std::begin(kRead), std::end(kRead), id) != std::end(kRead);
}

// Line `i` of the explanation as JSON.
Json line_json(const ExplainArgs &a, size_t i, size_t entry) {
    const Explanation &x = a.x;
    const Line &l = x.lines[i];
    Json one{{"file", x.file_names.empty() ? "" : x.file_names[l.file]}, {"line", l.number}, {"text", l.text}};
    if (l.invalid) {
        one["verdict"] = "ignored";
        one["detail"] = "invalid rule (the parser ignores the line)";
        return one;
    }
    one["kind"] = l.denial ? "denial" : "affirmative";
    if (!x.aligned || entry >= x.verdicts.size()) {
        one["verdict"] = x.aligned ? "not reached" : "unknown";
        one["detail"] = x.aligned ? "not reached: the walk ended before this line" : "(not matched with the walk)";
        return one;
    }
    const Verdict &v = x.verdicts[entry];
    one["verdict"] = v.matched ? "match" : "no match";
    one["detail"] = describe(v, l.denial);
    one["translator_status"] = v.status;
    if (v.apply >= 0) one["apply"] = v.apply;
    if (v.msgno != 0) one["message_number"] = v.msgno;
    if (!v.rule_text.empty()) one["rule"] = v.rule_text;
    one["decided"] = static_cast<long>(entry) == a.decided;
    return one;
}

// Hands every line to `sink` in file order.
void each_line(const ExplainArgs &a, const std::function<void(const Json &)> &sink) {
    size_t entry = 0;
    for (size_t i = 0; i < a.x.lines.size(); ++i) sink(line_json(a, i, a.x.lines[i].invalid ? 0 : entry++));
}

Result run_explain(const Options &o, ExplainArgs &a) {
    Result r;
    r.json["mechanism"] = a.mechanism;
    r.json["identity"] = a.identity;
    if (a.mechanism.empty() || a.identity.empty()) {
        r.fail("usage", "explain: MECH and IDENTITY must not be empty");
        return r;
    }
    if (std::string e = unreadable_config({kLocalMap, kVarGlobalMap, kOptGlobalMap}); !e.empty()) {
        r.fail("explain", e);
        return r;
    }
    if (std::string e = register_watched(a.mechanism); !e.empty()) {
        r.fail("explain", e);
        return r;
    }
    Explanation &x = a.x;
    Watch w;
    w.wants = explain_wants;
    w.on_record = [&x](const TraceRecord &t) {
        x.parse_record(t);
        x.walk_record(t);
    };
    w.on_call_start = [&x](const TranslatorCall &c) { x.call_start(c); };
    w.on_call_end = [&x](const TranslatorCall &c) { x.verdicts.back().status = c.status; };
    MapOutcome m = map_watched(o, a.mechanism, a.identity, true, std::move(w));
    x.finish_dump();
    if (!x.verdicts.empty()) {
        x.verdicts.back().msgno = m.msgno_after;
        x.verdicts.back().message = m.message_after;
    }
    x.aligned = x.aligned && x.verdicts.size() <= x.entry_line.size();
    a.decided = m.status == 0 && !x.verdicts.empty() && x.verdicts.back().matched
                    ? static_cast<long>(x.verdicts.size()) - 1
                    : -1;
    if (m.granted) r.exit = kExitAnswer;
    else if (m.status == 0) r.exit = kExitNoAnswer;
    else r.fail("explain " + a.identity, m.error);

    r.json["status"] = m.status;
    r.json["granted"] = m.granted;
    r.json["local"] = m.granted ? Json(m.local) : Json();
    r.json["answer"] = m.granted        ? "maps to \"" + m.local + "\""
                       : m.status == 0 ? (a.decided >= 0 ? "no local identity granted (a denial matched)"
                                                         : "no local identity granted (no line matched)")
                                       : "error: " + m.error;
    if (!m.error.empty()) r.json["error"] = m.error;
    r.json["files"] = x.files;
    r.json["id"] = x.id_text.empty() ? Json() : Json(x.id_text);
    r.json["line_count"] = x.lines.size();
    if (a.decided >= 0 && x.aligned) {
        const Line &l = x.lines[x.entry_line[static_cast<size_t>(a.decided)]];
        r.json["decided_by"] = {{"file", x.file_names[l.file]}, {"line", l.number}, {"text", l.text}};
    } else {
        r.json["decided_by"] = nullptr;
    }
    r.stream_key = "lines";
    r.stream = [&a](const std::function<void(const Json &)> &sink) { each_line(a, sink); };
    return r;
}

void text_explain(const ExplainArgs &a, const Json &j) {
    fmt::print("explain {} {}\n", j["mechanism"].get<std::string>(), j["identity"].get<std::string>());
    if (!j.contains("files")) return;
    for (const Json &f : j["files"])
        fmt::print("  file {:<34} {}\n", f["path"].get<std::string>(),
                   !f["present"].get<bool>() ? "absent" : f["read"].get<bool>() ? "selected" : "present, not used (superseded)");
    if (j["files"].empty()) fmt::print("  (the map files were not read in this call)\n");
    each_line(a, [&j](const Json &l) {
        std::string where = fmt::format("{}:{}", l["file"].get<std::string>(), l["line"].get<size_t>());
        fmt::print("  {}: {}\n", where, printable(l["text"]));
        if (l["verdict"] == "ignored") {
            fmt::print("      ignored by the parser: invalid rule\n");
            return;
        }
        fmt::print("      {}{}\n", printable(l["detail"]), l.value("decided", false) ? "   <== decides" : "");
        if (l["verdict"] == "no match") {
            if (l.contains("rule")) fmt::print("      rule: {}\n", printable(l["rule"]));
            if (!j["id"].is_null()) fmt::print("      id:   {}\n", printable(j["id"]));
        }
    });
    std::string answer = j["answer"];
    if (!j["decided_by"].is_null())
        fmt::print("answer: {}, decided by {}:{}\n", answer, j["decided_by"]["file"].get<std::string>(),
                   j["decided_by"]["line"].get<size_t>());
    else if (j["status"] == 0 && j["line_count"] == 0)
        fmt::print("answer: {}: the map files hold no line of {}\n", answer, j["mechanism"].get<std::string>());
    else
        fmt::print("answer: {}\n", answer);
}

}  // namespace

void add_explain(CLI::App &app, Options &o, CommandList &out) {
    auto a = std::make_shared<ExplainArgs>();
    CLI::App *sub = app.add_subcommand("explain", "which map file line decided, and why earlier lines did not");
    sub->footer(
        "Every line of MECH in the order the library tried it, with the library's reason, up to the line\n"
        "that decided.  Exit status: as for map.");
    sub->add_option("MECH", a->mechanism, "the mechanism's mnemonic")->required();
    sub->add_option("IDENTITY", a->identity, "one network identity")->required();
    out.push_back({sub, [&o, a] { return run_explain(o, *a); }, [a](const Json &j) { text_explain(*a, j); }});
}

}  // namespace oxidm_tool
