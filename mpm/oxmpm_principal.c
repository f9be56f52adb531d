/*
 * oxmpm_principal.c - sample MPM "princ": translator and cleanup routine for
 * principal names name[/instance]@REALM.  Syntax and statuses:
 * oxmpm_principal.h.
 *
 * Memory: each structure the translator fills owns exactly one block, hung
 * on its `tokens` field; the token array, every text and (for a rule) the
 * mapping buffer live inside it, with the block's size and origin stored in
 * front.  A rule's block is on the heap (libox_idm caches rules).  An id is
 * translated once per entry walked and released right after, so it goes
 * into the calling thread's small block when that is free and the id fits,
 * and onto the heap otherwise.  The cleanup routine zeroes the block's
 * texts (they held identities) and frees it or hands the small block back.
 * `rgy_type` points to the constant mnemonic and is never freed.
 *
 * The routines take no lock; the only state is each thread's small block.
 */
#define _DEFAULT_SOURCE /* explicit_bzero */
#include "oxmpm_principal.h"
#include "oxmpm_plugin.h"

#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <emmintrin.h>

#define EXPORT __attribute__((visibility("default")))

enum {
    ST_OK = IDM_OK,
    ST_BAD_ID = IDM_TRANSLATOR_REJECT,
    ST_REFUSED = IDM_TRANSLATOR_REFUSED,
    ST_NO_MEMORY = 12 /* ENOMEM: any other status passes the entry over */
};

static char mnemonic[] = OXMPM_PRINCIPAL_MNEMONIC;

/* A principal name split into its parts; instance_len 0 when absent. */
struct principal {
    const char *name, *instance, *realm;
    size_t name_len, instance_len, realm_len;
};

static int split(const char *text, struct principal *p) {
    const char *at = strchr(text, '@');
    if (at == NULL || at[1] == '\0' || strchr(at + 1, '@') != NULL) return -1;
    const char *slash = memchr(text, '/', (size_t)(at - text));
    p->name = text;
    p->realm = at + 1;
    p->realm_len = strlen(at + 1);
    if (slash == NULL) {
        p->name_len = (size_t)(at - text);
        p->instance = NULL;
        p->instance_len = 0;
    } else {
        p->name_len = (size_t)(slash - text);
        p->instance = slash + 1;
        p->instance_len = (size_t)(at - slash - 1);
        if (p->instance_len == 0 || memchr(p->instance, '/', p->instance_len) != NULL) return -1;
    }
    return p->name_len == 0 ? -1 : 0;
}

/* Block behind `tokens`: its size, the `in_use` flag of the thread's small
 * block when it is that block (NULL for a heap block), the token array, the
 * mapping buffer (rules only), then the texts. */
struct block {
    size_t size;
    unsigned char *small_in_use;
    char *tokens[2];
    idm_buffer mapping;
    char text[];
};

/* Text bytes of the thread's small block: room for the ids of ordinary
 * names.  `in_use` is set while an id lives in it. */
#define SMALL_TEXT 192

struct small_block {
    unsigned char in_use;
    _Alignas(struct block) char bytes[sizeof(struct block) + SMALL_TEXT];
};
static _Thread_local struct small_block small;

/* An id is copied sixteen bytes at a time (SSE2, which every x86-64
 * processor has) in one pass that also finds its separators.  Each part goes
 * to the small block in whole 16-byte stores, starting at a 16-byte boundary
 * of the text and padded with NULs to the next one, so that the loads with
 * which libox_idm compares the parts just afterwards find each of them
 * within one earlier store. */

/* The sixteen bytes of text at `s`: read at once where that cannot cross
 * into the next page (the bytes past a NUL it may hold then lie on the
 * NUL's own page; the sanitizers would take them for someone else's memory,
 * hence no checks here), else byte by byte up to the NUL. */
__attribute__((no_sanitize("address", "thread"))) static inline __m128i text_block(const char *s) {
    if (((uintptr_t)s & 4095) <= 4096 - 16) return _mm_loadu_si128((const __m128i *)(const void *)s);
    char bytes[16] = {0};
    for (int k = 0; k < 16 && s[k] != '\0'; ++k) bytes[k] = s[k];
    return _mm_loadu_si128((const __m128i *)(const void *)bytes);
}

