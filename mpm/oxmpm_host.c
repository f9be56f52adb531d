/*
 * oxmpm_host.c - sample MPM "host": translator and cleanup routine for
 * identities user@host.  Syntax and statuses: oxmpm_host.h.
 *
 * Memory: each structure the translator fills owns exactly one block, hung
 * on its `tokens` field; the token array, every text and (for a rule) the
 * mapping buffer live inside it, with the block's size and origin stored in
 * front.  A rule's block is on the heap (libox_idm caches rules).  An id is
 * translated once per entry walked and released right after, so it goes
 * into the calling thread's small block when that is free and the id fits,
 * and onto the heap otherwise.  The cleanup routine therefore needs nothing
 * but that pointer: it zeroes the block's texts (they held identities) and
 * frees it or hands the small block back.  `rgy_type` points to the constant mnemonic
 * and is never freed.
 *
 * The routines take no lock; the only state is each thread's small block,
 * so any number of threads may use them (libox_idm serialises the calls for
 * one mechanism anyway).
 */
#define _DEFAULT_SOURCE /* explicit_bzero */
#include "oxmpm_host.h"
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
    if (at == NULL || at == text || at[1] == '\0') return -1;
    size_t host_len = strlen(at + 1);
    if (memchr(at + 1, '@', host_len) != NULL) return -1;
    p->user = text;
    p->user_len = (size_t)(at - text);
    p->host = at + 1;
    p->host_len = host_len;
    return 0;
}

static char *put(char *dst, const char *src, size_t n, int fold) {
    if (!fold) {
        memcpy(dst, src, n);
    } else {
        for (size_t i = 0; i < n; ++i) {
            unsigned char c = (unsigned char)src[i];
            dst[i] = (char)(c + ((unsigned char)(c - 'A') < 26u ? 'a' - 'A' : 0));
        }
    }
    dst[n] = '\0';
    return dst + n + 1;
}

/* Block behind `tokens`: its size, the `in_use` flag of the thread's small
 * block when it is that block (NULL for a heap block), the token array, the
 * mapping buffer (rules only), then the texts. */
struct block {
    size_t size;
    unsigned char *small_in_use;
    char *tokens[1];
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
 * processor has) in one pass that also finds its separator.  Each part goes
 * to the small block in whole 16-byte stores, starting at a 16-byte boundary
 * of the text and padded with NULs to the next one, so that the loads with
 * which libox_idm compares the parts just afterwards find each of them
 * within one earlier store. */

/* `v` with its ASCII capitals folded to lower case, all sixteen at once. */
static inline __m128i fold_block(__m128i v) {
    const __m128i capital = _mm_and_si128(_mm_cmpgt_epi8(v, _mm_set1_epi8('A' - 1)), _mm_cmplt_epi8(v, _mm_set1_epi8('Z' + 1)));
    return _mm_or_si128(v, _mm_and_si128(capital, _mm_set1_epi8(0x20)));
}

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

static struct block *new_block(size_t text_size) {
    struct block *b = malloc(sizeof(struct block) + text_size);
    if (b == NULL) return NULL;
    b->size = sizeof(struct block) + text_size;
    b->small_in_use = NULL;
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

/* The id of a plain user@host in the thread's small block, copied and cut
 * in one pass: the user as written, the host folded to lower case.  0 when
 * done; -1 when the block is taken, the text does not fit or is anything but
 * a plain user@host (fill_id then takes the general path, which also gives
 * the status of a bad one). */
static int fill_id_small(const char *network_id, idm_id *id) {
    struct small_block *sm = &small;
    __asm__("" : "+r"(sm)); /* one thread-local look-up, not one per use */
    if (__atomic_load_n(&sm->in_use, __ATOMIC_ACQUIRE)) return -1;
    struct block *b = (struct block *)(void *)sm->bytes;
    char *const text = b->text;
    char *const end = text + SMALL_TEXT;
    int host = 0; /* which part: the user (ends at the '@'), then the host (at the NUL) */
    const char *s = network_id;
    const char *part_begin = s;
    char *t = text;
    char *rgy = NULL; /* the last part; the id gets it only when the text is whole */
    const __m128i nul = _mm_setzero_si128(), at = _mm_set1_epi8('@');
    for (;;) {
        if (t == end) goto fail;
        const __m128i v = text_block(s);
        const unsigned m = (unsigned)_mm_movemask_epi8(_mm_or_si128(_mm_cmpeq_epi8(v, nul), _mm_cmpeq_epi8(v, at)));
        if (m == 0) {
            _mm_storeu_si128((__m128i *)(void *)t, host ? fold_block(v) : v);
            s += 16;
            t += 16;
            continue;
        }
        const unsigned k = (unsigned)__builtin_ctz(m);
        const __m128i last = first_bytes(v, k);
        _mm_storeu_si128((__m128i *)(void *)t, host ? fold_block(last) : last);
        t += 16;
        s += k;
        if (s == part_begin || *s != (host ? '\0' : '@')) goto fail; /* an empty part, no '@' or a second one */
        if (host) break;
        host = 1;
        rgy = t;
        part_begin = ++s;
    }
    sm->in_use = 1;
    b->size = (size_t)(t - (char *)b);
    b->small_in_use = &sm->in_use;
    b->tokens[0] = text;
    id->rgy = rgy;
    id->rgy_type = mnemonic;
    id->token_cnt = 1;
    id->tokens = b->tokens;
    return 0;
fail:
    explicit_bzero(text, (size_t)(t - text));
    return -1;
}

static int32_t fill_id(const char *network_id, idm_id *id) {
    if (network_id != NULL && fill_id_small(network_id, id) == 0) return ST_OK;
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
