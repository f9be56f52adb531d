// --root DIR: answer from DIR/var/ox/cfg and DIR/opt/helvo/cfg as if they
// were the live configuration directories.  The library keeps its fixed
// paths; the command moves itself into a private mount namespace (inside a
// user namespace when it is not root) and bind-mounts the two directories
// over the fixed ones there.  The host's file systems are never written:
// where a fixed directory does not exist, its nearest existing ancestor gets
// an overlay whose upper layer lives on a detached tmpfs.
#ifndef OXIDM_TOOL_ROOTNS_H
#define OXIDM_TOOL_ROOTNS_H

#include <string>

namespace oxidm_tool {

// Enters the namespace and mounts DIR's directories.  A directory missing
// under DIR is replaced by an empty one (no files: nothing configured).
// Must run before any thread is started.  Returns "" on success, else a
// sentence that says what failed.
std::string enter_root(const std::string &dir);

}  // namespace oxidm_tool

#endif
