/*
 * ox_cu.h - the utility interface (libox_cu) that libox_idm uses, and the
 * inspection calls of this stand-in implementation.
 *
 * Error facility: each thread has one current error.  cu_set_error_1 makes a
 * new one current: it keeps the numbers, the default text's address and the
 * inserts (positional conversions %N$s, %N$d, %N$x, %N$u are understood; the
 * insert types are taken from the text, at most 16 inserts), copying text
 * inserts into the thread's record without formatting and without a heap
 * allocation while they fit.  The message is formatted when it is read.
 *
 * Active cluster: cu_get_cluster_info_1 reads the active cluster's name from
 * the first line of CU_ACTIVE_CLUSTER_FILE, unless a program set a name with
 * cux_set_active_cluster.
 */
#ifndef OX_CU_H
#define OX_CU_H

#include <stddef.h>
#include <stdint.h>
#include <sys/time.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct cu_error cu_error_t;

/* Records a new current error for the calling thread; returns `status`. */
int cu_set_error_1(int status, int reserved, const char *catalog, int set, int msgno, const char *deftext, ...);
/* *handle = a copy of the current error, or stays NULL when none is pending. */
int cu_get_error_1(cu_error_t **handle);
/* Makes a copy of the error behind `handle` current again. */
int cu_pset_error_1(const cu_error_t *handle);
/* Releases a handle from cu_get_error_1. */
void cu_rel_error_1(cu_error_t *handle);

int cu_gettimeofday_1(struct timeval *tv, void *tz);
/* Compares at most n bytes ignoring case under the POSIX locale; 0 = equal. */
int cu_8bit_strncasecmp_posix_1(const char *s1, const char *s2, size_t n);

#define CU_ACTIVE_CLUSTER_FILE "/var/ox/cfg/active_cluster"

/* Cluster information record; the active cluster's name starts at byte 64. */
typedef struct cu_cluster_info {
    uint32_t version;
    uint32_t node_number;
    char cluster_id[56];
    char cluster_name[64];
} cu_cluster_info_t;
#ifdef __cplusplus
static_assert(offsetof(cu_cluster_info_t, cluster_name) == 64, "cluster name at byte 64");
#else
_Static_assert(offsetof(cu_cluster_info_t, cluster_name) == 64, "cluster name at byte 64");
#endif

/* 0 and `info` filled, or non-zero when no active cluster name is known. */
int cu_get_cluster_info_1(cu_cluster_info_t *info);

/* ---- inspection interface of the stand-in (tests and tools) ---- */
int cux_error_pending(void);           /* 1 when this thread has a current error */
void cux_clear_error(void);            /* forget this thread's current error */
unsigned long cux_error_count(void);   /* cu_set_error_1 calls made on this thread */
int cux_error_status(void);
int cux_error_reserved(void);          /* second argument of cu_set_error_1 */
const char *cux_error_catalog(void);
int cux_error_set(void);
int cux_error_msgno(void);
const char *cux_error_deftext(void);   /* default text exactly as passed */
const char *cux_error_text(void);      /* formatted message */
int cux_error_insert_count(void);
const char *cux_error_insert(int i);   /* insert i (from 1), formatted by its conversion */
unsigned long long cux_error_insert_raw(int i); /* integer inserts as passed (64 bits for %x) */
unsigned long cux_handles_live(void);  /* handles from cu_get_error_1 not yet released */

/* NULL: back to CU_ACTIVE_CLUSTER_FILE.  "" or a name: that answer. */
void cux_set_active_cluster(const char *name);
void cux_fail_cluster_info(int fail);  /* non-zero: cu_get_cluster_info_1 fails */
/* 0: real clock; otherwise cu_gettimeofday_1 reports these seconds. */
void cux_set_clock(int64_t seconds);

#ifdef __cplusplus
}
#endif
#endif
