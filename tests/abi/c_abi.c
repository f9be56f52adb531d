/* The public header compiled as C: layouts and the prototypes of the seven
 * exported functions as a C program sees them. */
#include <stddef.h>

#include "oxidm.h"

_Static_assert(sizeof(idm_buffer) == 16, "idm_buffer");
_Static_assert(sizeof(idm_rule) == 48, "idm_rule");
_Static_assert(sizeof(idm_id) == 32, "idm_id");
_Static_assert(sizeof(idm_mapfile_entry) == 40, "entry");
_Static_assert(offsetof(idm_rule, mapping) == 40, "mapping");
_Static_assert(offsetof(idm_mapfile_entry, rule_index) == 32, "rule_index");

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
