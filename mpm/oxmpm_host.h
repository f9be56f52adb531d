/*
 * oxmpm_host.h - sample mechanism plug-in (MPM) "host": host-based
 * identities of the form  user@host.
 *
 * A consumer that loads this plug-in calls oxmpm_host_register() once; it
 * registers the translator and cleanup routine below with libox_idm under the
 * mnemonic "host".  Nothing runs when the object is loaded.
 *
 * Translation (identity and map file entry alike):
 *     user@host   ->  rgy_type "host", rgy the host, one token: the user
 * Exactly one '@' with a non-empty user and host.  Host names are compared
 * without regard to ASCII case: both sides are folded to lower case.  The
 * user is kept as written (user names are case-sensitive).
 *
 * Map file lines (see mpm/README.md for the whole file format):
 *     host:alice@node1=alice        alice on node1 is local user alice
 *     host:*@node1=*                every user of node1 maps to the same name
 *     host:*@*.example.org=guest    any user of a host in example.org: guest
 *     host:root@*=admin             root of any host: admin
 *     host:*=nobody                 "*" alone stands for "*@*"
 *     host:!mallory@*               mallory is never mapped (denial)
 * The user and the host may each hold one '*', standing for any run of
 * characters (also none); a second '*' in either makes the line unusable.
 * A mapping of "*" takes the user part of the identity as the local name.
 *
 * Translator statuses: 0 both structures filled; 38 the network identity is
 * not of the form user@host (the entry's rule, when given, is filled and
 * valid); 39 the entry's network identifier is not of that form (the line
 * is refused until the map files change); 12 out of memory (nothing kept:
 * the entry is tried again next time).
 */
#ifndef OXMPM_HOST_H
#define OXMPM_HOST_H

#include <stdint.h>

#include "oxidm.h"

#ifdef __cplusplus
extern "C" {
#endif

#define OXMPM_HOST_MNEMONIC "host"

/* Registers the routines below under "host"; the status of
 * sec_idm_register_translator (0, 4, 6 or 23). */
int32_t oxmpm_host_register(void);

int32_t oxmpm_host_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id);
int32_t oxmpm_host_cleanup(idm_rule *rule, idm_id *id);

#ifdef __cplusplus
}
#endif

#endif
