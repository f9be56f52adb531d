/*
 * ox_tr.h - the trace interface (libox_tr) that libox_idm uses, and the
 * inspection calls of this stand-in implementation.
 *
 * A component registers an array of per-category detail levels; the trace
 * library writes the configured levels into it, and the component reads them
 * before each trace point.  Records are kept in memory for inspection and,
 * when OX_TR_FILE names a file (or "stderr"), also written there in readable
 * form.  OX_TR_LEVELS sets levels at registration, e.g. "_SEI:API=8,Diag=1"
 * or "_SEI:8,0,0,0,1" (one level per category in order).  Both variables are
 * read by this stand-in only; libox_idm itself reads no environment.
 */
#ifndef OX_TR_H
#define OX_TR_H

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

/* One category as registered: number, name, and a reserved null field. */
typedef struct tr_category {
    long number;
    const char *name;
    void *reserved;
} tr_category_t;

int tr_register_component_1(const char *component, unsigned char *levels, const tr_category_t *categories,
                            int count);
int tr_unregister_component_1(const char *component);
int tr_record_id_1(const char *component, int id);
/* count pairs follow: (const void *item, size_t length) */
int tr_record_data_1(const char *component, int id, int count, ...);
/* count texts follow: const char * */
int tr_record_strings_1(const char *component, int id, int count, ...);

/* ---- inspection interface of the stand-in ---- */
enum { TRX_ID = 0, TRX_DATA = 1, TRX_STRINGS = 2 };

/* Sets a level now (written into the registered array) and for a later
 * registration of the component. */
void trx_set_level(const char *component, int category, unsigned char level);
void trx_set_all_levels(const char *component, unsigned char level);
void trx_clear(void);                 /* forget all kept records */
void trx_keep(int on);                /* keep records in memory (default on) */
size_t trx_count(void);               /* records kept */
/* Record i: returns 0 and fills id, kind, item count; -1 when out of range. */
int trx_record(size_t i, int *id, int *kind, int *items);
/* Item j of record i: its bytes and length (texts include their NUL). */
const void *trx_item(size_t i, int j, size_t *length);
const char *trx_component(size_t i);
int trx_registrations(const char *component);   /* successful registrations */
int trx_unregistrations(const char *component);
/* Category names as registered, or NULL. */
const char *trx_category_name(const char *component, int category);
/* Calls `hook` with the id of every record, on the recording thread, after
 * the record is kept; NULL removes it.  Tests block threads at a chosen
 * trace point with it. */
void trx_on_record(void (*hook)(int id));
/* Writes all kept records in readable form to `path` ("-" for stdout). */
int trx_dump(const char *path);

#ifdef __cplusplus
}
#endif
#endif
