// map and explain: one mapping request through the shipped library, watched.
//
// The command registers each mechanism's routines through a thin pair of
// wrappers that call the plug-in's own routines unchanged and note, at every
// translator call, where the trace stood and which error was current.  The
// library's trace records between two calls belong to one entry: the check
// of its rule and of the id, the application and its result.  The parser's
// Diag records (file, line as read, invalid line, new entry) give each
// entry its file and line.  Every verdict shown is read from those records
// and from the messages the library reported; nothing is judged here.
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "ox_cu.h"
#include "ox_tr.h"
#include "oxidm.h"
#include "oxidm_cli.h"
#include "oxidm_json.h"
#include "oxidm_tracepoints.h"
#include "oxidm_plugins.h"
#include "oxidm_tracefmt.h"

namespace oxidm_tool {

namespace tp = idm::trace::tp;

namespace {

constexpr const char kMapHelp[] =
    "usage: oxidm map [--json] MECH IDENTITY...\n"
    "\n"
    "Maps each network identity of mechanism MECH to a local user with\n"
    "sec_idm_map_identity, reading the map files\n"
    "  /var/ox/cfg/oxsec_map.local, and\n"
    "  /var/ox/cfg/oxsec_map.global or else /opt/helvo/cfg/oxsec_map.global.\n"
    "The first matching line decides: a local user, or none when it is a\n"
    "denial.  `oxidm mechanisms` lists the mechanisms this command knows.\n"
    "\n"
    "exit status: 0 every identity maps to a user, 1 some identity is granted\n"
    "no local identity (no matching line, or a denial), 2 an error.\n";

constexpr const char kExplainHelp[] =
    "usage: oxidm explain [--json] MECH IDENTITY\n"
    "\n"
    "Maps IDENTITY as `oxidm map` does and shows how the library got there:\n"
    "which map files it read, every line of MECH in the order it tried them,\n"
    "why each line before the deciding one did not match (the library's own\n"
    "message: token or registry mismatch, invalid rule, ...), and the file and\n"
    "line that decided.  Lines the parser ignored as invalid are shown too.\n"
    "The source is the library's trace (API level 8, Mapping 8, Diag 1).\n"
    "\n"
    "exit status: as for map.\n";

constexpr const char kMechanismsHelp[] =
    "usage: oxidm mechanisms [--json]\n"
    "\n"
    "Lists the mechanisms (sample plug-ins) this command registers, with the\n"
    "form of their network identities.\n";

// ---- the watch on the translator ----

struct Call {
    bool has_entry = false;
    std::string network_id, local_id;
    size_t record_at = 0;              // trace records before the call
    unsigned long errors_before = 0;   // cu_set_error_1 calls before the translator ran
    unsigned long errors_after = 0;    // ... and after it returned
    int32_t status = 0;
    struct {
        int msgno = 0;
        std::string text;
    } message_before;                  // the error current when the call began
};

struct Watch {
    const Mechanism *mech = nullptr;
    std::vector<Call> calls;
};
Watch g_watch;

int32_t watched_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    Call c;
    c.record_at = trx_count();
    c.errors_before = cux_error_count();
    if (!g_watch.calls.empty() && c.errors_before > g_watch.calls.back().errors_after && cux_error_pending()) {
        c.message_before.msgno = cux_error_msgno();
        c.message_before.text = library_error();
    }
    if (entry != nullptr) {
        c.has_entry = true;
        c.network_id = entry->network_id ? entry->network_id : "";
        c.local_id = entry->local_id ? entry->local_id : "";
    }
    c.status = g_watch.mech->translator(entry, network_id, rule, id);
    c.errors_after = cux_error_count();
    g_watch.calls.push_back(std::move(c));
    return g_watch.calls.back().status;
}

int32_t watched_cleanup(idm_rule *rule, idm_id *id) { return g_watch.mech->cleanup(rule, id); }

// One-line form of a library message: line breaks and tab runs become
// single spaces.
std::string flat(const std::string &text) {
    std::string out;
    bool space = false;
    for (char c : text) {
        if (c == '\n' || c == '\t' || c == ' ') {
            space = !out.empty();
            continue;
        }
        if (space) out += ' ';
        space = false;
        out += c;
    }
    return out;
}

struct Message {
    int msgno = 0;
    std::string text;
};
Message current_message() {
    Message m;
    if (cux_error_pending()) {
        m.msgno = cux_error_msgno();
        m.text = flat(library_error());
    }
    return m;
}

// A line as the terminal should show it: control characters escaped.
std::string printable(const std::string &s) {
    std::string out;
    for (unsigned char c : s) {
        if (c == '\r') out += "\\r";
        else if (c == '\t') out += "\\t";
        else if (c < 0x20 || c == 0x7f) {
            char buf[8];
            std::snprintf(buf, sizeof buf, "\\x%02x", c);
            out += buf;
        } else out += static_cast<char>(c);
    }
    return out;
}

// ---- what the parser's records say ----

struct Piece {
    std::string file;
    size_t line = 0;
    std::string text;  // as read, without its line feed
};

struct FileState {
    int index;
    std::string path;
    bool present, in_use;
};

struct ParsedLine {
    Piece where;
    bool invalid = false;       // ignored by the parser
    int entry = -1;             // index into the entry list
    std::string kind, network_id, local_id;
};

struct ParseView {
    std::vector<FileState> files;
    std::vector<ParsedLine> lines;   // invalid lines and entries, in file order
    std::vector<int> entry_line;     // entry index -> index into lines
};

ParseView read_parse_records(const std::vector<TraceRecord> &records) {
    ParseView v;
    Piece current;
    size_t next_line = 1;
    std::string file;
    for (const TraceRecord &r : records) {
        switch (r.id) {
            case tp::kTestFilesState:
                if (r.items.size() >= 4) {
                    int index = r.i32(0);
                    std::string path = r.text(1);
                    bool present = r.i32(2) != 0, in_use = r.i32(3) != 0;
                    bool known = false;
                    for (FileState &f : v.files)
                        if (f.index == index) {
                            f = {index, path, present, in_use};
                            known = true;
                        }
                    if (!known) v.files.push_back({index, path, present, in_use});
                }
                break;
            case tp::kParseFile:
                file = r.text(0);
                next_line = 1;
                break;
            case tp::kParseLine: {
                std::string t = r.text(0);
                bool ends_line = (!t.empty() && t.back() == '\n') || t.size() < 1023;
                if (!t.empty() && t.back() == '\n') t.pop_back();
                current = {file, next_line, t};
                if (ends_line) ++next_line;
                break;
            }
            case tp::kEntriesInvalidLine: {
                ParsedLine l;
                l.where = current;
                l.invalid = true;
                v.lines.push_back(l);
                break;
            }
            case tp::kEntriesNewEntry: {
                ParsedLine l;
                l.where = current;
                l.entry = static_cast<int>(v.entry_line.size());
                l.kind = r.text(1);
                l.network_id = r.text(2);
                l.local_id = r.text(3);
                v.entry_line.push_back(static_cast<int>(v.lines.size()));
                v.lines.push_back(l);
                break;
            }
            default:
                break;
        }
    }
    return v;
}

// ---- what the walk's records say about one entry ----

struct Verdict {
    int32_t translator_status = 0;
    int check_rule = -1, check_id = -1, apply = -1;  // statuses, -1 when not run
    bool matched = false;
    std::string result;              // local identity from record 133, "" for none
    std::string rule_text, id_text;  // from the dumps 136/139/138 and 137/139
    Message message;                 // reported while this entry was handled
};

std::string join_fields(const std::string &rgy_type, const std::string &rgy, const std::vector<std::string> &tokens) {
    std::string s = "type \"" + rgy_type + "\", registry \"" + rgy + "\", tokens (";
    for (size_t i = 0; i < tokens.size(); ++i) s += (i ? ", \"" : "\"") + tokens[i] + "\"";
    return s + ")";
}

Verdict read_walk_records(const std::vector<TraceRecord> &records) {
    Verdict v;
    enum { kNone, kRule, kId } dumping = kNone;
    std::string rgy_type, rgy, mapping;
    bool has_mapping = false;
    std::vector<std::string> tokens;
    auto finish_dump = [&]() {
        if (dumping == kRule) {
            v.rule_text = join_fields(rgy_type, rgy, tokens) +
                          (has_mapping ? ", grants \"" + mapping + "\"" : ", grants nothing");
        } else if (dumping == kId) {
            v.id_text = join_fields(rgy_type, rgy, tokens);
        }
        dumping = kNone;
        tokens.clear();
        has_mapping = false;
    };
    for (const TraceRecord &r : records) {
        switch (r.id) {
            case tp::kDumpRule:
                finish_dump();
                dumping = kRule;
                rgy_type = r.text(1);
                rgy = r.text(2);
                break;
            case tp::kDumpId:
                finish_dump();
                dumping = kId;
                rgy_type = r.text(0);
                rgy = r.text(1);
                break;
            case tp::kDumpToken:
                if (dumping != kNone) tokens.push_back(r.text(1));
                break;
            case tp::kDumpRuleMapping:
                has_mapping = true;
                mapping = r.text(1);
                break;
            case tp::kCheckRuleExitData:
                finish_dump();
                v.check_rule = r.i32(0);
                break;
            case tp::kCheckIdExitData:
                finish_dump();
                v.check_id = r.i32(0);
                break;
            case tp::kApplyMatched:
                v.matched = true;
                break;
            case tp::kApplyResult: {
                v.matched = true;
                std::string value = r.text(0);
                v.result = value == "[null]" ? "" : value;
                break;
            }
            case tp::kApplyExitData:
                finish_dump();
                v.apply = r.i32(0);
                if (v.apply == 0) v.matched = true;
                break;
            default:
                break;
        }
    }
    finish_dump();
    return v;
}

// "2650-666 libox_idm Failure: Unable to ..." reads "2650-666 Unable to ...".
std::string short_message(const std::string &text) {
    std::string s = text;
    for (const char *noise : {" libox_idm Failure:", " libox_idm:", " libox_idm"}) {
        size_t at = s.find(noise);
        if (at != std::string::npos && at < 10) {
            s.erase(at, std::strlen(noise));
            break;
        }
    }
    return s;
}

std::string describe(const Verdict &v, bool denial) {
    auto with_message = [&](const std::string &what) {
        return v.message.text.empty() ? what : what + ": " + short_message(v.message.text);
    };
    switch (v.translator_status) {
        case IDM_OK: break;
        case IDM_TRANSLATOR_STOP: return with_message("the translator stopped the walk (status 31)");
        case IDM_TRANSLATOR_REJECT: return with_message("the translator rejected the identity or the line (status 38)");
        case IDM_TRANSLATOR_REFUSED:
            return with_message("the translator refused the line (status 39): not tried again until the map "
                                "files change");
        default:
            return "the translator answered status " + std::to_string(v.translator_status) +
                   ": the line is passed over this time";
    }
    if (v.matched) return denial ? "matches: a denial, no local identity granted" : "matches: maps to \"" + v.result + "\"";
    if (v.check_rule > 0) return with_message("invalid rule");
    if (v.check_id > 0) return with_message("invalid id");
    if (v.apply > 0) return with_message("no match");
    if (v.apply < 0) return "passed over: its rule was found unusable before";
    return "no match";
}

// Levels the watch needs; under `oxidm trace`, the caller's Mapping level
// is kept when it already shows matches.
void raise_levels(const Context &ctx, bool full) {
    if (full) {
        trx_set_level("_SEI", 1, 8);
        trx_set_level("_SEI", 2, 8);
        trx_set_level("_SEI", 4, 1);
        return;
    }
    unsigned char m = ctx.tracing ? ctx.trace_levels.level[2] : 0;
    if (m != 1 && m != 2 && m != 8) trx_set_level("_SEI", 2, 2);
}

// Registers the mechanism's routines (watched) with the library.
int register_watched(const std::string &mnemonic, std::string &error) {
    const Mechanism *m = find_mechanism(mnemonic);
    if (m == nullptr) {
        error = "unknown mechanism \"" + mnemonic + "\" (see oxidm mechanisms)";
        return kExitError;
    }
    g_watch.mech = m;
    clear_library_error();
    int32_t status = sec_idm_register_translator(IDM_MAPPING_NATIVE, mnemonic.c_str(), watched_translate,
                                                 watched_cleanup);
    if (status != 0) {
        error = library_error();
        if (error.empty()) error = "registration failed with status " + std::to_string(status);
        return kExitError;
    }
    return kExitAnswer;
}

struct Outcome {
    int32_t status = 0;
    bool granted = false;
    std::string local;
    bool matched = false;  // some entry matched (a denial when nothing granted)
    std::string error;
    size_t first_call = 0, end_call = 0;
    size_t first_record = 0;
};

Outcome map_one(const std::string &mnemonic, const std::string &identity) {
    Outcome o;
    o.first_call = g_watch.calls.size();
    o.first_record = trx_count();
    idm_buffer local{0, nullptr};
    clear_library_error();
    o.status = sec_idm_map_identity(mnemonic.c_str(), identity.c_str(), &local);
    o.end_call = g_watch.calls.size();
    if (o.status == 0 && local.value != nullptr) {
        o.granted = true;
        o.local = local.value;
    }
    std::free(local.value);
    if (o.status != 0) {
        o.error = library_error();
        if (o.error.empty())
            o.error = "the mechanism's translator answered status " + std::to_string(o.status) +
                      " (the library reported no message)";
    }
    for (const TraceRecord &r : captured_records(o.first_record))
        if (r.id == tp::kApplyMatched || r.id == tp::kApplyResult) o.matched = true;
    return o;
}

}  // namespace

