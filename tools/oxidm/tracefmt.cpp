// Trace records decoded by the library's own table of trace points
// (oxidm_tracepoints.h): routine, meaning and item names of every id; 8-byte
// items are addresses unless their name starts with '#' (then a count or a
// time).
#include "tracefmt.h"

#include <algorithm>
#include <cctype>
#include <cstring>
#include <deque>
#include <functional>
#include <string_view>

#include "ox_tr.h"
#include "oxidm_tracepoints.h"

namespace oxidm_tool {

namespace {

// The library's table of trace points, each row's item names split out
// (the table keeps them as one ", "-separated text).
const std::vector<TraceIdInfo> &table() {
    static const std::vector<TraceIdInfo> rows = [] {
        static std::deque<std::string> names;  // the split names, kept for the process
        std::vector<TraceIdInfo> v;
        for (const idm::trace::TracePoint &p : idm::trace::kTracePoints) {
            TraceIdInfo t{p.id, p.routine, p.what, {}};
            std::string_view items = p.items;
            for (size_t j = 0; !items.empty() && j < 8; ++j) {
                const size_t comma = items.find(", ");
                t.items[j] = names.emplace_back(items.substr(0, comma)).c_str();
                items = comma == std::string_view::npos ? std::string_view{} : items.substr(comma + 2);
            }
            v.push_back(t);
        }
        return v;
    }();
    return rows;
}

bool is_address_name(const char *name) {
    if (name == nullptr) return true;
    return name[0] != '#';
}

std::string quoted_text(std::string_view s) {
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
    for (const TraceIdInfo &t : table())
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

namespace {
std::function<void(const TraceRecord &)> g_sink;
bool (*g_wants)(int id) = nullptr;
bool g_forget = true;
size_t g_delivered = 0;
void drain_hook(int) { drain_records(); }
}  // namespace

void stream_records(std::function<void(const TraceRecord &)> sink, bool forget, bool (*wants)(int id)) {
    g_sink = std::move(sink);
    g_wants = wants;
    g_forget = forget;
    if (forget) trx_clear();
    g_delivered = trx_count();
    trx_on_record(g_sink ? drain_hook : nullptr);
}

void drain_records() {
    if (!g_sink) return;
    std::vector<TraceRecord> records;
    size_t n = trx_count();
    for (size_t i = g_delivered; i < n; ++i) {
        int id = 0, kind = 0, items = 0;
        if (trx_record(i, &id, &kind, &items) != 0) break;
        if (g_wants && !g_wants(id)) continue;
        TraceRecord r;
        r.id = id;
        r.kind = kind;
        for (int j = 0; j < items; ++j) {
            size_t len = 0;
            const void *p = trx_item(i, j, &len);
            r.items.emplace_back(p ? std::string(static_cast<const char *>(p), len) : std::string());
        }
        records.push_back(std::move(r));
    }
    if (g_forget) trx_clear();
    g_delivered = g_forget ? 0 : n;
    for (const TraceRecord &r : records) g_sink(r);
}

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
    if (r.is_text(j)) return quoted_text(r.text(j));
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

nlohmann::ordered_json records_json(const std::vector<TraceRecord> &records) {
    nlohmann::ordered_json out = nlohmann::ordered_json::array();
    for (const TraceRecord &r : records) {
        const TraceIdInfo *info = trace_id_info(r.id);
        auto opt = [](const char *t) { return t ? nlohmann::ordered_json(t) : nlohmann::ordered_json(); };
        nlohmann::ordered_json items = nlohmann::ordered_json::array();
        for (size_t j = 0; j < r.items.size(); ++j) {
            nlohmann::ordered_json item{{"name", opt(item_name(info, j))}};
            const std::string &s = r.items[j];
            if (r.is_text(j)) item["text"] = r.text(j);
            else if (s.size() == 4) item["int"] = r.i32(j);
            else if (s.size() == 8 && !is_address_name(info && j < 8 ? info->items[j] : nullptr)) item["int"] = r.i64(j);
            else item["raw"] = decode_item(r, j);
            items.push_back(std::move(item));
        }
        out.push_back({{"component", r.component}, {"id", r.id}, {"routine", opt(info ? info->routine : nullptr)},
                       {"what", opt(info ? info->what : nullptr)}, {"items", std::move(items)}});
    }
    return out;
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
