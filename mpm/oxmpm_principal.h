// oxmpm_principal.h - sample mechanism plug-in (MPM) "princ": principal
// names of the form  name[/instance]@REALM.
//
// A consumer that loads this plug-in calls oxmpm_principal_register() once;
// it registers the translator and cleanup routine below with libox_idm under
// the mnemonic "princ".  Nothing runs when the object is loaded.
//
// Translation (identity and map file entry alike):
//     name@REALM            ->  rgy_type "princ", rgy REALM, tokens (name)
//     name/instance@REALM   ->  rgy_type "princ", rgy REALM, tokens (name, instance)
// Exactly one '@' followed by a non-empty realm; at most one '/' before it,
// with non-empty parts on both sides.  Everything is case-sensitive, realms
// included.  A one-token rule never matches a two-token identity, nor the
// reverse: "joe@R" and "joe/admin@R" are different principals.
//
// Map file lines (see mpm/README.md for the whole file format):
//     princ:joe@EXAMPLE.ORG=joe          one principal
//     princ:*@EXAMPLE.ORG=*              every plain principal of the realm,
//                                        under its own name
//     princ:*/admin@EXAMPLE.ORG=root     every admin instance of the realm
//     princ:joe/*@EXAMPLE.ORG=*          joe's instances, named by instance
//     princ:*@*.EXAMPLE.ORG=guest        plain principals of the sub-realms
//     princ:!*/root@*                    no root instance is ever mapped
// The name, the instance and the realm may each hold one '*', standing for
// any run of characters (also none); a second '*' in one of them makes the
// line unusable.  A mapping of "*" takes the identity's token at the place of
// the rule's "*" token (or of its one partially wildcarded token, or its only
// token); when that is not one token, the line is unusable.
//
// Translator statuses: 0 both structures filled; 38 the network identity is
// not a principal name of the form above (the entry's rule, when given, is
// filled); 39 the entry's network identifier is not of that form (the line
// is refused until the map files change); 12 out of memory (nothing kept:
// the entry is tried again next time).
#ifndef OXMPM_PRINCIPAL_H
#define OXMPM_PRINCIPAL_H

#include <stdint.h>

#include "oxidm.h"

#ifdef __cplusplus
extern "C" {
#endif

#define OXMPM_PRINCIPAL_MNEMONIC "princ"

/* Registers the routines below under "princ"; the status of
 * sec_idm_register_translator (0, 4, 6 or 23). */
int32_t oxmpm_principal_register(void);

int32_t oxmpm_principal_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule,
                                  idm_id *id);
int32_t oxmpm_principal_cleanup(idm_rule *rule, idm_id *id);

#ifdef __cplusplus
}
#endif

#endif