int cmd_mechanisms(Context &ctx, const Args &in) {
    if (wants_help(in)) {
        std::fputs(kMechanismsHelp, stdout);
        return 0;
    }
    take_json(ctx, in);
    Json json;
    json.begin_object().begin_array("mechanisms");
    for (const Mechanism &m : mechanisms()) {
        json.begin_object().str("mnemonic", m.mnemonic).str("identities", m.summary).end_object();
        if (!ctx.json) std::printf("%-10s %s\n", m.mnemonic.c_str(), m.summary.c_str());
    }
    json.end_array().end_object();
    if (ctx.json) json.print();
    return kExitAnswer;
}

int cmd_map(Context &ctx, const Args &in) {
    if (wants_help(in)) {
        std::fputs(kMapHelp, stdout);
        return 0;
    }
    Args args = take_json(ctx, in);
    if (args.size() < 2) {
        std::fputs(kMapHelp, stderr);
        return kExitError;
    }
    const std::string &mnemonic = args[0];
    std::string error;
    if (register_watched(mnemonic, error) != kExitAnswer) {
        complain("map", error);
        return kExitError;
    }
    raise_levels(ctx, false);
    int worst = kExitAnswer;
    Json json;
    json.begin_object().str("mechanism", mnemonic).begin_array("results");
    for (size_t i = 1; i < args.size(); ++i) {
        const std::string &identity = args[i];
        Outcome o = map_one(mnemonic, identity);
        json.begin_object().str("identity", identity).num("status", o.status).boolean("granted", o.granted);
        if (o.granted) {
            json.str("local", o.local).str("decision", "mapped");
            if (!ctx.json) std::printf("%s -> %s\n", identity.c_str(), o.local.c_str());
        } else if (o.status == 0) {
            json.null("local").str("decision", o.matched ? "denied" : "no match");
            if (!ctx.json)
                std::printf("%s: no local identity granted (%s)\n", identity.c_str(),
                            o.matched ? "a denial matched" : "no line matched");
            if (worst < kExitNoAnswer) worst = kExitNoAnswer;
        } else {
            json.null("local").str("decision", "error").str("error", o.error);
            complain("map " + identity, o.error);
            worst = kExitError;
        }
        json.end_object();
    }
    json.end_array().end_object();
    if (ctx.json) json.print();
    return worst;
}

