// Stand-in for the maker's trace library libox_tr.  Keeps the registered
// components (their level arrays and category names) and every record, all
// guarded by g_mutex; levels are written into the component's own array,
// which the component reads without a lock (single bytes).
#include "ox_tr.h"

#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <strings.h>
#include <map>
#include <mutex>
#include <string>
#include <vector>

namespace {

struct Component {
    unsigned char *levels = nullptr;
    std::vector<std::string> categories;
    unsigned char pending[16] = {};
    bool has_pending[16] = {};
    int registrations = 0;
    int unregistrations = 0;
};

struct Record {
    std::string component;
    int id;
    int kind;
    std::vector<std::string> items;  // raw bytes
};

std::mutex g_mutex;
std::map<std::string, Component> *g_components = new std::map<std::string, Component>;  // never destroyed
std::vector<Record> *g_records = new std::vector<Record>;
bool g_keep = true;
FILE *g_out = nullptr;
bool g_env_read = false;
constexpr size_t kMaxRecords = 4u << 20;

// Called with g_mutex held.
void read_env() {
    if (g_env_read) return;
    g_env_read = true;
    if (const char *f = std::getenv("OX_TR_FILE"); f && *f) {
        if (std::strcmp(f, "stderr") == 0) g_out = stderr;
        else if (std::strcmp(f, "stdout") == 0 || std::strcmp(f, "-") == 0) g_out = stdout;
        else g_out = std::fopen(f, "ae");
    }
}

// "_SEI:API=8,Diag=1" or "_SEI:8,0,0,0,1"; several components separated by ';'.
void apply_env_levels(const std::string &name, Component &c) {
    const char *env = std::getenv("OX_TR_LEVELS");
    if (!env) return;
    std::string spec(env);
    size_t start = 0;
    while (start <= spec.size()) {
        size_t end = spec.find(';', start);
        if (end == std::string::npos) end = spec.size();
        std::string part = spec.substr(start, end - start);
        size_t colon = part.find(':');
        if (colon != std::string::npos && part.substr(0, colon) == name) {
            std::string list = part.substr(colon + 1);
            size_t p = 0;
            int position = 0;
            while (p <= list.size()) {
                size_t q = list.find(',', p);
                if (q == std::string::npos) q = list.size();
                std::string item = list.substr(p, q - p);
                size_t eq = item.find('=');
                int cat = position;
                std::string value = item;
                if (eq != std::string::npos) {
                    std::string key = item.substr(0, eq);
                    value = item.substr(eq + 1);
                    cat = -1;
                    for (size_t k = 0; k < c.categories.size(); ++k)
                        if (strcasecmp(c.categories[k].c_str(), key.c_str()) == 0) cat = static_cast<int>(k);
                }
                if (cat >= 0 && cat < 16 && !value.empty()) {
                    c.pending[cat] = static_cast<unsigned char>(std::atoi(value.c_str()));
                    c.has_pending[cat] = true;
                }
                ++position;
                p = q + 1;
            }
        }
        start = end + 1;
    }
}

void write_record(const Record &r) {
    if (!g_out) return;
    std::fprintf(g_out, "%s %d", r.component.c_str(), r.id);
    for (const std::string &item : r.items) {
        bool text = !item.empty() && item.back() == '\0';
        for (size_t i = 0; text && i + 1 < item.size(); ++i)
            if (static_cast<unsigned char>(item[i]) < 0x20 && item[i] != '\t' && item[i] != '\n') text = false;
        if (r.kind == TRX_STRINGS || (text && item.size() != 4 && item.size() != 8)) {
            std::fprintf(g_out, " \"%s\"", item.c_str());
        } else if (item.size() == 4) {
            int v;
            std::memcpy(&v, item.data(), 4);
            std::fprintf(g_out, " %d", v);
        } else if (item.size() == 8) {
            unsigned long long v;
            std::memcpy(&v, item.data(), 8);
            std::fprintf(g_out, " 0x%llx", v);
        } else {
            std::fputs(" <", g_out);
            for (unsigned char ch : item) std::fprintf(g_out, "%02x", ch);
            std::fputs(">", g_out);
        }
    }
    std::fputc('\n', g_out);
    std::fflush(g_out);
}

std::atomic<void (*)(int)> g_hook{nullptr};

void add(Record &&r) {
    const int id = r.id;
    {
        std::lock_guard<std::mutex> lock(g_mutex);
        read_env();
        write_record(r);
        if (g_keep && g_records->size() < kMaxRecords) g_records->push_back(std::move(r));
    }
    // Outside the mutex: a test's hook may block, or be cancelled, here.
    if (void (*hook)(int) = g_hook.load(std::memory_order_acquire)) hook(id);
}

}  // namespace

extern "C" int tr_register_component_1(const char *component, unsigned char *levels,
                                       const tr_category_t *categories, int count) {
    if (!component || !levels || count < 0 || count > 16) return 4;
    std::lock_guard<std::mutex> lock(g_mutex);
    read_env();
    Component &c = (*g_components)[component];
    c.levels = levels;
    // A category is known by its number, not by its place in the array.
    c.categories.assign(static_cast<size_t>(count), "");
    for (int i = 0; categories != nullptr && i < count; ++i)
        if (categories[i].name != nullptr && categories[i].number >= 0 && categories[i].number < count)
            c.categories[static_cast<size_t>(categories[i].number)] = categories[i].name;
    apply_env_levels(component, c);
    for (int i = 0; i < count; ++i)
        if (c.has_pending[i]) levels[i] = c.pending[i];
    ++c.registrations;
    return 0;
}

