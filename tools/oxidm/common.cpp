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

std::string library_error() { return cux_error_pending() ? check::one_line(cux_error_text()) : ""; }

void clear_library_error() { cux_clear_error(); }

std::string short_message(const std::string &text) {
    std::string s = text;
    for (std::string_view noise : {" libox_idm Failure:", " libox_idm:", " libox_idm"})
        if (size_t at = s.find(noise); at != std::string::npos && at < 10) return s.erase(at, noise.size());
    return s;
}

bool read_file(const std::string &path, std::string &out, std::string &error) {
    // Only regular files: a device or a pipe could be endless or block
    // (opened without waiting, so that a FIFO cannot hold the command).
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    struct stat st;
    bool regular = fd >= 0 && fstat(fd, &st) == 0 && S_ISREG(st.st_mode);
    char buf[1 << 16];
    ssize_t n = 0;
    out.clear();
    while (regular && ((n = read(fd, buf, sizeof buf)) > 0 || (n < 0 && errno == EINTR)))
        if (n > 0) out.append(buf, static_cast<size_t>(n));
    if (fd < 0 || n < 0) error = fmt::format("{}: {}", path, std::strerror(errno));
    else if (!regular) error = path + ": not a regular file";
    if (fd >= 0) close(fd);
    return fd >= 0 && regular && n == 0;
}

bool exists(const std::string &path, bool &present, std::string &error) {
    struct stat st;
    present = lstat(path.c_str(), &st) == 0;
    if (present || errno == ENOENT) return true;
    error = fmt::format("{}: {}", path, std::strerror(errno));
    return false;
}

std::string unreadable_config(std::initializer_list<const char *> paths) {
    bool present = false;
    std::string error;
    for (const char *p : paths)
        if (!exists(p, present, error)) return "cannot tell whether it exists: " + error;
    return "";
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
        {OXMPM_HOST_MNEMONIC, "user@host (host names without regard to case)", "built in",
         {oxmpm_host_translate, oxmpm_host_cleanup}},
        {OXMPM_PRINCIPAL_MNEMONIC, "name@REALM or name/instance@REALM", "built in",
         {oxmpm_principal_translate, oxmpm_principal_cleanup}},
    };
    return list;
}

}  // namespace

const std::vector<Mechanism> &mechanisms() { return registry(); }

const Mechanism *find_mechanism(const std::string &mnemonic) {
    // The latest loaded wins: a plug-in may stand in for a built-in one.
    const std::vector<Mechanism> &list = registry();
    auto it = std::find_if(list.rbegin(), list.rend(), [&](const Mechanism &m) { return m.mnemonic == mnemonic; });
    return it == list.rend() ? nullptr : &*it;
}

bool load_plugins(const Options &o, std::string &error) {
    for (const std::string &path : o.plugins) {
        // A plug-in is named by its path only, never searched for.
        void *handle = dlopen((path.find('/') == std::string::npos ? "./" + path : path).c_str(), RTLD_NOW | RTLD_LOCAL);
        auto call = handle ? reinterpret_cast<oxmpm_plugin_entry_routine>(dlsym(handle, OXMPM_PLUGIN_SYMBOL)) : nullptr;
        const oxmpm_plugin *entry = call ? call() : nullptr;
        if (handle == nullptr)
            error = dlerror();
        else if (entry == nullptr)
            error = fmt::format("{}: no \"{}\" entry: not a mechanism plug-in (see oxidm(1))", path, OXMPM_PLUGIN_SYMBOL);
        else if (entry->version != OXMPM_PLUGIN_VERSION || entry->mnemonic == nullptr || entry->mnemonic[0] == '\0' ||
                 entry->translate == nullptr || entry->cleanup == nullptr)
            error = fmt::format("{}: its {} is not version {} or lacks a mnemonic or a routine", path,
                                OXMPM_PLUGIN_SYMBOL, OXMPM_PLUGIN_VERSION);
        else
            registry().push_back({entry->mnemonic, entry->summary ? entry->summary : "", path,
                                  {entry->translate, entry->cleanup}});
        if (!error.empty()) return false;
    }
    return true;
}

}  // namespace oxidm_tool
