// Private mount namespaces over the fixed configuration directories.  For
// the command's --root DIR: answer from DIR/var/ox/cfg and DIR/opt/helvo/cfg
// as if they were the live configuration directories; for the test programs
// and benchmarks: empty directories of their own.  The library keeps its fixed
// paths; the command moves itself into a private mount namespace (inside a
// user namespace when it is not root) and bind-mounts the two directories
// over the fixed ones there.  The host's file systems are never written:
// where a fixed directory does not exist, its nearest existing ancestor gets
// an overlay whose upper layer lives on a detached tmpfs.
#ifndef OXIDM_TOOL_ROOTNS_H
#define OXIDM_TOOL_ROOTNS_H

#include <string>

namespace oxidm_tool {

// Each returns "" on success, else a sentence that says what failed.  The
// first two must run before any thread is started.

// Moves the process into a private mount namespace, inside a user namespace
// when it is not root (the caller mapped to root there when `as_root`, else
// to its own ids).
std::string enter_namespace(bool as_root);

// Enters the namespace and mounts DIR's directories.  A directory missing
// under DIR is replaced by an empty one (no files: nothing configured).
std::string enter_root(const std::string &dir);

// Inside the namespace: fresh, empty tmpfs mounts on both fixed paths, again
// at every call (the test programs and benchmarks).
std::string fresh_config();

}  // namespace oxidm_tool

#endif
