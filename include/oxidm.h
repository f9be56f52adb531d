/*
 * oxidm.h - public interface of libox_idm, the identity-mapping and
 * cluster-membership library of the cluster security service.
 *
 * Three questions are answered here:
 *   - which local user a mechanism's network identity stands for
 *     (sec_idm_register_translator, sec_idm_map_identity);
 *   - which groups a local user belongs to (sec_idm_get_groups);
 *   - whether a host is listed in a cluster known on this node, or in the
 *     active cluster (sec_is_in_any_cluster, sec_is_in_active_cluster).
 *
 * Every function may be called from any thread at any time, also before any
 * other call: the library initialises itself lazily on first use and is never
 * torn down.  Failures are reported through the error facility of libox_cu as
 * numbered messages of catalogue "oxseclib.cat", set 1; the library prints
 * nothing.
 *
 * The records below are shared with mechanism plug-ins (MPMs) that live in
 * other shared objects: their layouts are fixed (x86-64, LP64) and checked by
 * static assertions at the end of this file.
 */
#ifndef OXIDM_H
#define OXIDM_H

#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Length-and-value buffer.  `length` counts the bytes of `value` including
 * its terminating NUL; 0 means empty.  A buffer handed back by the library
 * owns a heap copy of its text: release `value` with free(). */
typedef struct idm_buffer {
    uint32_t length; /* byte 0 */
    char *value;     /* byte 8 */
} idm_buffer;

/* Kinds of map file entry. */
#define IDM_ENTRY_AFFIRMATIVE 0u
#define IDM_ENTRY_DENIAL 1u

/* One accepted line of an identity mapping file, as handed to a translator.
 * The library owns the entry and its texts; a translator only reads them. */
typedef struct idm_mapfile_entry {
    int64_t read_time; /* byte 0: clock seconds when the line was parsed */
    uint32_t kind;     /* byte 8: IDM_ENTRY_AFFIRMATIVE or IDM_ENTRY_DENIAL */
    char *network_id;  /* byte 16: the network identifier, never empty */
    char *local_id;    /* byte 24: the local identifier; NULL for a denial */
    int32_t rule_index; /* byte 32: library-private, 1-based rule cache slot */
} idm_mapfile_entry;

/* Check status in the low half of idm_rule.rule_state; the high half of a
 * valid rule holds the 1-based position of the token that supplies the local
 * name (0: the mapping's own text is the local name). */
#define IDM_RULE_UNCHECKED 0u
#define IDM_RULE_VALID 1u
#define IDM_RULE_AMBIGUOUS 2u
#define IDM_RULE_BAD_TOKENS 4u
#define IDM_RULE_BAD_RGY 8u
#define IDM_RULE_BAD_MAPPING 16u
#define IDM_RULE_MULTI_WILDCARD 32u

/* Wildcard character of registries, tokens and mappings. */
#define IDM_WILDCARD '*'

/* A rule translated from one map file entry.  Everything the translator puts
 * in here (texts, token array, mapping buffer) belongs to the translator and
 * is released by its cleanup routine; the library writes only rule_state. */
typedef struct idm_rule {
    uint32_t rule_state; /* byte 0: owned by the library; 0 for a fresh rule */
    char *rgy_type;      /* byte 8: must equal the id's rgy_type exactly */
    char *rgy;           /* byte 16: may hold one '*' */
    int32_t token_cnt;   /* byte 24 */
    char **tokens;       /* byte 32: token_cnt texts, each may hold one '*' */
    idm_buffer *mapping; /* byte 40: local identity granted; NULL for none */
} idm_rule;

/* A translated network identity; all tokens are literal. */
typedef struct idm_id {
    char *rgy_type;    /* byte 0 */
    char *rgy;         /* byte 8 */
    int32_t token_cnt; /* byte 16 */
    char **tokens;     /* byte 24 */
} idm_id;

/* Statuses of the exported functions, and those a translator routine
 * returns that the mapping walk acts on.  Each status that comes with a
 * message names its numbers (catalogue oxseclib.cat, set 1). */
