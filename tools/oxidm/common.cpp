// What every command shares: the library's current report, file reading
// that fails closed, and the mechanisms the command knows (the sample
// plug-ins it is linked with, and those loaded with --plugin).
#include <dlfcn.h>
#include <fcntl.h>
#include <fmt/core.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "ox_cu.h"
#include "oxmpm_host.h"
#include "oxmpm_plugin.h"
#include "oxmpm_principal.h"
#include "tool.h"

namespace oxidm_tool {

std::string library_error() {
    if (!cux_error_pending()) return "";
    const char *t = cux_error_text();
    // Messages carry line feeds and tabs around their inserts: one line.
    std::string out;
    bool space = false;
    for (const char *p = t ? t : ""; *p; ++p) {
        if (*p == '\n' || *p == '\t' || *p == ' ') {
            space = !out.empty();
            continue;
        }
        if (space) out += ' ';
        space = false;
        out += *p;
    }
    return out;
}

void clear_library_error() { cux_clear_error(); }

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

bool read_file(const std::string &path, std::string &out, std::string &error) {
    // Only regular files: a device or a pipe could be endless or block
    // (opened without waiting, so that a FIFO cannot hold the command).
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (fd < 0) {
        error = fmt::format("{}: {}", path, std::strerror(errno));
        return false;
    }
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        close(fd);
        error = path + ": not a regular file";
        return false;
    }
    out.clear();
    out.reserve(static_cast<size_t>(st.st_size));
    char buf[1 << 16];
    for (;;) {
        ssize_t n = read(fd, buf, sizeof buf);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            error = fmt::format("{}: {}", path, std::strerror(errno));
            close(fd);
            return false;
        }
        if (n == 0) break;
        out.append(buf, static_cast<size_t>(n));
    }
    close(fd);
    return true;
}

bool exists(const std::string &path, bool &present, std::string &error) {
    struct stat st;
    if (lstat(path.c_str(), &st) == 0) {
        present = true;
        return true;
    }
    present = false;
    if (errno == ENOENT) return true;
    error = fmt::format("{}: {}", path, std::strerror(errno));
    return false;
}

std::string printable(const std::string &s) {
    std::string out;
    for (unsigned char c : s) {
        if (c == '\r') out += "\\r";
        else if (c == '\t') out += "\\t";
        else if (c < 0x20 || c == 0x7f) out += fmt::format("\\x{:02x}", c);
        else out += static_cast<char>(c);
    }
    return out;
}

namespace {

std::vector<Mechanism> &registry() {
    static std::vector<Mechanism> list = {
        {OXMPM_HOST_MNEMONIC, "user@host (host names without regard to case)", "built in", oxmpm_host_translate,
         oxmpm_host_cleanup},
        {OXMPM_PRINCIPAL_MNEMONIC, "name@REALM or name/instance@REALM", "built in", oxmpm_principal_translate,
         oxmpm_principal_cleanup},
    };
    return list;
}

}  // namespace

const std::vector<Mechanism> &mechanisms() { return registry(); }

const Mechanism *find_mechanism(const std::string &mnemonic) {
    // The latest loaded wins: a plug-in may stand in for a built-in one.
    const std::vector<Mechanism> &list = registry();
    for (auto it = list.rbegin(); it != list.rend(); ++it)
        if (it->mnemonic == mnemonic) return &*it;
    return nullptr;
}

bool load_plugins(const Options &o, std::string &error) {
    for (const std::string &path : o.plugins) {
        // A bare name would be searched for along the library path: a plug-in
        // is named by its path only.
        std::string name = path.find('/') == std::string::npos ? "./" + path : path;
        void *handle = dlopen(name.c_str(), RTLD_NOW | RTLD_LOCAL);
        if (handle == nullptr) {
            const char *why = dlerror();
            error = why ? why : path + ": cannot be loaded";
            return false;
        }
        auto *entry = static_cast<const oxmpm_plugin *>(dlsym(handle, OXMPM_PLUGIN_SYMBOL));
        if (entry == nullptr) {
            error = fmt::format("{}: no \"{}\" symbol: not a mechanism plug-in (see oxidm(1))", path,
                                OXMPM_PLUGIN_SYMBOL);
            return false;
        }
        if (entry->version != OXMPM_PLUGIN_VERSION || entry->mnemonic == nullptr || entry->mnemonic[0] == '\0' ||
            entry->translate == nullptr || entry->cleanup == nullptr) {
            error = fmt::format("{}: its {} (version {}) lacks a mnemonic or a routine, or is not version {}",
                                path, OXMPM_PLUGIN_SYMBOL, entry->version, OXMPM_PLUGIN_VERSION);
            return false;
        }
        registry().push_back({entry->mnemonic, entry->summary ? entry->summary : "", path, entry->translate,
                              entry->cleanup});
    }
    return true;
}

}  // namespace oxidm_tool

namespace oxidm_tool {

std::string unreadable_config(std::initializer_list<const char *> paths) {
    for (const char *p : paths) {
        bool present = false;
        std::string error;
        if (!exists(p, present, error)) return "cannot tell whether it exists: " + error;
    }
    return "";
}

}  // namespace oxidm_tool
