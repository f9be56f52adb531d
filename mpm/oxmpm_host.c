/*
 * oxmpm_host.c - sample MPM "host": translator and cleanup routine for
 * identities user@host.  Syntax and statuses: oxmpm_host.h.
 *
 * Memory: each structure the translator fills owns exactly one heap block,
 * hung on its `tokens` field; the token array, every text and (for a rule)
 * the mapping buffer live inside it, with the block's size stored in front.
 * The cleanup routine therefore needs nothing but that pointer: it zeroes
 * the block (it held identities) and frees it.  `rgy_type` points to
 * the constant mnemonic and is never freed.
 *
 * The routines keep no state and take no lock, so any number of threads may
 * use them; libox_idm serialises the calls for one mechanism anyway.
 */
#define _DEFAULT_SOURCE /* explicit_bzero */
#include "oxmpm_host.h"
#include "oxmpm_plugin.h"

#include <stddef.h>
#include <stdlib.h>
#include <string.h>

#define EXPORT __attribute__((visibility("default")))

enum {
    ST_OK = IDM_OK,
    ST_BAD_ID = IDM_TRANSLATOR_REJECT,
    ST_REFUSED = IDM_TRANSLATOR_REFUSED,
    ST_NO_MEMORY = 12 /* ENOMEM: any other status passes the entry over */
};

static char mnemonic[] = OXMPM_HOST_MNEMONIC;

/* One identity or entry identifier split at its '@'. */
struct parts {
    const char *user;
    size_t user_len;
    const char *host;
    size_t host_len;
};

/* 0 when `text` is user@host with exactly one '@' and both parts non-empty;
 * "*" alone is taken as "*@*". */
static int split(const char *text, struct parts *p) {
    if (strcmp(text, "*") == 0) {
        p->user = p->host = "*";
        p->user_len = p->host_len = 1;
        return 0;
    }
    const char *at = strchr(text, '@');
    if (at == NULL || at == text || at[1] == '\0' || strchr(at + 1, '@') != NULL) return -1;
    p->user = text;
    p->user_len = (size_t)(at - text);
    p->host = at + 1;
    p->host_len = strlen(at + 1);
    return 0;
}

static char *put(char *dst, const char *src, size_t n, int fold) {
    for (size_t i = 0; i < n; ++i) {
        char c = src[i];
        dst[i] = (fold && c >= 'A' && c <= 'Z') ? (char)(c - 'A' + 'a') : c;
    }
    dst[n] = '\0';
    return dst + n + 1;
}

/* Heap block behind `tokens`: its size, the token array, the mapping
 * buffer (rules only), then host, user and local name. */
struct block {
    size_t size;
    char *tokens[1];
    idm_buffer mapping;
    char text[];
};

static struct block *new_block(size_t text_size) {
    struct block *b = malloc(sizeof(struct block) + text_size);
    if (b != NULL) b->size = sizeof(struct block) + text_size;
    return b;
}

static void free_block(char **tokens) {
    if (tokens == NULL) return;
    struct block *b = (struct block *)(void *)((char *)tokens - offsetof(struct block, tokens));
    explicit_bzero(b, b->size);
    free(b);
}

static int32_t fill_rule(const idm_mapfile_entry *entry, idm_rule *rule) {
    struct parts p;
    if (split(entry->network_id, &p) != 0) return ST_REFUSED;
    int affirmative = entry->kind == IDM_ENTRY_AFFIRMATIVE && entry->local_id != NULL;
    size_t local_len = affirmative ? strlen(entry->local_id) : 0;
    struct block *b = new_block(p.host_len + 1 + p.user_len + 1 + (affirmative ? local_len + 1 : 0));
    if (b == NULL) return ST_NO_MEMORY;
    char *t = b->text;
    rule->rgy = t;
    t = put(t, p.host, p.host_len, 1);
    b->tokens[0] = t;
    t = put(t, p.user, p.user_len, 0);
    rule->rgy_type = mnemonic;
    rule->token_cnt = 1;
    rule->tokens = b->tokens;
    rule->mapping = NULL;
    if (affirmative) {
        b->mapping.value = t;
        b->mapping.length = (uint32_t)(local_len + 1);
        put(t, entry->local_id, local_len, 0);
        rule->mapping = &b->mapping;
    }
    return ST_OK;
}

static int32_t fill_id(const char *network_id, idm_id *id) {
    struct parts p;
    if (network_id == NULL || split(network_id, &p) != 0) return ST_BAD_ID;
    struct block *b = new_block(p.host_len + 1 + p.user_len + 1);
    if (b == NULL) return ST_NO_MEMORY;
    char *t = b->text;
    id->rgy = t;
    t = put(t, p.host, p.host_len, 1);
    b->tokens[0] = t;
    put(t, p.user, p.user_len, 0);
    id->rgy_type = mnemonic;
    id->token_cnt = 1;
    id->tokens = b->tokens;
    return ST_OK;
}

/* Frees the block and clears the fields. */
static void release_rule(idm_rule *rule) {
    free_block(rule->tokens);
    rule->rgy_type = rule->rgy = NULL;
    rule->token_cnt = 0;
    rule->tokens = NULL;
    rule->mapping = NULL;
}

static void release_id(idm_id *id) {
    free_block(id->tokens);
    id->rgy_type = id->rgy = NULL;
    id->token_cnt = 0;
    id->tokens = NULL;
}

EXPORT int32_t oxmpm_host_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule,
                                    idm_id *id) {
    if (rule == NULL || id == NULL) return ST_BAD_ID;
    if (entry != NULL) {
        if (entry->network_id == NULL) return ST_REFUSED;
        int32_t s = fill_rule(entry, rule);
        if (s != ST_OK) return s;
    }
    int32_t s = fill_id(network_id, id);
    if (s == ST_NO_MEMORY && entry != NULL) release_rule(rule); /* no cleanup call follows */
    return s;
}

EXPORT int32_t oxmpm_host_cleanup(idm_rule *rule, idm_id *id) {
    if (rule != NULL) release_rule(rule);
    if (id != NULL) release_id(id);
    return 0;
}

EXPORT int32_t oxmpm_host_register(void) {
    return sec_idm_register_translator(IDM_MAPPING_NATIVE, mnemonic, oxmpm_host_translate, oxmpm_host_cleanup);
}

#ifdef OXMPM_SHARED_OBJECT
/* The entry a program that loads this object by path calls (oxmpm_plugin.h).
 * Only the shared object has it: the archives of both samples link together. */
static const struct oxmpm_plugin entry = {OXMPM_PLUGIN_VERSION, mnemonic,
                                          "user@host (host names without regard to case)", oxmpm_host_translate,
                                          oxmpm_host_cleanup};
OXMPM_PLUGIN_EXPORT const struct oxmpm_plugin *oxmpm_plugin_entry(void) { return &entry; }
#endif
