/*
 * oxmpm_plugin.h - how a mechanism plug-in (MPM) makes itself known to a
 * program that loads it by path, such as `oxidm --plugin PATH`.
 *
 * A plug-in shared object exports one data symbol, OXMPM_PLUGIN_SYMBOL
 * ("oxmpm_plugin"), of type `const struct oxmpm_plugin`, with C linkage and
 * default visibility:
 *
 *     OXMPM_PLUGIN_EXPORT const struct oxmpm_plugin oxmpm_plugin = {
 *         OXMPM_PLUGIN_VERSION, "mymech", "user:domain",
 *         mymech_translate, mymech_cleanup};
 *
 * The loader opens the object with dlopen(RTLD_NOW | RTLD_LOCAL), looks the
 * symbol up, checks the version and that every field but `summary` is set,
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

#define OXMPM_PLUGIN_SYMBOL "oxmpm_plugin"
#define OXMPM_PLUGIN_VERSION 1u
#define OXMPM_PLUGIN_EXPORT __attribute__((visibility("default")))

struct oxmpm_plugin {
    uint32_t version;                  /* OXMPM_PLUGIN_VERSION */
    const char *mnemonic;              /* the selector of its map file lines */
    const char *summary;               /* one line: what its identities look like (may be NULL) */
    idm_translator_routine translate;  /* fills a rule and an id */
    idm_cleanup_routine cleanup;       /* releases what translate filled */
};

#ifdef __cplusplus
}
#endif

#endif
