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
    const int fd = open(path, O_WRONLY | O_CLOEXEC);
    const bool ok = fd >= 0 && write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
    if (fd >= 0) close(fd);
    return ok;
}

bool mkdirs(const std::string &path) {
    for (size_t i = path.find('/', 1);; i = path.find('/', i + 1)) {
        if (mkdir(path.substr(0, i).c_str(), 0755) != 0 && errno != EEXIST) return false;
        if (i == std::string::npos) return true;
    }
}

// `dir` becomes an overlay whose upper layer lies in the private /tmp.
bool overlay(const char *dir, const std::string &scratch) {
    const std::string opts = "lowerdir=" + std::string(dir) + ",upperdir=" + scratch + "/upper,workdir=" + scratch + "/work";
    return mkdirs(scratch + "/upper") && mkdirs(scratch + "/work") && mount("overlay", dir, "overlay", 0, opts.c_str()) == 0;
}

bool fresh_tmpfs(const char *dir) {
    umount2(dir, MNT_DETACH);
    return mount("tmpfs", dir, "tmpfs", 0, "mode=0755") == 0;
}

}  // namespace

bool enter_private_namespace() {
    if (g_namespace) return true;
    const uid_t uid = geteuid();
    const gid_t gid = getegid();
    if (uid == 0) {
        if (unshare(CLONE_NEWNS) != 0) return false;
    } else {  // a user namespace mapping the caller to root
        if (unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) return false;
        write_proc("/proc/self/setgroups", "deny");
        if (!write_proc("/proc/self/uid_map", "0 " + std::to_string(uid) + " 1") ||
            !write_proc("/proc/self/gid_map", "0 " + std::to_string(gid) + " 1"))
            return false;
    }
    // The host's /var and /opt are never written.
    g_namespace = mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
                  mount("tmpfs", "/tmp", "tmpfs", 0, "mode=1777") == 0 && overlay("/var", "/tmp/.oxtest-var") &&
                  overlay("/opt", "/tmp/.oxtest-opt") && mkdirs(kVarCfg) && mkdirs(kOptCfg) &&
                  fresh_tmpfs(kVarCfg) && fresh_tmpfs(kOptCfg);
    return g_namespace;
}

bool in_private_namespace() { return g_namespace; }

void fresh_config_dirs() {
    if (!g_namespace) return;
    fresh_tmpfs(kVarCfg);
    fresh_tmpfs(kOptCfg);
}

}  // namespace oxtest
