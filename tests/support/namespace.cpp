// Private mount namespace for tests and benchmarks: the library's fixed
// configuration directories become fresh tmpfs mounts that only this process
// sees.  No GoogleTest dependency, so benchmarks use it too.
#include "namespace.h"

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>

namespace oxtest {

namespace {

bool g_namespace = false;

bool write_proc(const char *path, const std::string &text) {
    int fd = open(path, O_WRONLY | O_CLOEXEC);
    if (fd < 0) return false;
    bool ok = write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
    close(fd);
    return ok;
}

bool mkdirs(const std::string &path) {
    for (size_t i = 1; i <= path.size(); ++i) {
        if (i == path.size() || path[i] == '/') {
            std::string part = path.substr(0, i);
            if (mkdir(part.c_str(), 0755) != 0 && errno != EEXIST) return false;
        }
    }
    return true;
}

bool overlay(const char *dir, const char *scratch) {
    std::string upper = std::string(scratch) + "/upper";
    std::string work = std::string(scratch) + "/work";
    if (!mkdirs(upper) || !mkdirs(work)) return false;
    std::string opts = "lowerdir=" + std::string(dir) + ",upperdir=" + upper + ",workdir=" + work;
    return mount("overlay", dir, "overlay", 0, opts.c_str()) == 0;
}

bool fresh_tmpfs(const char *dir) {
    umount2(dir, MNT_DETACH);
    return mount("tmpfs", dir, "tmpfs", 0, "mode=0755") == 0;
}

}  // namespace

bool enter_private_namespace() {
    if (g_namespace) return true;
    uid_t uid = geteuid();
    gid_t gid = getegid();
    if (uid == 0) {
        if (unshare(CLONE_NEWNS) != 0) return false;
    } else {
        if (unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) return false;
        write_proc("/proc/self/setgroups", "deny");
        if (!write_proc("/proc/self/uid_map", "0 " + std::to_string(uid) + " 1")) return false;
        if (!write_proc("/proc/self/gid_map", "0 " + std::to_string(gid) + " 1")) return false;
    }
    if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) return false;
    // A private /tmp holds the overlays' upper layers; the host's /var and
    // /opt are never written.
    if (mount("tmpfs", "/tmp", "tmpfs", 0, "mode=1777") != 0) return false;
    if (!overlay("/var", "/tmp/.oxtest-var") || !overlay("/opt", "/tmp/.oxtest-opt")) return false;
    if (!mkdirs(kVarCfg) || !mkdirs(kOptCfg)) return false;
    if (!fresh_tmpfs(kVarCfg) || !fresh_tmpfs(kOptCfg)) return false;
    g_namespace = true;
    return true;
}

bool in_private_namespace() { return g_namespace; }

void fresh_config_dirs() {
    if (!g_namespace) return;
    fresh_tmpfs(kVarCfg);
    fresh_tmpfs(kOptCfg);
}

}  // namespace oxtest
