// Private mount namespaces over the library's fixed configuration
// directories.  Order of work: unshare, make every mount private, open the
// source directories (so DIR stays reachable whatever the mounts hide),
// create missing mount points under an overlay, and mount over the fixed
// paths.  The scratch file system and the overlay count live for the
// process: the test programs mount fresh directories many times.
#include "rootns.h"

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>

namespace oxidm_tool {

namespace {

struct Fd {
    int fd = -1;
    Fd() = default;
    explicit Fd(int f) : fd(f) {}
    Fd(const Fd &) = delete;
    Fd &operator=(const Fd &) = delete;
    ~Fd() {
        if (fd >= 0) close(fd);
    }
};

std::string why(const std::string &what) { return what + ": " + std::strerror(errno); }

bool write_proc(const char *path, const std::string &text) {
    Fd f(open(path, O_WRONLY | O_CLOEXEC));
    if (f.fd < 0) return false;
    return write(f.fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
}

bool is_dir(const std::string &path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

std::string fd_path(int fd) { return "/proc/self/fd/" + std::to_string(fd); }

// A detached tmpfs (no mount point anywhere) that holds the overlays' upper
// and work directories and the empty stand-ins for missing directories.
class Scratch {
  public:
    std::string make() {
        if (mnt_.fd >= 0) return "";
        Fd fs(fsopen("tmpfs", FSOPEN_CLOEXEC));
        if (fs.fd < 0) return why("fsopen(tmpfs)");
        if (fsconfig(fs.fd, FSCONFIG_SET_STRING, "mode", "0755", 0) != 0 ||
            fsconfig(fs.fd, FSCONFIG_CMD_CREATE, nullptr, nullptr, 0) != 0)
            return why("creating a tmpfs");
        mnt_.fd = fsmount(fs.fd, FSMOUNT_CLOEXEC, 0);
        if (mnt_.fd < 0) return why("fsmount(tmpfs)");
        return "";
    }
    // A new directory on the scratch file system; its path through /proc.
    std::string dir(const std::string &name, std::string &error) {
        if (error = make(); !error.empty()) return "";
        if (mkdirat(mnt_.fd, name.c_str(), 0755) != 0 && errno != EEXIST) {
            error = why("scratch directory " + name);
            return "";
        }
        return fd_path(mnt_.fd) + "/" + name;
    }

  private:
    Fd mnt_;
};

// Makes `target` exist inside the namespace.  Its nearest existing ancestor
// is covered by an overlay (lower: the ancestor itself) so that mkdir writes
// only to the scratch tmpfs.
std::string make_mount_point(const std::string &target, Scratch &scratch, int &overlays) {
    if (is_dir(target)) return "";
    std::string ancestor = target;
    while (!is_dir(ancestor)) {
        size_t slash = ancestor.rfind('/');
        ancestor = slash == 0 ? "/" : ancestor.substr(0, slash);
    }
    if (ancestor == "/")
        return "cannot create " + target + ": the root directory itself would need an overlay";
    std::string error;
    std::string n = std::to_string(overlays++);
    std::string upper = scratch.dir("upper" + n, error);
    if (!error.empty()) return error;
    std::string work = scratch.dir("work" + n, error);
    if (!error.empty()) return error;
    std::string opts = "lowerdir=" + ancestor + ",upperdir=" + upper + ",workdir=" + work;
    if (mount("overlay", ancestor.c_str(), "overlay", 0, opts.c_str()) != 0)
        return why("overlay on " + ancestor);
    for (size_t i = ancestor.size() + 1; i <= target.size(); ++i) {
        if (i == target.size() || target[i] == '/') {
            std::string part = target.substr(0, i);
            if (mkdir(part.c_str(), 0755) != 0 && errno != EEXIST) return why("mkdir " + part);
        }
    }
    return "";
}

Scratch g_scratch;
int g_overlays = 0;
bool g_fresh = false;  // fresh_config has mounted over the fixed paths
constexpr const char *kTargets[] = {"/var/ox/cfg", "/opt/helvo/cfg"};

}  // namespace

std::string enter_namespace(bool as_root) {
    uid_t uid = geteuid();
    gid_t gid = getegid();
    if (uid == 0) {
        if (unshare(CLONE_NEWNS) != 0) return why("unshare(mount namespace)");
    } else {
        if (unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) return why("unshare(user and mount namespace)");
        write_proc("/proc/self/setgroups", "deny");
        const std::string inside_uid = as_root ? "0" : std::to_string(uid), inside_gid = as_root ? "0" : std::to_string(gid);
        if (!write_proc("/proc/self/uid_map", inside_uid + " " + std::to_string(uid) + " 1"))
            return why("writing uid_map");
        if (!write_proc("/proc/self/gid_map", inside_gid + " " + std::to_string(gid) + " 1"))
            return why("writing gid_map");
    }
    if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) return why("making mounts private");
    return "";
}

std::string fresh_config() {
    for (const char *target : kTargets) {
        if (std::string e = make_mount_point(target, g_scratch, g_overlays); !e.empty()) return e;
        if (g_fresh) umount2(target, MNT_DETACH);
        if (mount("tmpfs", target, "tmpfs", 0, "mode=0755") != 0) return why(std::string("tmpfs on ") + target);
    }
    g_fresh = true;
    return "";
}

std::string enter_root(const std::string &dir) {
    if (!is_dir(dir)) return "--root " + dir + ": not a directory";
    // The caller keeps its own ids inside (mapped to themselves), so the
    // library's access checks on the files answer as they would outside.
    if (std::string e = enter_namespace(false); !e.empty()) return e;

    // Sources opened inside the new namespace (a bind needs a source of its
    // own namespace) and before any overlay, so that none can hide them.
    Fd sources[2];
    bool present[2] = {};
    for (int i = 0; i < 2; ++i) {
        std::string src = dir + kTargets[i];
        sources[i].fd = open(src.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
        present[i] = sources[i].fd >= 0;
        if (!present[i] && errno != ENOENT) return why(src);
    }

    for (int i = 0; i < 2; ++i) {
        if (std::string e = make_mount_point(kTargets[i], g_scratch, g_overlays); !e.empty()) return e;
        std::string source;
        if (present[i]) {
            source = fd_path(sources[i].fd);
        } else {
            std::string error;
            source = g_scratch.dir("empty" + std::to_string(i), error);
            if (!error.empty()) return error;
        }
        if (mount(source.c_str(), kTargets[i], nullptr, MS_BIND | MS_REC, nullptr) != 0)
            return why(std::string("bind-mounting ") + (present[i] ? dir + kTargets[i] : "an empty directory") +
                       " on " + kTargets[i]);
    }
    return "";
}

}  // namespace oxidm_tool