int cmd_explain(Context &ctx, const Args &in) {
    if (wants_help(in)) {
        std::fputs(kExplainHelp, stdout);
        return 0;
    }
    Args args = take_json(ctx, in);
    if (args.size() != 2) {
        std::fputs(kExplainHelp, stderr);
        return kExitError;
    }
    const std::string &mnemonic = args[0], &identity = args[1];
    std::string error;
    if (register_watched(mnemonic, error) != kExitAnswer) {
        complain("explain", error);
        return kExitError;
    }
    raise_levels(ctx, true);
    size_t from = trx_count();
    Outcome o = map_one(mnemonic, identity);
    Message final_message = current_message();
    unsigned long final_count = cux_error_count();
    std::vector<TraceRecord> records = captured_records(from);
    auto slice = [&](size_t a, size_t b) {
        a = std::min(a, records.size());
        b = std::min(std::max(a, b), records.size());
        return std::vector<TraceRecord>(records.begin() + static_cast<long>(a), records.begin() + static_cast<long>(b));
    };
    size_t walk_start = o.end_call > o.first_call ? g_watch.calls[o.first_call].record_at - from : records.size();
    ParseView parse = read_parse_records(slice(0, walk_start));

    // One verdict per translator call; in a fresh process call k of the walk
    // is entry k (no rule is cached yet).
    std::vector<Verdict> verdicts;
    for (size_t k = o.first_call; k < o.end_call; ++k) {
        const Call &c = g_watch.calls[k];
        size_t b = k + 1 < o.end_call ? g_watch.calls[k + 1].record_at - from : records.size();
        Verdict v = read_walk_records(slice(c.record_at - from, b));
        v.translator_status = c.status;
        // The library keeps one current error: the one current when the next
        // call began (or at the end) was reported while this entry was handled.
        if (k + 1 < o.end_call) {
            const Call &next = g_watch.calls[k + 1];
            if (next.errors_before > c.errors_after)
                v.message = {next.message_before.msgno, flat(next.message_before.text)};
        } else if (final_count > c.errors_after) {
            v.message = final_message;
        }
        verdicts.push_back(v);
    }
    bool aligned = true;
    for (size_t k = 0; k < verdicts.size(); ++k) {
        const Call &c = g_watch.calls[o.first_call + k];
        if (k >= parse.entry_line.size() || !c.has_entry) {
            aligned = false;
            continue;
        }
        const ParsedLine &l = parse.lines[static_cast<size_t>(parse.entry_line[k])];
        if (l.network_id != c.network_id || l.local_id != c.local_id) aligned = false;
    }
    int decided = -1;  // entry index that ended the walk with a match
    if (o.status == 0 && !verdicts.empty() && verdicts.back().matched) decided = static_cast<int>(verdicts.size()) - 1;

    int exit = o.granted ? kExitAnswer : (o.status == 0 ? kExitNoAnswer : kExitError);
    std::string answer = o.granted ? "maps to \"" + o.local + "\""
                         : o.status == 0 ? (decided >= 0 ? "no local identity granted (a denial matched)"
                                                         : "no local identity granted (no line matched)")
                                         : "error: " + flat(o.error);
    auto where = [&](const Piece &p) { return p.file + ":" + std::to_string(p.line); };

    Json json;
    json.begin_object().str("mechanism", mnemonic).str("identity", identity).num("status", o.status);
    json.boolean("granted", o.granted);
    if (o.granted) json.str("local", o.local);
    else json.null("local");
    json.str("answer", answer);
    if (!o.error.empty()) json.str("error", o.error);
    json.begin_array("files");
    for (const FileState &f : parse.files)
        json.begin_object().str("path", f.path).boolean("present", f.present).boolean("read", f.in_use).end_object();
    json.end_array();
    if (!ctx.json) {
        std::printf("explain %s %s\n", mnemonic.c_str(), identity.c_str());
        for (const FileState &f : parse.files)
            std::printf("  file %-34s %s\n", f.path.c_str(),
                        !f.present ? "absent" : f.in_use ? "selected" : "present, not used (superseded)");
        if (parse.files.empty())
            std::printf("  (the map files were not read in this call)\n");
    }

    json.begin_array("lines");
    for (const ParsedLine &l : parse.lines) {
        json.begin_object().str("file", l.where.file).num("line", static_cast<int64_t>(l.where.line));
        json.str("text", l.where.text);
        if (l.invalid) {
            json.str("verdict", "ignored").str("reason", "invalid rule (the parser ignores the line)");
            json.end_object();
            if (!ctx.json)
                std::printf("  %s: %s\n      ignored by the parser: invalid rule\n", where(l.where).c_str(),
                            printable(l.where.text).c_str());
            continue;
        }
        bool denial = l.kind.rfind("Denial", 0) == 0;
        json.str("kind", denial ? "denial" : "affirmative").str("network_id", l.network_id);
        if (denial) json.null("local_id");
        else json.str("local_id", l.local_id);
        size_t k = static_cast<size_t>(l.entry);
        std::string text;
        if (!aligned || k >= verdicts.size()) {
            text = aligned ? "not reached: the walk ended before this line" : "(not matched with the walk)";
            json.str("verdict", aligned ? "not reached" : "unknown");
        } else {
            const Verdict &v = verdicts[k];
            text = describe(v, denial);
            json.str("verdict", v.matched ? "match" : "no match").str("detail", text);
            json.num("translator_status", v.translator_status);
            if (v.check_rule >= 0) json.num("check_rule", v.check_rule);
            if (v.check_id >= 0) json.num("check_id", v.check_id);
            if (v.apply >= 0) json.num("apply", v.apply);
            if (v.message.msgno != 0) json.num("message_number", v.message.msgno).str("message", v.message.text);
            if (!v.rule_text.empty()) json.str("rule", v.rule_text);
            if (!v.id_text.empty()) json.str("id", v.id_text);
            json.boolean("decided", static_cast<int>(k) == decided);
        }
        json.end_object();
        if (!ctx.json) {
            std::printf("  %s: %s\n      %s%s\n", where(l.where).c_str(), printable(l.where.text).c_str(),
                        printable(text).c_str(),
                        static_cast<int>(k) == decided ? "   <== decides" : "");
            if (aligned && k < verdicts.size() && !verdicts[k].matched) {
                if (!verdicts[k].rule_text.empty())
                    std::printf("      rule: %s\n", printable(verdicts[k].rule_text).c_str());
                if (!verdicts[k].id_text.empty())
                    std::printf("      id:   %s\n", printable(verdicts[k].id_text).c_str());
            }
        }
    }
    json.end_array();
    if (decided >= 0 && aligned) {
        const ParsedLine &l = parse.lines[static_cast<size_t>(parse.entry_line[static_cast<size_t>(decided)])];
        json.begin_object("decided_by").str("file", l.where.file).num("line", static_cast<int64_t>(l.where.line));
        json.str("text", l.where.text).end_object();
        if (!ctx.json) std::printf("answer: %s, decided by %s\n", answer.c_str(), where(l.where).c_str());
    } else {
        json.null("decided_by");
        if (!ctx.json) {
            if (o.status != 0) std::printf("answer: %s\n", answer.c_str());
            else if (parse.lines.empty()) std::printf("answer: %s: the map files hold no line of %s\n", answer.c_str(), mnemonic.c_str());
            else std::printf("answer: %s\n", answer.c_str());
        }
    }
    json.end_object();
    if (ctx.json) json.print();
    if (exit == kExitError) complain("explain " + identity, o.error);
    return exit;
}

}  // namespace oxidm_tool
