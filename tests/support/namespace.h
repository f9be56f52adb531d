// Private mount namespace with fresh /var/ox/cfg and /opt/helvo/cfg.
#ifndef OXIDM_TEST_NAMESPACE_H
#define OXIDM_TEST_NAMESPACE_H

namespace oxtest {

inline constexpr const char kVarCfg[] = "/var/ox/cfg";
inline constexpr const char kOptCfg[] = "/opt/helvo/cfg";
inline constexpr const char kLocalMap[] = "/var/ox/cfg/oxsec_map.local";
inline constexpr const char kVarGlobalMap[] = "/var/ox/cfg/oxsec_map.global";
inline constexpr const char kOptGlobalMap[] = "/opt/helvo/cfg/oxsec_map.global";
inline constexpr const char kNodeInfo[] = "/var/ox/cfg/oxsec.nodeinfo";

// Moves the process into a private mount namespace (as root; otherwise a user
// namespace mapping the caller to root) with a private /tmp, where
// /var/ox/cfg and /opt/helvo/cfg are empty tmpfs mounts.  Must run before any
// thread is started.  Returns false when namespaces are not available.
bool enter_private_namespace();
bool in_private_namespace();
// Replaces both configuration directories by fresh, empty tmpfs mounts.
void fresh_config_dirs();

}  // namespace oxtest

#endif
