/* A short session against libox_idm: registers a translator and prints the
 * answers of the mapping, group and cluster functions for a few inputs.  It
 * reads the live configuration (/var/ox/cfg, /opt/helvo/cfg). */
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "ox_cu.h"
#include "oxidm.h"

/* Network identity "user": one token, registry type "demo", registry "local". */
static int32_t demo_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    static char rgy_type[] = "demo", rgy[] = "local";
    if (entry != NULL) {
        char **tokens = malloc(sizeof *tokens);
        idm_buffer *mapping = NULL;
        if (tokens == NULL) return 6;
        tokens[0] = entry->network_id;
        if (entry->kind == IDM_ENTRY_AFFIRMATIVE) {
            mapping = malloc(sizeof *mapping);
            if (mapping == NULL) {
                free(tokens);
                return 6;
            }
            mapping->value = entry->local_id;
            mapping->length = (uint32_t)strlen(entry->local_id) + 1;
        }
        rule->rgy_type = rgy_type;
        rule->rgy = rgy;
        rule->token_cnt = 1;
        rule->tokens = tokens;
        rule->mapping = mapping;
    }
    id->tokens = malloc(sizeof *id->tokens);
    if (id->tokens == NULL) return 6;
    id->tokens[0] = (char *)network_id;
    id->rgy_type = rgy_type;
    id->rgy = rgy;
    id->token_cnt = 1;
    return 0;
}

static int32_t demo_cleanup(idm_rule *rule, idm_id *id) {
    if (rule != NULL) {
        free(rule->tokens);
        free(rule->mapping);
    }
    if (id != NULL) free(id->tokens);
    return 0;
}

static void show_error(int32_t status) {
    if (status != 0 && cux_error_pending()) printf("    reported: %s", cux_error_text());
}

int main(int argc, char **argv) {
    const char *user = argc > 1 ? argv[1] : "root";
    int32_t status = sec_idm_register_translator(IDM_MAPPING_NATIVE, "demo", demo_translate, demo_cleanup);
    printf("register \"demo\": status %d\n", status);
    const char *identities[] = {"alice", "bob", "mallory"};
    for (size_t i = 0; i < sizeof identities / sizeof identities[0]; ++i) {
        idm_buffer local;
        status = sec_idm_map_identity("demo", identities[i], &local);
        printf("map demo:%s -> status %d, %s\n", identities[i], status,
               local.value != NULL ? local.value : "(no local identity granted)");
        show_error(status);
        free(local.value);
    }
    idm_buffer local;
    status = sec_idm_map_identity("unregistered", "alice", &local);
    printf("map unregistered:alice -> status %d\n", status);
    show_error(status);

    idm_buffer ubuf = {(uint32_t)strlen(user) + 1, (char *)user};
    uint32_t count = 0;
    idm_buffer *groups = NULL;
    status = sec_idm_get_groups(&ubuf, &count, &groups);
    printf("groups of %s: status %d, %u group(s):", user, status, count);
    for (uint32_t i = 0; i < count; ++i) {
        printf(" %s", groups[i].value != NULL ? groups[i].value : "?");
        free(groups[i].value);
    }
    printf("\n");
    show_error(status);
    free(groups);

    const char *hosts[] = {"localhost", "127.0.0.1"};
    for (size_t i = 0; i < 2; ++i)
        printf("host %s: in any cluster %d, in active cluster %d\n", hosts[i], sec_is_in_any_cluster(hosts[i]),
               sec_is_in_active_cluster(hosts[i]));
    return 0;
}
