// Trace id table and record decoding.  The table lists every id the library
// records, with the routine that records it; 8-byte items are addresses
// unless their name starts with '#' (then a count or a time).
#include "oxidm_tracefmt.h"

#include <algorithm>
#include <cctype>
#include <cstring>
#include <string_view>

#include "ox_tr.h"
#include "oxidm_json.h"

namespace oxidm_tool {

namespace {

constexpr TraceIdInfo kIds[] = {
    {2, "idm__trace_routine_end", "end of routine", {"routine"}},
    {3, "idm__trace_routine_end", "end of routine", {"routine", "status"}},
    {4, "idm__native_read_mapfiles", "entry", {}},
    {5, "idm__native_read_mapfiles", "exit", {}},
    {6, "idm__native_read_mapfiles", "bad argument", {"position", "value"}},
    {8, "idm__native_read_mapfiles", "arguments",
     {"mechanism", "set location", "set", "count location", "count", "array location", "array"}},
    {9, "idm__native_read_mapfiles", "Diag: file about to be parsed", {"path"}},
    {12, "idm__native_read_mapfiles", "exit data",
     {"status", "set location", "set", "count location", "count", "array location"}},
    {13, "idm__native_get_mapfile_names", "entry", {}},
    {15, "idm__native_get_mapfile_names", "entry data", {"set_out", "*set_out"}},
    {16, "idm__native_get_mapfile_names", "exit", {}},
    {17, "idm__native_get_mapfile_names", "exit data: file of the set", {"index", "path"}},
    {21, "idm__native_get_mapfile_names", "bad argument", {"position", "value"}},
    {22, "idm__native_get_mapfile_names", "allocation failure", {"site", "bytes"}},
    {24, "idm__ready_mapfile", "entry", {}},
    {26, "idm__ready_mapfile", "entry data", {"path", "descriptor location", "stream location"}},
    {27, "idm__ready_mapfile", "exit", {}},
    {29, "idm__ready_mapfile", "exit data", {"status", "path", "descriptor", "stream"}},
    {30, "idm__ready_mapfile", "Diag: sec__open_file", {"path", "result", "descriptor"}},
    {31, "idm__ready_mapfile", "Diag: sec__readlock_file", {"path", "result"}},
    {32, "idm__ready_mapfile", "Diag: stream opened", {}},
    {34, "idm__ready_mapfile", "Diag: stream not opened", {"path", "errno", "stream"}},
    {35, "idm__ready_mapfile", "bad argument", {"position"}},
    {36, "idm__parse_mapfile", "entry", {}},
    {38, "idm__parse_mapfile", "entry data", {"stream", "count location", "count", "array location"}},
    {39, "idm__parse_mapfile", "exit", {}},
    {40, "idm__parse_mapfile", "exit data", {"status", "count", "array location"}},
    {42, "idm__parse_mapfile", "Diag: reading file", {"path", "mechanism"}},
    {43, "idm__parse_mapfile", "Diag: line as read", {"line"}},
    {44, "idm__parse_mapfile", "Diag: empty line", {}},
    {45, "idm__parse_mapfile", "Diag: line skipped (blank, comment or other mechanism)", {}},
    {46, "idm__parse_mapfile", "Diag: reading ended", {}},
    {47, "idm__parse_mapfile", "bad argument", {"position", "value"}},
    {48, "idm__read_mapfile_entries", "entry", {}},
    {50, "idm__read_mapfile_entries", "entry data", {"line", "count", "array location"}},
    {51, "idm__read_mapfile_entries", "exit", {}},
    {53, "idm__read_mapfile_entries", "exit data", {"status", "array location"}},
    {55, "idm__alloc_entries", "Diag: entry array grows", {"count", "bytes"}},
    {56, "idm__read_mapfile_entries", "Diag: invalid line ignored", {}},
    {58, "idm__read_mapfile_entries", "Diag: new entry", {"#read_time", "kind", "network_id", "local_id"}},
    {59, "idm__read_mapfile_entries", "bad argument", {"position", "value"}},
    {61, "idm__alloc_entries", "allocation failure", {"bytes"}},
    {62, "idm__read_mapfile_entries", "allocation failure: network identifier", {"bytes"}},
    {65, "idm__read_mapfile_entries", "allocation failure: local identifier", {"bytes"}},
    {67, "idm__native_test_mapfiles_v1", "entry", {}},
    {68, "idm__native_test_mapfiles_v1", "Diag: file appeared", {"path"}},
    {69, "idm__native_test_mapfiles_v1", "Diag: appeared file selected", {"path"}},
    {70, "idm__native_test_mapfiles_v1", "Diag: parsed in the second of its change, read again", {"path"}},
    {71, "idm__native_test_mapfiles_v1", "Diag: superseded", {"path", "superseded by"}},
    {72, "idm__native_test_mapfiles_v1", "Diag: still present", {"path"}},
    {73, "idm__native_test_mapfiles_v1", "Diag: selected", {"path"}},
    {74, "idm__native_test_mapfiles_v1", "Diag: modification time changed", {"path"}},
    {75, "idm__native_test_mapfiles_v1", "Diag: unchanged (or still absent)", {"path"}},
    {76, "idm__native_test_mapfiles_v1", "Diag: removed", {"path"}},
    {77, "idm__native_test_mapfiles_v1", "Diag: superseding file removed, read again", {"path"}},
    {78, "idm__native_test_mapfiles_v1", "exit", {}},
    {79, "idm__native_test_mapfiles_v1", "exit data", {"result"}},
    {80, "idm__native_test_mapfiles", "entry", {}},
    {81, "idm__native_test_mapfiles", "bad argument", {"position", "value"}},
    {82, "idm__native_test_mapfiles", "layout version not 1", {"version"}},
    {83, "idm__native_test_mapfiles", "Diag: file state",
     {"index", "path", "present", "in use", "removed", "reread", "mtime", "read_time"}},
    {84, "idm__native_test_mapfiles", "exit", {}},
    {85, "idm__native_test_mapfiles", "exit data", {"result"}},
    {87, "idm__thread_cleanup_mapfile", "Diag: open file released", {"path", "descriptor", "stream"}},
    {88, "sec_idm_register_translator", "entry", {}},
    {90, "sec_idm_register_translator", "entry data", {"mapping type", "mnemonic", "translator", "cleanup"}},
    {91, "sec_idm_register_translator", "exit", {}},
    {92, "sec_idm_register_translator", "exit data", {"status", "state word 0", "translator count"}},
    {93, "sec_idm_map_identity", "entry", {}},
    {95, "sec_idm_map_identity", "entry data", {"mnemonic", "network identity", "result buffer"}},
    {96, "sec_idm_map_identity", "exit", {}},
    {97, "sec_idm_map_identity", "exit data", {"status", "state word 0"}},
    {98, "sec_idm_get_groups", "entry", {}},
    {100, "sec_idm_get_groups", "entry data", {"user buffer", "count location", "list location"}},
    {101, "sec_idm_get_groups", "exit", {}},
    {102, "sec_idm_get_groups", "exit data", {"status"}},
    {103, "idm__native_register_translator", "entry", {}},
    {105, "idm__native_register_translator", "entry data", {"mnemonic", "translator", "cleanup"}},
    {106, "idm__native_register_translator", "exit", {}},
    {107, "idm__native_register_translator", "exit data", {"status"}},
    {108, "idm__native_map_identity", "entry", {}},
    {110, "idm__native_map_identity", "entry data", {"mnemonic", "network identity", "result buffer"}},
    {111, "idm__native_map_identity", "exit", {}},
    {112, "idm__native_map_identity", "exit data", {"status"}},
    {113, "idm__native_get_groups", "entry", {}},
    {115, "idm__native_get_groups", "entry data", {"user buffer", "count location", "list location"}},
    {116, "idm__native_get_groups", "exit", {}},
    {117, "idm__native_get_groups", "exit data", {"status"}},
    {118, "idm__native_check_rule", "entry", {}},
    {120, "idm__native_check_rule", "entry data", {"rule"}},
    {121, "idm__native_check_rule", "exit", {}},
    {122, "idm__native_check_rule", "exit data", {"status"}},
    {123, "idm__native_check_id", "entry", {}},
    {125, "idm__native_check_id", "entry data", {"id"}},
    {126, "idm__native_check_id", "exit", {}},
    {127, "idm__native_check_id", "exit data", {"status"}},
    {128, "idm__native_apply_rule", "entry", {}},
    {130, "idm__native_apply_rule", "entry data", {"rule", "id", "result"}},
    {131, "idm__native_apply_rule", "Mapping: rule and id matched",
     {"rule rgy_type", "rule rgy", "rule token_cnt", "rule tokens", "id rgy_type", "id rgy", "id token_cnt",
      "id tokens"}},
    {133, "idm__native_apply_rule", "Mapping: result", {"local identity"}},
    {134, "idm__native_apply_rule", "exit", {}},
    {135, "idm__native_apply_rule", "exit data", {"status"}},
    {136, "idm__trace_native_rule", "rule", {"rule_state", "rgy_type", "rgy", "token_cnt"}},
    {137, "idm__trace_native_id", "id", {"rgy_type", "rgy", "token_cnt"}},
    {138, "idm__trace_native_rule", "rule mapping", {"length", "value"}},
    {139, "idm__trace_native_rule/id", "token", {"position", "token"}},
    {140, "sec_is_in_active_cluster", "entry", {}},
    {141, "sec_is_in_active_cluster", "entry data", {"host"}},
    {142, "sec_is_in_active_cluster", "exit", {}},
    {143, "sec_is_in_active_cluster", "exit data", {"answer"}},
    {144, "sec_is_in_any_cluster", "entry", {}},
    {145, "sec_is_in_any_cluster", "entry data", {"host"}},
    {146, "sec_is_in_any_cluster", "exit", {}},
    {147, "sec_is_in_any_cluster", "exit data", {"answer"}},
    {148, "sec__idm_clmap_init", "entry", {}},
    {149, "sec__idm_clmap_init", "exit", {}},
    {150, "sec__get_cluster_names", "entry", {}},
    {151, "sec__get_cluster_names", "entry data", {"host"}},
    {152, "sec__get_cluster_names", "exit", {}},
    {153, "sec__get_cluster_names", "exit data", {"result"}},
    {154, "idm__read_clmap_file", "start", {}},
    {155, "idm__construct_clcfg", "Diag: parsing", {"text", "#length"}},
    {157, "idm__construct_clcfg", "error: host record incomplete", {}},
    {158, "idm__construct_clcfg", "Diag: host record complete", {}},
    {159, "idm__construct_clcfg", "Diag: name", {"index", "value"}},
    {160, "idm__construct_clcfg", "Diag: address", {"index", "value"}},
    {161, "idm__construct_clcfg", "Diag: cluster", {"index", "value"}},
    {162, "idm__construct_clcfg", "Diag: tree record not made", {"attribute", "value"}},
    {163, "idm__construct_clcfg", "allocation failure", {"site", "#bytes"}},
    {164, "idm__construct_clcfg", "error: NODE without \":\"", {}},
    {165, "idm__construct_clcfg", "error: NAME outside a host record, or repeated", {}},
    {166, "idm__construct_clcfg", "error: NAME without \":\"", {}},
    {167, "idm__construct_clcfg", "error: ADDRESS outside a host record, or repeated", {}},
    {168, "idm__construct_clcfg", "error: ADDRESS without \":\"", {}},
    {169, "idm__construct_clcfg", "error: CLUSTER outside a host record, or repeated", {}},
    {170, "idm__construct_clcfg", "error: CLUSTER without \":\"", {}},
    {171, "idm__construct_clcfg", "error: statement without a keyword", {}},
    {172, "idm__construct_clcfg", "error: tree insertion failed", {"attribute"}},
    {173, "idm__read_clmap_file", "end", {"status"}},
};

bool is_address_name(const char *name) {
    if (name == nullptr) return true;
    return name[0] != '#';
}

std::string quoted(std::string_view s) {
    std::string out = "\"";
    for (unsigned char c : s) {
        if (c == '"' || c == '\\') {
            out += '\\';
            out += static_cast<char>(c);
        } else if (c == '\n') {
            out += "\\n";
        } else if (c == '\r') {
            out += "\\r";
        } else if (c == '\t') {
            out += "\\t";
        } else if (c < 0x20 || c >= 0x7f) {
            char buf[8];
            std::snprintf(buf, sizeof buf, "\\x%02x", c);
            out += buf;
        } else {
            out += static_cast<char>(c);
        }
    }
    return out + "\"";
}

const char *item_name(const TraceIdInfo *info, size_t j) {
    if (info == nullptr || j >= 8 || info->items[j] == nullptr) return nullptr;
    return info->items[j][0] == '#' ? info->items[j] + 1 : info->items[j];
}

}  // namespace

const TraceIdInfo *trace_id_info(int id) {
    for (const TraceIdInfo &t : kIds)
        if (t.id == id) return &t;
    return nullptr;
}

int32_t TraceRecord::i32(size_t j) const {
    int32_t v = 0;
    if (j < items.size() && items[j].size() >= 4) std::memcpy(&v, items[j].data(), 4);
    return v;
}

int64_t TraceRecord::i64(size_t j) const {
    int64_t v = 0;
    if (j < items.size() && items[j].size() >= 8) std::memcpy(&v, items[j].data(), 8);
    return v;
}

bool TraceRecord::is_text(size_t j) const {
    if (j >= items.size() || items[j].empty() || items[j].back() != '\0') return false;
    if (kind == TRX_STRINGS) return true;
    // A 4- or 8-byte item ending in a zero byte may be a number: texts are
    // recognised by their printable bytes before the NUL.
    const std::string &s = items[j];
    for (size_t i = 0; i + 1 < s.size(); ++i) {
        unsigned char c = static_cast<unsigned char>(s[i]);
        if (c == 0) return false;
        if (c < 0x20 && c != '\t' && c != '\r' && c != '\n') return false;
    }
    if (s.size() == 4 || s.size() == 8) {
        // "abc" and "abcdefg" are as likely as small numbers; numbers win
        // unless every byte before the NUL is printable and non-zero.
        for (size_t i = 0; i + 1 < s.size(); ++i)
            if (static_cast<unsigned char>(s[i]) < 0x20) return false;
        return s.size() > 1;
    }
    return true;
}

std::string TraceRecord::text(size_t j) const {
    if (j >= items.size()) return "";
    const std::string &s = items[j];
    return !s.empty() && s.back() == '\0' ? s.substr(0, s.size() - 1) : s;
}

size_t captured_count() { return trx_count(); }

std::vector<TraceRecord> captured_records(size_t from) {
    std::vector<TraceRecord> out;
    size_t n = trx_count();
    for (size_t i = from; i < n; ++i) {
        TraceRecord r;
        int items = 0;
        if (trx_record(i, &r.id, &r.kind, &items) != 0) break;
        const char *c = trx_component(i);
        r.component = c ? c : "";
        for (int j = 0; j < items; ++j) {
            size_t len = 0;
            const void *p = trx_item(i, j, &len);
            r.items.emplace_back(p ? std::string(static_cast<const char *>(p), len) : std::string());
        }
        out.push_back(std::move(r));
    }
    return out;
}

bool parse_levels(const std::string &text, TraceLevels &out) {
    static constexpr const char *kNames[] = {"error", "api", "mapping", "milestone", "diag"};
    TraceLevels levels;
    size_t pos = 0;
    int position = 0;
    while (pos <= text.size()) {
        size_t comma = text.find(',', pos);
        if (comma == std::string::npos) comma = text.size();
        std::string item = text.substr(pos, comma - pos);
        std::string key, value = item;
        if (size_t eq = item.find('='); eq != std::string::npos) {
            key = item.substr(0, eq);
            value = item.substr(eq + 1);
        }
        if (value.empty() || value.size() > 3 || !std::all_of(value.begin(), value.end(), ::isdigit)) return false;
        int v = std::stoi(value);
        if (v > 255) return false;
        std::transform(key.begin(), key.end(), key.begin(), [](unsigned char c) { return std::tolower(c); });
        if (key.empty()) {
            if (position >= 5) return false;
            levels.level[position] = static_cast<unsigned char>(v);
        } else if (key == "all") {
            for (unsigned char &l : levels.level) l = static_cast<unsigned char>(v);
        } else {
            int cat = -1;
            for (int k = 0; k < 5; ++k)
                if (key == kNames[k]) cat = k;
            if (cat < 0) return false;
            levels.level[cat] = static_cast<unsigned char>(v);
        }
        ++position;
        pos = comma + 1;
    }
    out = levels;
    return true;
}

void apply_levels(const TraceLevels &levels) {
    for (int c = 0; c < 5; ++c) trx_set_level("_SEI", c, levels.level[c]);
}

std::string decode_item(const TraceRecord &r, size_t j) {
    const TraceIdInfo *info = trace_id_info(r.id);
    const std::string &s = r.items[j];
    const char *raw_name = info && j < 8 ? info->items[j] : nullptr;
    if (r.is_text(j)) return quoted(r.text(j));
    if (s.size() == 4) return std::to_string(r.i32(j));
    if (s.size() == 8) {
        if (!is_address_name(raw_name)) return std::to_string(r.i64(j));
        char buf[32];
        std::snprintf(buf, sizeof buf, "0x%llx", static_cast<unsigned long long>(r.i64(j)));
        return buf;
    }
    std::string hex = "<";
    for (unsigned char c : s) {
        char buf[4];
        std::snprintf(buf, sizeof buf, "%02x", c);
        hex += buf;
    }
    return hex + ">";
}

std::string format_record(const TraceRecord &r) {
    const TraceIdInfo *info = trace_id_info(r.id);
    char head[64];
    std::snprintf(head, sizeof head, "%4d ", r.id);
    std::string out = head;
    if (r.component != "_SEI" && !r.component.empty()) out += "[" + r.component + "] ";
    if (info != nullptr) {
        out += info->routine;
        out += ' ';
        out += info->what;
    } else if (r.id < 0) {
        out += "(unreadable line)";
    } else {
        out += "(unknown id)";
    }
    for (size_t j = 0; j < r.items.size(); ++j) {
        out += j == 0 ? ": " : ", ";
        if (const char *name = item_name(info, j)) {
            out += name;
            out += '=';
        }
        out += decode_item(r, j);
    }
    return out;
}

void records_json(const std::vector<TraceRecord> &records, Json &json) {
    json.begin_array("records");
    for (const TraceRecord &r : records) {
        const TraceIdInfo *info = trace_id_info(r.id);
        json.begin_object();
        json.str("component", r.component);
        json.num("id", r.id);
        json.opt("routine", info ? info->routine : nullptr);
        json.opt("what", info ? info->what : nullptr);
        json.begin_array("items");
        for (size_t j = 0; j < r.items.size(); ++j) {
            json.begin_object();
            json.opt("name", item_name(info, j));
            const std::string &s = r.items[j];
            if (r.is_text(j)) {
                json.str("text", r.text(j));
            } else if (s.size() == 4) {
                json.num("int", r.i32(j));
            } else if (s.size() == 8 && !is_address_name(info && j < 8 ? info->items[j] : nullptr)) {
                json.num("int", r.i64(j));
            } else {
                json.str("raw", decode_item(r, j));
            }
            json.end_object();
        }
        json.end_array();
        json.end_object();
    }
    json.end_array();
}

// The stand-in writes: COMPONENT ID then items, each " \"text\"" (no
// escaping), " N" (4-byte), " 0xH" (8-byte) or " <hex>" (other).
std::vector<TraceRecord> read_trace_file(FILE *f) {
    std::vector<TraceRecord> out;
    std::string line;
    int c;
    auto flush = [&]() {
        TraceRecord r;
        size_t sp = line.find(' ');
        bool ok = sp != std::string::npos && sp > 0;
        size_t pos = 0;
        if (ok) {
            r.component = line.substr(0, sp);
            pos = sp + 1;
            size_t end = line.find(' ', pos);
            if (end == std::string::npos) end = line.size();
            std::string id = line.substr(pos, end - pos);
            ok = !id.empty() && std::all_of(id.begin(), id.end(), ::isdigit) && id.size() < 9;
            if (ok) r.id = std::stoi(id);
            pos = end;
        }
        r.kind = TRX_DATA;
        while (ok && pos < line.size()) {
            if (line[pos] != ' ') {
                ok = false;
                break;
            }
            ++pos;
            if (pos >= line.size()) break;
            if (line[pos] == '"') {
                // Texts are written unescaped: the item runs to the last '"'
                // that is followed by a space and a token start, or the end.
                size_t q = pos + 1, close = std::string::npos;
                while (q < line.size()) {
                    size_t next = line.find('"', q);
                    if (next == std::string::npos) break;
                    if (next + 1 == line.size() ||
                        (line[next + 1] == ' ' && next + 2 < line.size() &&
                         (line[next + 2] == '"' || line[next + 2] == '<' || line[next + 2] == '-' ||
                          std::isdigit(static_cast<unsigned char>(line[next + 2]))))) {
                        close = next;
                        break;
                    }
                    q = next + 1;
                }
                if (close == std::string::npos) {
                    ok = false;
                    break;
                }
                r.items.push_back(line.substr(pos + 1, close - pos - 1) + '\0');
                pos = close + 1;
            } else {
                size_t end = line.find(' ', pos);
                if (end == std::string::npos) end = line.size();
                std::string tok = line.substr(pos, end - pos);
                pos = end;
                if (tok.size() > 2 && tok[0] == '0' && tok[1] == 'x') {
                    unsigned long long v = std::strtoull(tok.c_str() + 2, nullptr, 16);
                    r.items.emplace_back(reinterpret_cast<const char *>(&v), 8);
                } else if (tok.size() > 2 && tok.front() == '<' && tok.back() == '>') {
                    std::string bytes;
                    for (size_t k = 1; k + 2 < tok.size(); k += 2)
                        bytes += static_cast<char>(std::strtoul(tok.substr(k, 2).c_str(), nullptr, 16));
                    r.items.push_back(bytes);
                } else if (!tok.empty()) {
                    char *endp = nullptr;
                    long v = std::strtol(tok.c_str(), &endp, 10);
                    if (endp == nullptr || *endp != '\0') {
                        ok = false;
                        break;
                    }
                    int32_t v32 = static_cast<int32_t>(v);
                    r.items.emplace_back(reinterpret_cast<const char *>(&v32), 4);
                }
            }
        }
        if (!ok) {
            r = TraceRecord{};
            r.id = -1;
            r.kind = TRX_STRINGS;
            r.items.push_back(line + '\0');
        }
        out.push_back(std::move(r));
        line.clear();
    };
    while ((c = std::fgetc(f)) != EOF) {
        if (c == '\n') flush();
        else line += static_cast<char>(c);
    }
    if (!line.empty()) flush();
    return out;
}

}  // namespace oxidm_tool
