/* A C program built against the installed packages with pkg-config, linked
 * with the sample plug-in "host" compiled outside the tree from its source
 * and the installed headers.  Run where /var/ox/cfg holds the example
 * configuration; exits 0 when every answer is the expected one. */
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <oxidm.h>
#include <oxmpm_host.h>

static const struct {
    const char *mech, *identity;
    int32_t status;
    const char *local; /* "" for no local identity */
} rows[] = {
    {"host", "alice@node1.example.org", IDM_OK, "alice"}, /* host:*@node*.example.org=* */
    {"host", "x@build.example.org", IDM_OK, ""},          /* host:!*@build.example.org */
    {"nosuchmech", "alice@node1.example.org", IDM_E_NO_TRANSLATOR, ""},
};

int main(void) {
    int bad = oxmpm_host_register() != IDM_OK;
    for (size_t i = 0; i < sizeof rows / sizeof rows[0]; ++i) {
        idm_buffer local = {0, NULL};
        int32_t status = sec_idm_map_identity(rows[i].mech, rows[i].identity, &local);
        const char *got = local.value ? local.value : "";
        if (status != rows[i].status || strcmp(got, rows[i].local) != 0) {
            printf("map %s %s: status %d, \"%s\"\n", rows[i].mech, rows[i].identity, (int)status, got);
            bad = 1;
        }
        free(local.value);
    }
    if (sec_is_in_any_cluster("node1.example.org") != 1 || sec_is_in_any_cluster("no-such-host.invalid") != -1)
        bad = 1;
    puts(bad ? "C consumer: wrong answers" : "C consumer: ok");
    return bad;
}
