// The test programs' and benchmarks' namespace: the command's (rootns.h),
// with a private /tmp and empty configuration directories.  No GoogleTest
// dependency, so benchmarks use it too.
#include "namespace.h"

#include <sys/mount.h>

#include "rootns.h"

namespace oxtest {

namespace {
bool g_namespace = false;
}

bool enter_private_namespace() {
    if (!g_namespace)
        g_namespace = oxidm_tool::enter_namespace(true).empty() && mount("tmpfs", "/tmp", "tmpfs", 0, "mode=1777") == 0 &&
                      oxidm_tool::fresh_config().empty();
    return g_namespace;
}

bool in_private_namespace() { return g_namespace; }

void fresh_config_dirs() {
    if (g_namespace) oxidm_tool::fresh_config();
}

}  // namespace oxtest
