// Cluster membership: the node information file, its two search trees and
// the exported queries.  (Placeholder until the cluster module lands.)
#include "oxidm_internal.h"

extern "C" {

__attribute__((visibility("default"))) void sec__idm_clmap_init(void) {}

__attribute__((visibility("default"))) int32_t sec_is_in_any_cluster(const char *host) {
    (void)host;
    pthread_once(&idm__init_once_block, idm__state_init);
    return -1;
}

__attribute__((visibility("default"))) int32_t sec_is_in_active_cluster(const char *host) {
    (void)host;
    pthread_once(&idm__init_once_block, idm__state_init);
    return -1;
}

}  // extern "C"