/* The first `k` bytes of `v` (k < 16), the rest zero. */
static inline __m128i first_bytes(__m128i v, unsigned k) {
    static const char mask[32] = {-1, -1, -1, -1, -1, -1, -1, -1, -1, -1, -1, -1, -1, -1, -1, -1};
    return _mm_and_si128(v, _mm_loadu_si128((const __m128i *)(const void *)(mask + 16 - k)));
}

static char *put(char *dst, const char *src, size_t n) {
    memcpy(dst, src, n);
    dst[n] = '\0';
    return dst + n + 1;
}

/* Builds the block for `p` (plus `extra` bytes of text space) and points
 * rgy, token_cnt and tokens of the caller's structure into it. */
static struct block *make_block(const struct principal *p, size_t extra, char **rgy, int32_t *token_cnt,
                                char ***tokens) {
    size_t size = sizeof(struct block) + p->realm_len + 1 + p->name_len + 1 + p->instance_len + 1 + extra;
    struct block *b = malloc(size);
    if (b == NULL) return NULL;
    b->size = size;
    b->small_in_use = NULL;
    char *t = b->text;
    *rgy = t;
    t = put(t, p->realm, p->realm_len);
    b->tokens[0] = t;
    t = put(t, p->name, p->name_len);
    b->tokens[1] = NULL;
    *token_cnt = 1;
    if (p->instance != NULL) {
        b->tokens[1] = t;
        put(t, p->instance, p->instance_len);
        *token_cnt = 2;
    }
    b->mapping.length = 0;
    b->mapping.value = NULL;
    *tokens = b->tokens;
    return b;
}

/* Zeroes the block and frees it, or hands the small block back to its
 * thread (the cleanup may run on another thread than the translation, as
 * long as the translating thread lives). */
static void free_block(char **tokens) {
    if (tokens == NULL) return;
    struct block *b = (struct block *)(void *)((char *)tokens - offsetof(struct block, tokens));
    unsigned char *small_in_use = b->small_in_use;
    if (small_in_use == NULL) {
        explicit_bzero(b, b->size);
        free(b);
        return;
    }
    /* The small block's texts are whole 16-byte blocks (see fill_id_small):
     * zeroed in line. */
    for (char *t = b->text, *end = (char *)b + b->size; t < end; t += 16)
        _mm_storeu_si128((__m128i *)(void *)t, _mm_setzero_si128());
    __atomic_store_n(small_in_use, 0, __ATOMIC_RELEASE);
}

static int32_t fill_rule(const idm_mapfile_entry *entry, idm_rule *rule) {
    struct principal p;
    if (entry->network_id == NULL || split(entry->network_id, &p) != 0) return ST_REFUSED;
    int affirmative = entry->kind == IDM_ENTRY_AFFIRMATIVE && entry->local_id != NULL;
    size_t local_len = affirmative ? strlen(entry->local_id) : 0;
    struct block *b = make_block(&p, affirmative ? local_len + 1 : 0, &rule->rgy, &rule->token_cnt, &rule->tokens);
    if (b == NULL) return ST_NO_MEMORY;
    rule->rgy_type = mnemonic;
    rule->mapping = NULL;
    if (affirmative) {
        char *t = b->text + (b->size - sizeof(struct block) - local_len - 1);
        put(t, entry->local_id, local_len);
        b->mapping.value = t;
        b->mapping.length = (uint32_t)(local_len + 1);
        rule->mapping = &b->mapping;
    }
    return ST_OK;
}

/* The id of a plain name[/instance]@REALM in the thread's small block,
 * copied and cut into its parts in one pass.  0 when done; -1 when the
 * block is taken, the text does not fit or is not a well-formed principal
 * (fill_id then takes the general path, which also gives the status of a
 * bad one). */
