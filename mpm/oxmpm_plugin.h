/*
 * oxmpm_plugin.h - how a mechanism plug-in (MPM) makes itself known to a
 * program that loads it by path, such as `oxidm --plugin PATH`.
 *
 * A plug-in shared object exports one function, OXMPM_PLUGIN_SYMBOL
 * ("oxmpm_plugin_entry"), with C linkage and default visibility, that
 * returns its description:
 *
 *     static const struct oxmpm_plugin entry = {
 *         OXMPM_PLUGIN_VERSION, "mymech", "user:domain", mymech_translate, mymech_cleanup};
 *     OXMPM_PLUGIN_EXPORT const struct oxmpm_plugin *oxmpm_plugin_entry(void) { return &entry; }
 *
 * (A function, not a data symbol: a program may link several plug-ins, and
 * their entries must not be one object defined twice.)  The loader opens the
 * object with dlopen(RTLD_NOW | RTLD_LOCAL), calls the entry, checks the
 * version and that every field but `summary` is set,
 * and registers `translate` and `cleanup` under `mnemonic` itself (with
 * sec_idm_register_translator).  Nothing must run at load time: no
 * constructor, no registration of its own.  One object describes one
 * mechanism; the routines follow the conventions of include/oxidm.h.
 */
#ifndef OXMPM_PLUGIN_H
#define OXMPM_PLUGIN_H

#include <stdint.h>

#include "oxidm.h"

#ifdef __cplusplus
extern "C" {
#endif

#define OXMPM_PLUGIN_SYMBOL "oxmpm_plugin_entry"
#define OXMPM_PLUGIN_VERSION 1u
#define OXMPM_PLUGIN_EXPORT __attribute__((visibility("default")))

struct oxmpm_plugin {
    uint32_t version;                  /* OXMPM_PLUGIN_VERSION */
    const char *mnemonic;              /* the selector of its map file lines */
    const char *summary;               /* one line: what its identities look like (may be NULL) */
    idm_translator_routine translate;  /* fills a rule and an id */
    idm_cleanup_routine cleanup;       /* releases what translate filled */
};

/* The entry every plug-in defines. */
typedef const struct oxmpm_plugin *(*oxmpm_plugin_entry_routine)(void);

#ifdef __cplusplus
}
#endif

#endif