extern "C" int tr_unregister_component_1(const char *component) {
    if (!component) return 4;
    std::lock_guard<std::mutex> lock(g_mutex);
    auto it = g_components->find(component);
    if (it == g_components->end() || !it->second.levels) return 1;
    it->second.levels = nullptr;
    ++it->second.unregistrations;
    return 0;
}

extern "C" int tr_record_id_1(const char *component, int id) {
    add(Record{component ? component : "", id, TRX_ID, {}});
    return 0;
}

extern "C" int tr_record_data_1(const char *component, int id, int count, ...) {
    Record r{component ? component : "", id, TRX_DATA, {}};
    va_list ap;
    va_start(ap, count);
    for (int i = 0; i < count; ++i) {
        const void *p = va_arg(ap, const void *);
        size_t len = va_arg(ap, size_t);
        r.items.emplace_back(p ? std::string(static_cast<const char *>(p), len) : std::string());
    }
    va_end(ap);
    add(std::move(r));
    return 0;
}

extern "C" int tr_record_strings_1(const char *component, int id, int count, ...) {
    Record r{component ? component : "", id, TRX_STRINGS, {}};
    va_list ap;
    va_start(ap, count);
    for (int i = 0; i < count; ++i) {
        const char *s = va_arg(ap, const char *);
        std::string item = s ? s : "";
        item.push_back('\0');
        r.items.push_back(std::move(item));
    }
    va_end(ap);
    add(std::move(r));
    return 0;
}

// ---- inspection ----
extern "C" void trx_on_record(void (*hook)(int id)) { g_hook.store(hook, std::memory_order_release); }

extern "C" void trx_set_level(const char *component, int category, unsigned char level) {
    if (!component || category < 0 || category >= 16) return;
    std::lock_guard<std::mutex> lock(g_mutex);
    Component &c = (*g_components)[component];
    c.pending[category] = level;
    c.has_pending[category] = true;
    if (c.levels && category < static_cast<int>(c.categories.size()))
        __atomic_store_n(&c.levels[category], level, __ATOMIC_RELAXED);
}

extern "C" void trx_set_all_levels(const char *component, unsigned char level) {
    for (int i = 0; i < 5; ++i) trx_set_level(component, i, level);
}

extern "C" void trx_clear(void) {
    std::lock_guard<std::mutex> lock(g_mutex);
    g_records->clear();
}

extern "C" void trx_keep(int on) {
    std::lock_guard<std::mutex> lock(g_mutex);
    g_keep = on != 0;
}

extern "C" size_t trx_count(void) {
    std::lock_guard<std::mutex> lock(g_mutex);
    return g_records->size();
}

extern "C" int trx_record(size_t i, int *id, int *kind, int *items) {
    std::lock_guard<std::mutex> lock(g_mutex);
    if (i >= g_records->size()) return -1;
    const Record &r = (*g_records)[i];
    if (id) *id = r.id;
    if (kind) *kind = r.kind;
    if (items) *items = static_cast<int>(r.items.size());
    return 0;
}

extern "C" const void *trx_item(size_t i, int j, size_t *length) {
    std::lock_guard<std::mutex> lock(g_mutex);
    if (i >= g_records->size() || j < 0 || j >= static_cast<int>((*g_records)[i].items.size())) return nullptr;
    const std::string &item = (*g_records)[i].items[j];
    if (length) *length = item.size();
    return item.data();
}

extern "C" const char *trx_component(size_t i) {
    std::lock_guard<std::mutex> lock(g_mutex);
    return i < g_records->size() ? (*g_records)[i].component.c_str() : nullptr;
}

extern "C" int trx_registrations(const char *component) {
    std::lock_guard<std::mutex> lock(g_mutex);
    auto it = g_components->find(component ? component : "");
    return it == g_components->end() ? 0 : it->second.registrations;
}

extern "C" int trx_unregistrations(const char *component) {
    std::lock_guard<std::mutex> lock(g_mutex);
    auto it = g_components->find(component ? component : "");
    return it == g_components->end() ? 0 : it->second.unregistrations;
}

extern "C" const char *trx_category_name(const char *component, int category) {
    std::lock_guard<std::mutex> lock(g_mutex);
    auto it = g_components->find(component ? component : "");
    if (it == g_components->end() || category < 0 || category >= static_cast<int>(it->second.categories.size()))
        return nullptr;
    return it->second.categories[category].c_str();
}

extern "C" int trx_dump(const char *path) {
    std::lock_guard<std::mutex> lock(g_mutex);
    FILE *saved = g_out;
    FILE *f = (!path || std::strcmp(path, "-") == 0) ? stdout : std::fopen(path, "we");
    if (!f) return -1;
    g_out = f;
    for (const Record &r : *g_records) write_record(r);
    g_out = saved;
    if (f != stdout) std::fclose(f);
    return 0;
}
