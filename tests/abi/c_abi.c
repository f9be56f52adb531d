/* The public header compiled as C (its layout assertions included) and the
 * prototypes of the seven exported functions as a C program sees them. */
#include "oxidm.h"

int c_abi_check(void) {
    int32_t (*reg)(int32_t, const char *, idm_translator_routine, idm_cleanup_routine) = sec_idm_register_translator;
    int32_t (*map)(const char *, const char *, idm_buffer *) = sec_idm_map_identity;
    int32_t (*grp)(idm_buffer *, uint32_t *, idm_buffer **) = sec_idm_get_groups;
    int32_t (*get)(const char *, idm_translator_routine *, idm_cleanup_routine *) = _sec_idm_get_translator;
    void (*init)(void) = sec__idm_clmap_init;
    int32_t (*any)(const char *) = sec_is_in_any_cluster;
    int32_t (*act)(const char *) = sec_is_in_active_cluster;
    return reg && map && grp && get && init && any && act;
}
