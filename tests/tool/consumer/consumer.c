/* A program built against the installed libox_idm, once with pkg-config and
 * once with find_package(oxidm): asks the library three questions and prints
 * the answers and the error text of libox_cu. */
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <ox_cu.h>
#include <oxidm.h>

int main(void) {
    idm_buffer local = {0, NULL};
    int32_t status = sec_idm_map_identity("nosuchmech", "alice@node1", &local);
    printf("map: status %d: %s", (int)status, cux_error_pending() ? cux_error_text() : "(no message)\n");
    printf("cluster: %d\n", (int)sec_is_in_any_cluster("no-such-host.invalid"));
    char name[] = "root";
    idm_buffer user = {(uint32_t)sizeof name, name};
    uint32_t count = 0;
    idm_buffer *groups = NULL;
    status = sec_idm_get_groups(&user, &count, &groups);
    printf("groups of root: status %d, %u, first %s\n", (int)status, count,
           count > 0 && groups[0].value ? groups[0].value : "-");
    for (uint32_t i = 0; i < count; ++i) free(groups[i].value);
    free(groups);
    return 0;
}