enum idm_status {
    IDM_OK = 0,
    IDM_E_BAD_PARAMETER = 4,   /* 2650-650 */
    IDM_E_NO_MEMORY = 6,       /* 2650-654 */
    IDM_E_GROUPS = 15,         /* 2650-698 unknown user, 2650-699, 2650-700 */
    IDM_E_NODE_FILE = 21,      /* 2650-690, 2650-692 to 2650-694 */
    IDM_E_NO_TRANSLATOR = 22,  /* 2650-660 */
    IDM_E_INTERNAL = 23,       /* 2650-651, 2650-655, 2650-657, 2650-658, 2650-661, 2650-691 */
    IDM_E_MAPFILE_LOCKED = 30, /* 2650-656 */
    IDM_E_MAPFILE_ACCESS = 36, /* 2650-653, 2650-654 */
    IDM_E_RULE = 38,           /* 2650-662 to 2650-667 */

    /* Translator results with a meaning to the walk (besides IDM_OK): */
    IDM_TRANSLATOR_STOP = 31,    /* ends the walk at once, with this status */
    IDM_TRANSLATOR_REJECT = 38,  /* no match; the rule is checked and kept as it stands */
    IDM_TRANSLATOR_REFUSED = 39  /* the entry is passed over until the map files change */
};

/* Translator routine of an MPM.
 *   entry != NULL: `rule` arrives zeroed; fill it from the entry (for an
 *                  affirmative entry `mapping` holds the local identity it
 *                  grants) and fill `id` from `network_id`.
 *   entry == NULL: `rule` is a rule cached from an earlier call; fill only
 *                  `id`.
 * Returns IDM_OK when both structures were filled; IDM_TRANSLATOR_STOP
 * stops the mapping walk at once; IDM_TRANSLATOR_REJECT and
 * IDM_TRANSLATOR_REFUSED mark the entry's rule unusable until the map files
 * change; any other status passes the entry over.  The routine may be cancelled at any
 * cancellation point: the library holds no lock that cancellation would
 * leak. */
typedef int32_t (*idm_translator_routine)(const idm_mapfile_entry *entry, const char *network_id,
                                          idm_rule *rule, idm_id *id);

/* Cleanup routine of an MPM: releases what its translator allocated inside
 * `rule` and/or `id`; a NULL pointer means that structure is left alone.
 * The result is not used. */
typedef int32_t (*idm_cleanup_routine)(idm_rule *rule, idm_id *id);

/* The only mapping type: the native mapping service. */
#define IDM_MAPPING_NATIVE 1

/* Registers (or replaces) the translator and cleanup routines of mechanism
 * `mnemonic` (compared as exact bytes).  There is no way to unregister.
 * Returns 0; 4 bad argument (2650-650); 6 memory (2650-654); 23 a mutex
 * could not be made (2650-661, 2650-655). */
int32_t sec_idm_register_translator(int32_t mapping_type, const char *mnemonic,
                                    idm_translator_routine translator, idm_cleanup_routine cleanup);

/* Maps a network identity of mechanism `mnemonic` to a local user name.
 * `local` is cleared first (after the argument checks).
 *   0 with local->value set:    the local user; free(local->value).
 *   0 with local->length == 0:  no local identity is granted (no entry
 *                               matched, or the first match was a denial).
 *   4  bad argument (2650-650; `local` untouched);
 *   22 no translator registered under `mnemonic` (2650-660);
 *   other: a map file error (6, 23, 30, 36, ...) or the translator's own
 *   status, as reported by the failing routine. */
int32_t sec_idm_map_identity(const char *mnemonic, const char *network_id, idm_buffer *local);

/* Lists the groups of local user `user->value`: primary group first, then
 * every group whose member list names the user, in enumeration order.
 * On 0, *count elements are returned in *groups (NULL when none): free each
 * element's value, then the array.  On failure *count is 0 and *groups NULL.
 *   4 bad argument (2650-650); 6 memory (2650-654);
 *   15 unknown user (2650-698), primary group unreadable (2650-699),
 *      group enumeration failed (2650-700).
 * Group scans are serialised inside the library, but the system's group
 * enumeration position (setgrent/getgrent/endgrent) is process-wide: other
 * code in the same process that enumerates groups while a lookup runs can
 * still disturb the lookup's scan. */
