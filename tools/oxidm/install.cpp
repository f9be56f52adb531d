// oxidm install [--accept-warnings] TARGET FILE: replaces a map file or the
// node information file the way a careful editor does.  The new text is
// checked as the library will read it; a temporary file in the target's
// directory gets the target's owner and mode and is synced; the write lock
// that map file readers take (an open-file-description lock on the old
// file) is held while the temporary file is renamed into place; the
// directory is synced.  Readers see the old file or the new one, never a mix.
#include <fcntl.h>
#include <fmt/core.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "tool.h"

namespace oxidm_tool {

namespace {

struct Target {
    const char *name, *path;
    bool map;
};
constexpr Target kTargets[] = {
    {"local", kLocalMap, true},
    {"global", kVarGlobalMap, true},
    {"opt-global", kOptGlobalMap, true},
    {"nodeinfo", kNodeInfo, false},
};

struct InstallArgs {
    std::string target, file;
    bool accept_warnings = false;
};

std::string why(const std::string &what) { return fmt::format("{}: {}", what, std::strerror(errno)); }

// Waits up to 10 s for the whole-file write lock on `fd`.
bool write_lock(int fd) {
    struct flock fl {};
    fl.l_type = F_WRLCK;
    for (int tries = 0; tries < 1000; ++tries) {
        if (fcntl(fd, F_OFD_SETLK, &fl) == 0) return true;
        if (errno != EAGAIN && errno != EACCES && errno != EINTR) return false;
        usleep(10'000);
    }
    errno = ETIMEDOUT;
    return false;
}

// Writes `text` to `target` by rename; "" or what failed.  The temporary
// file is removed on failure.
std::string replace(const std::string &target, const std::string &text) {
    std::string dir = target.substr(0, target.rfind('/'));
    struct stat dst {}, old {};
    if (stat(dir.c_str(), &dst) != 0 || !S_ISDIR(dst.st_mode)) return errno ? why(dir) : dir + ": not a directory";
    bool had_old = lstat(target.c_str(), &old) == 0;
    if (!had_old && errno != ENOENT) return why(target);
    if (had_old && !S_ISREG(old.st_mode)) return target + ": not a regular file (not replaced)";
    std::string tmp = dir + "/." + target.substr(dir.size() + 1) + ".oxidm-XXXXXX";
    int fd = mkstemp(tmp.data());
    if (fd < 0) return why("creating a temporary file in " + dir);
    std::string error;
    for (size_t done = 0; error.empty() && done < text.size();) {
        ssize_t n = write(fd, text.data() + done, text.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) error = why("writing " + tmp);
        else done += static_cast<size_t>(n);
    }
    if (error.empty() && fchown(fd, had_old ? old.st_uid : geteuid(), had_old ? old.st_gid : getegid()) != 0)
        error = why("giving " + tmp + " the target's owner");
    if (error.empty() && fchmod(fd, had_old ? old.st_mode & 07777 : 0644) != 0) error = why("giving " + tmp + " the target's mode");
    if (error.empty() && fsync(fd) != 0) error = why("syncing " + tmp);
    close(fd);
    // Readers of the old file hold its shared lock while they parse it; the
    // lock goes with the descriptor, after the rename.
    int lock = had_old ? open(target.c_str(), O_WRONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK) : -1;
    if (error.empty() && had_old && (lock < 0 || !write_lock(lock))) error = why("locking " + target);
    if (error.empty() && rename(tmp.c_str(), target.c_str()) != 0) error = why("renaming " + tmp + " to " + target);
    if (lock >= 0) close(lock);
    if (!error.empty()) {
        unlink(tmp.c_str());
        return error;
    }
    int dirfd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    bool synced = dirfd >= 0 && fsync(dirfd) == 0;
    if (dirfd >= 0) close(dirfd);
    return synced ? "" : why("syncing " + dir + " (the file is in place)");
}

Result run_install(const Options &o, const InstallArgs &a) {
    Result r;
    const Target *t = nullptr;
    for (const Target &k : kTargets)
        if (a.target == k.name) t = &k;
    std::string target = o.root.empty() ? t->path : o.root + t->path;
    r.json["target"] = target;
    r.json["file"] = a.file;
    r.json["installed"] = false;
    std::string text, error;
    if (!read_file(a.file, text, error)) {
        r.fail("install", error);
        return r;
    }
    Checked c = t->map ? check_map_text(a.file, text, nullptr) : check_node_text(a.file, text);
    // The new file's own owner and mode do not matter: it gets the target's.
    std::erase_if(c.findings, [](const check::Finding &f) { return f.code == "file-writable" || f.code == "directory-writable" || f.code == "symbolic-link"; });
    permission_findings(target, c.findings);
    r.json["check"] = checked_json(c);
    size_t errors = c.count(check::Severity::kError), warnings = c.count(check::Severity::kWarning);
    if (errors > 0) {
        r.fail("install", fmt::format("{} has {} error{}: not installed", a.file, errors, errors == 1 ? "" : "s"));
        return r;
    }
    if (warnings > 0 && !a.accept_warnings) {
        r.fail("install", fmt::format("{} has {} warning{}: not installed (--accept-warnings installs it)", a.file,
                                      warnings, warnings == 1 ? "" : "s"));
        return r;
    }
    if (std::string e = replace(target, text); !e.empty()) {
        r.fail("install", e);
        return r;
    }
    r.json["installed"] = true;
    return r;
}

void text_install(const Json &j) {
    if (j.contains("check")) checked_text(j["check"]);
    if (j["installed"].get<bool>())
        fmt::print("installed {} as {}\n", j["file"].get<std::string>(), j["target"].get<std::string>());
}

}  // namespace

void add_install(CLI::App &app, Options &o, CommandList &out) {
    auto a = std::make_shared<InstallArgs>();
    CLI::App *sub = app.add_subcommand("install", "replace a map file or the node information file safely");
    sub->footer(
        "TARGET: local, global, opt-global or nodeinfo (under DIR with --root).  FILE is checked; errors\n"
        "refuse it, warnings too unless accepted; it replaces the target by rename (see oxidm(1)).\n"
        "Exit status: 0 installed, 2 not installed.");
    sub->add_option("TARGET", a->target, "local, global, opt-global or nodeinfo")
        ->required()
        ->check(CLI::IsMember({"local", "global", "opt-global", "nodeinfo"}));
    sub->add_option("FILE", a->file, "the new file")->required();
    sub->add_flag("--accept-warnings", a->accept_warnings, "install a file whose check shows warnings");
    Command c{sub, [&o, a] { return run_install(o, *a); }, text_install};
    c.own_root = true;
    out.push_back(std::move(c));
}

}  // namespace oxidm_tool
