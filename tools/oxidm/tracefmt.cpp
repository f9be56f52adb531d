// Trace records decoded by the library's own table of trace points
// (oxidm_tracepoints.h): routine, meaning and item names of every id; 8-byte
// items are addresses unless their name starts with '#' (then a count or a
// time).
#include "tracefmt.h"

#include <fmt/core.h>

#include <algorithm>
#include <cstring>
#include <deque>
#include <sstream>

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

const char *raw_name(const TraceIdInfo *info, size_t j) { return info && j < 8 ? info->items[j] : nullptr; }
bool is_address_name(const char *name) { return name == nullptr || name[0] != '#'; }
const char *item_name(const TraceIdInfo *info, size_t j) {
    const char *n = raw_name(info, j);
    return n && n[0] == '#' ? n + 1 : n;
}

std::string quoted_text(std::string_view s) {
    std::string out = "\"";
    for (unsigned char c : s) {
        if (c == '"' || c == '\\') out += {'\\', static_cast<char>(c)};
        else if (c == '\n') out += "\\n";
        else if (c == '\r') out += "\\r";
        else if (c == '\t') out += "\\t";
        else if (c < 0x20 || c >= 0x7f) out += fmt::format("\\x{:02x}", c);
        else out += static_cast<char>(c);
    }
    return out + "\"";
}

// Record i of the stand-in's memory, or id -1 when there is none.
TraceRecord kept(size_t i, bool with_component, bool (*wants)(int)) {
    TraceRecord r;
    int items = 0;
    if (trx_record(i, &r.id, &r.kind, &items) != 0 || (wants && !wants(r.id))) {
        r.id = -1;
        return r;
    }
    if (with_component) r.component = trx_component(i) ? trx_component(i) : "";
    for (int j = 0; j < items; ++j) {
        size_t len = 0;
        const void *p = trx_item(i, j, &len);
        r.items.emplace_back(p ? std::string(static_cast<const char *>(p), len) : std::string());
    }
    return r;
}

std::function<void(const TraceRecord &)> g_sink;
bool (*g_wants)(int id) = nullptr;
bool g_forget = true;
size_t g_delivered = 0;
void drain_hook(int) { drain_records(); }

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
    // A 4- or 8-byte item ending in a zero byte may be a number: numbers win
    // unless every byte before the NUL is printable.
    const std::string &s = items[j];
    bool fixed = s.size() == 4 || s.size() == 8;
    return std::all_of(s.begin(), s.end() - 1, [fixed](unsigned char c) {
               return c >= 0x20 || (!fixed && c != 0 && (c == '\t' || c == '\r' || c == '\n'));
           }) && s.size() > 1;
}

std::string TraceRecord::text(size_t j) const {
    if (j >= items.size()) return "";
    const std::string &s = items[j];
    return !s.empty() && s.back() == '\0' ? s.substr(0, s.size() - 1) : s;
}

size_t captured_count() { return trx_count(); }

std::vector<TraceRecord> captured_records(size_t from) {
    std::vector<TraceRecord> out;
    for (size_t i = from, n = trx_count(); i < n; ++i) out.push_back(kept(i, true, nullptr));
    return out;
}

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
    for (size_t i = g_delivered; i < n; ++i)
        if (TraceRecord r = kept(i, false, g_wants); r.id != -1) records.push_back(std::move(r));
    if (g_forget) trx_clear();
    g_delivered = g_forget ? 0 : n;
    for (const TraceRecord &r : records) g_sink(r);
}

bool parse_levels(const std::string &text, TraceLevels &out) {
    static constexpr std::string_view kNames[] = {"error", "api", "mapping", "milestone", "diag"};
    TraceLevels levels;
    std::istringstream items(text);
    std::string item;
    for (int position = 0; std::getline(items, item, ','); ++position) {
        size_t eq = item.find('=');
        std::string key = eq == std::string::npos ? "" : item.substr(0, eq), value = item.substr(eq + 1);
        if (value.empty() || value.size() > 3 || !std::all_of(value.begin(), value.end(), ::isdigit)) return false;
        int v = std::stoi(value);
        std::transform(key.begin(), key.end(), key.begin(), [](unsigned char c) { return std::tolower(c); });
        auto cat = std::find(std::begin(kNames), std::end(kNames), key) - std::begin(kNames);
        if (v > 255 || (key.empty() && position >= 5) || (!key.empty() && key != "all" && cat == 5)) return false;
        for (int c = 0; c < 5; ++c)
            if (key == "all" || c == (key.empty() ? position : cat)) levels.level[c] = static_cast<unsigned char>(v);
    }
    if (text.empty() || text.back() == ',') return false;
    out = levels;
    return true;
}

void apply_levels(const TraceLevels &levels) {
    for (int c = 0; c < 5; ++c) trx_set_level("_SEI", c, levels.level[c]);
}

std::string decode_item(const TraceRecord &r, size_t j) {
    const std::string &s = r.items[j];
    if (r.is_text(j)) return quoted_text(r.text(j));
    if (s.size() == 4) return std::to_string(r.i32(j));
    if (s.size() == 8)
        return is_address_name(raw_name(trace_id_info(r.id), j)) ? fmt::format("0x{:x}", static_cast<uint64_t>(r.i64(j)))
                                                                 : std::to_string(r.i64(j));
    std::string hex = "<";
    for (unsigned char c : s) hex += fmt::format("{:02x}", c);
    return hex + ">";
}