int32_t sec_idm_get_groups(idm_buffer *user, uint32_t *count, idm_buffer **groups);

/* Copies the routines registered under `mnemonic` to *translator and
 * *cleanup; leaves both untouched when none is registered.  Returns 0, or 4
 * when an output pointer is NULL (nothing reported).  `mnemonic` must not be
 * NULL.  To test registration, set both outputs to NULL first. */
int32_t _sec_idm_get_translator(const char *mnemonic, idm_translator_routine *translator,
                                idm_cleanup_routine *cleanup);

/* Sets up the cluster map; run once by the library's own initialisation. */
void sec__idm_clmap_init(void);

/* 1: host (name or numeric address text) is listed in the node information
 * file with at least one cluster; -1: not listed, or the file could not be
 * loaded (the error stays current in libox_cu). */
int32_t sec_is_in_any_cluster(const char *host);

/* 1: host is listed and one of its clusters is the active cluster; 0: listed,
 * but not in the active cluster; -1: not listed, no active cluster known, or
 * the file could not be loaded. */
int32_t sec_is_in_active_cluster(const char *host);

#ifdef __cplusplus
}
#endif

/* Fixed layouts shared with plug-ins. */
#ifdef __cplusplus
#define OXIDM_STATIC_ASSERT static_assert
#else
#define OXIDM_STATIC_ASSERT _Static_assert
#endif
OXIDM_STATIC_ASSERT(sizeof(idm_buffer) == 16, "idm_buffer is 16 bytes");
OXIDM_STATIC_ASSERT(offsetof(idm_buffer, length) == 0, "idm_buffer.length at 0");
OXIDM_STATIC_ASSERT(offsetof(idm_buffer, value) == 8, "idm_buffer.value at 8");
OXIDM_STATIC_ASSERT(sizeof(idm_mapfile_entry) == 40, "map file entry is 40 bytes");
OXIDM_STATIC_ASSERT(offsetof(idm_mapfile_entry, read_time) == 0, "read_time at 0");
OXIDM_STATIC_ASSERT(offsetof(idm_mapfile_entry, kind) == 8, "kind at 8");
OXIDM_STATIC_ASSERT(offsetof(idm_mapfile_entry, network_id) == 16, "network_id at 16");
OXIDM_STATIC_ASSERT(offsetof(idm_mapfile_entry, local_id) == 24, "local_id at 24");
OXIDM_STATIC_ASSERT(offsetof(idm_mapfile_entry, rule_index) == 32, "rule_index at 32");
OXIDM_STATIC_ASSERT(sizeof(idm_rule) == 48, "idm_rule is 48 bytes");
OXIDM_STATIC_ASSERT(offsetof(idm_rule, rule_state) == 0, "rule_state at 0");
OXIDM_STATIC_ASSERT(offsetof(idm_rule, rgy_type) == 8, "rgy_type at 8");
OXIDM_STATIC_ASSERT(offsetof(idm_rule, rgy) == 16, "rgy at 16");
OXIDM_STATIC_ASSERT(offsetof(idm_rule, token_cnt) == 24, "token_cnt at 24");
OXIDM_STATIC_ASSERT(offsetof(idm_rule, tokens) == 32, "tokens at 32");
OXIDM_STATIC_ASSERT(offsetof(idm_rule, mapping) == 40, "mapping at 40");
OXIDM_STATIC_ASSERT(sizeof(idm_id) == 32, "idm_id is 32 bytes");
OXIDM_STATIC_ASSERT(offsetof(idm_id, rgy_type) == 0, "id rgy_type at 0");
OXIDM_STATIC_ASSERT(offsetof(idm_id, rgy) == 8, "id rgy at 8");
OXIDM_STATIC_ASSERT(offsetof(idm_id, token_cnt) == 16, "id token_cnt at 16");
OXIDM_STATIC_ASSERT(offsetof(idm_id, tokens) == 24, "id tokens at 24");
#undef OXIDM_STATIC_ASSERT

#endif /* OXIDM_H */