static int fill_id_small(const char *network_id, idm_id *id) {
    struct small_block *sm = &small;
    __asm__("" : "+r"(sm)); /* one thread-local look-up, not one per use */
    if (__atomic_load_n(&sm->in_use, __ATOMIC_ACQUIRE)) return -1;
    struct block *b = (struct block *)(void *)sm->bytes;
    char *const text = b->text;
    char *const end = text + SMALL_TEXT;
    enum { NAME, INSTANCE, REALM } part = NAME;
    const char *s = network_id;
    const char *part_begin = s;
    char *t = text;
    char *rgy = NULL; /* the last part; the id gets it only when the text is whole */
    /* A part ends at its first NUL, '@' or `other` ('/' for the name and the
     * instance, which are judged by the separator found; '@' for the realm). */
    const __m128i nul = _mm_setzero_si128(), at = _mm_set1_epi8('@');
    __m128i other = _mm_set1_epi8('/');
    b->tokens[1] = NULL;
    for (;;) {
        if (t == end) goto fail;
        const __m128i v = text_block(s);
        const unsigned m = (unsigned)_mm_movemask_epi8(
            _mm_or_si128(_mm_or_si128(_mm_cmpeq_epi8(v, nul), _mm_cmpeq_epi8(v, at)), _mm_cmpeq_epi8(v, other)));
        if (m == 0) {
            _mm_storeu_si128((__m128i *)(void *)t, v);
            s += 16;
            t += 16;
            continue;
        }
        const unsigned k = (unsigned)__builtin_ctz(m);
        _mm_storeu_si128((__m128i *)(void *)t, first_bytes(v, k));
        t += 16;
        s += k;
        const char c = *s;
        if (s == part_begin) goto fail; /* an empty part */
        if (part == REALM) {
            if (c != '\0') goto fail;
            break;
        }
        if (c == '/' && part == NAME) {
            part = INSTANCE;
            b->tokens[1] = t;
        } else if (c == '@') {
            part = REALM;
            other = at;
            rgy = t;
        } else {
            goto fail;
        }
        part_begin = ++s;
    }
    sm->in_use = 1;
    b->size = (size_t)(t - (char *)b);
    b->small_in_use = &sm->in_use;
    b->tokens[0] = text;
    b->mapping.length = 0;
    b->mapping.value = NULL;
    id->rgy = rgy;
    id->rgy_type = mnemonic;
    id->token_cnt = b->tokens[1] != NULL ? 2 : 1;
    id->tokens = b->tokens;
    return 0;
fail:
    explicit_bzero(text, (size_t)(t - text));
    return -1;
}

static int32_t fill_id(const char *network_id, idm_id *id) {
    if (network_id != NULL && fill_id_small(network_id, id) == 0) return ST_OK;
    struct principal p;
    if (network_id == NULL || split(network_id, &p) != 0) return ST_BAD_ID;
    if (make_block(&p, 0, &id->rgy, &id->token_cnt, &id->tokens) == NULL) return ST_NO_MEMORY;
    id->rgy_type = mnemonic;
    return ST_OK;
}

EXPORT int32_t oxmpm_principal_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule,
                                         idm_id *id) {
    if (rule == NULL || id == NULL) return ST_BAD_ID;
    if (entry != NULL) {
        int32_t s = fill_rule(entry, rule);
        if (s != ST_OK) return s;
    }
    int32_t s = fill_id(network_id, id);
    if (s == ST_NO_MEMORY && entry != NULL) oxmpm_principal_cleanup(rule, NULL); /* no cleanup call follows */
    return s;
}

EXPORT int32_t oxmpm_principal_cleanup(idm_rule *rule, idm_id *id) {
    if (rule != NULL) {
        free_block(rule->tokens);
        rule->rgy_type = rule->rgy = NULL;
        rule->token_cnt = 0;
        rule->tokens = NULL;
        rule->mapping = NULL;
    }
    if (id != NULL) {
        free_block(id->tokens);
        id->rgy_type = id->rgy = NULL;
        id->token_cnt = 0;
        id->tokens = NULL;
    }
    return 0;
}

EXPORT int32_t oxmpm_principal_register(void) {
    return sec_idm_register_translator(IDM_MAPPING_NATIVE, mnemonic, oxmpm_principal_translate,
                                       oxmpm_principal_cleanup);
}

#ifdef OXMPM_SHARED_OBJECT
/* The entry a program that loads this object by path calls (oxmpm_plugin.h).
 * Only the shared object has it: the archives of both samples link together. */
static const struct oxmpm_plugin entry = {OXMPM_PLUGIN_VERSION, mnemonic, "name@REALM or name/instance@REALM",
                                          oxmpm_principal_translate, oxmpm_principal_cleanup};
OXMPM_PLUGIN_EXPORT const struct oxmpm_plugin *oxmpm_plugin_entry(void) { return &entry; }
#endif