std::string format_record(const TraceRecord &r) {
    const TraceIdInfo *info = trace_id_info(r.id);
    std::string out = fmt::format("{:4} ", r.id);
    if (r.component != "_SEI" && !r.component.empty()) out += "[" + r.component + "] ";
    out += info ? fmt::format("{} {}", info->routine, info->what) : r.id < 0 ? "(unreadable line)" : "(unknown id)";
    for (size_t j = 0; j < r.items.size(); ++j) {
        out += j == 0 ? ": " : ", ";
        if (const char *name = item_name(info, j)) out += fmt::format("{}=", name);
        out += decode_item(r, j);
    }
    return out;
}

nlohmann::ordered_json records_json(const std::vector<TraceRecord> &records) {
    nlohmann::ordered_json out = nlohmann::ordered_json::array();
    auto opt = [](const char *t) { return t ? nlohmann::ordered_json(t) : nlohmann::ordered_json(); };
    for (const TraceRecord &r : records) {
        const TraceIdInfo *info = trace_id_info(r.id);
        nlohmann::ordered_json items = nlohmann::ordered_json::array();
        for (size_t j = 0; j < r.items.size(); ++j) {
            nlohmann::ordered_json item{{"name", opt(item_name(info, j))}};
            const std::string &s = r.items[j];
            if (r.is_text(j)) item["text"] = r.text(j);
            else if (s.size() == 4) item["int"] = r.i32(j);
            else if (s.size() == 8 && !is_address_name(raw_name(info, j))) item["int"] = r.i64(j);
            else item["raw"] = decode_item(r, j);
            items.push_back(std::move(item));
        }
        out.push_back({{"component", r.component}, {"id", r.id}, {"routine", opt(info ? info->routine : nullptr)},
                       {"what", opt(info ? info->what : nullptr)}, {"items", std::move(items)}});
    }
    return out;
}

namespace {

// One item of the stand-in's text form at `pos` (after its space): " \"text\""
// (no escaping: the text runs to the last '"' followed by the start of
// another item or the end), " N" (4-byte), " 0xH" (8-byte), " <hex>".
bool read_item(const std::string &line, size_t &pos, std::vector<std::string> &items) {
    if (line[pos] == '"') {
        for (size_t q = line.find('"', pos + 1); q != std::string::npos; q = line.find('"', q + 1))
            if (q + 1 == line.size() || (line[q + 1] == ' ' && q + 2 < line.size() &&
                                         std::strchr("\"<-0123456789", line[q + 2]) != nullptr)) {
                items.push_back(line.substr(pos + 1, q - pos - 1) + '\0');
                pos = q + 1;
                return true;
            }
        return false;
    }
    size_t end = std::min(line.find(' ', pos), line.size());
    std::string tok = line.substr(pos, end - pos);
    pos = end;
    char *rest = nullptr;
    if (tok.size() > 2 && tok.compare(0, 2, "0x") == 0) {
        uint64_t v = std::strtoull(tok.c_str() + 2, &rest, 16);
        items.emplace_back(reinterpret_cast<const char *>(&v), 8);
    } else if (tok.size() > 2 && tok.front() == '<' && tok.back() == '>') {
        std::string bytes;
        for (size_t k = 1; k + 2 < tok.size(); k += 2)
            bytes += static_cast<char>(std::strtoul(tok.substr(k, 2).c_str(), nullptr, 16));
        items.push_back(bytes);
        return true;
    } else {
        auto v = static_cast<int32_t>(std::strtol(tok.c_str(), &rest, 10));
        items.emplace_back(reinterpret_cast<const char *>(&v), 4);
    }
    return !tok.empty() && rest != nullptr && *rest == '\0';
}

}  // namespace

std::vector<TraceRecord> read_trace_file(FILE *f) {
    std::vector<TraceRecord> out;
    std::string line;
    auto flush = [&]() {
        TraceRecord r;
        r.kind = TRX_DATA;
        size_t sp = line.find(' '), end = std::min(line.find(' ', sp + 1), line.size());
        std::string id = sp == std::string::npos ? "" : line.substr(sp + 1, end - sp - 1);
        bool ok = sp > 0 && !id.empty() && id.size() < 9 && std::all_of(id.begin(), id.end(), ::isdigit);
        if (ok) {
            r.component = line.substr(0, sp);
            r.id = std::stoi(id);
        }
        for (size_t pos = end; ok && pos < line.size();)
            ok = line[pos] == ' ' && (++pos == line.size() || read_item(line, pos, r.items));
        if (!ok) r = TraceRecord{-1, TRX_STRINGS, "", {line + '\0'}};
        out.push_back(std::move(r));
        line.clear();
    };
    for (int c; (c = std::fgetc(f)) != EOF;) {
        if (c == '\n') flush();
        else line += static_cast<char>(c);
    }
    if (!line.empty()) flush();
    return out;
}

}  // namespace oxidm_tool
