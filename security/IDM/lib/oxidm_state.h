// Front-end and native-service state of libox_idm: the process-wide records
// (created once by the once-controls, never destroyed, so a thread still
// calling in during exit never meets a destroyed mutex), the translator
// record, and the routines the modules call across each other.
//
// Lock order (outermost first):
//   idm__state.mutex            only inside idm__state_init
//   idm__native_state.mutex     the translator list
//   idm_translator.mutex        one mechanism's routines, map files, entries, rules
//   idmutex (oxsec_lock)        the cluster trees; independent of the above
#ifndef OXIDM_STATE_H
#define OXIDM_STATE_H

#include <pthread.h>

#include <cstdint>

#include "oxidm.h"
#include "oxidm_annotations.h"
#include "oxidm_diag.h"
#include "oxidm_holds.h"

struct idm_mapfile_set;

// One registered mechanism.  Created by registration, never freed.
// `next` and `mnemonic` never change once the record is on the list and may
// be read under the native mutex alone; everything else is guarded by `mutex`.
struct idm_translator {
    idm_translator *next;
    idm_mutex_t mutex;
    char *mnemonic;
    idm_translator_routine translator OXIDM_GUARDED_BY(mutex);
    idm_cleanup_routine cleanup OXIDM_GUARDED_BY(mutex);
    idm_mapfile_set *mapfiles OXIDM_GUARDED_BY(mutex);
    int32_t entry_count OXIDM_GUARDED_BY(mutex);
    idm_mapfile_entry *entries OXIDM_GUARDED_BY(mutex);
    int32_t rule_count OXIDM_GUARDED_BY(mutex);
    idm_rule *rules OXIDM_GUARDED_BY(mutex);
};

struct idm_mapping_service {
    void *state;  // begins with two 32-bit words recorded by the exit traces
    int32_t (*register_translator)(const char *, idm_translator_routine, idm_cleanup_routine);
    int32_t (*map_identity)(const char *, const char *, idm_buffer *);
    int32_t (*get_groups)(idm_buffer *, uint32_t *, idm_buffer **);
};

// Written once under `mutex` by idm__state_init; read without a lock after
// the once-control has run.
struct idm_state_t {
    idm_mutex_t mutex;
    uint32_t mapping_type;
    idm_mapping_service services[1];
};

struct idm_native_state_t {
    uint32_t reserved;          // never set
    uint32_t translator_count;  // written under mutex, read atomically by traces
    idm_mutex_t mutex;
    idm_translator *translators OXIDM_GUARDED_BY(mutex);
};

extern "C" {
extern idm_state_t idm__state;
extern idm_native_state_t idm__native_state;
extern pthread_once_t idm__init_once_block;
extern pthread_once_t idm__native_init_once_block;

void idm__state_init(void);
void idm__native_state_init(void);
int32_t idm__mapping_type_valid(int32_t mapping_type);

// Native service (oxidm_native).
int32_t idm__native_register_translator(const char *mnemonic, idm_translator_routine translator,
                                        idm_cleanup_routine cleanup);
int32_t idm__native_map_identity(const char *mnemonic, const char *network_id, idm_buffer *local);
int32_t idm__native_get_groups(idm_buffer *user, uint32_t *count, idm_buffer **groups);
int32_t idm__native_get_translator(const char *mnemonic, idm_translator_routine *translator,
                                   idm_cleanup_routine *cleanup);
idm_translator *idm__native_find_translator(const char *mnemonic);
}

namespace idm {

// Reads the native service's two state words for exit traces.
inline uint32_t native_word(int i) {
    return i == 0 ? __atomic_load_n(&idm__native_state.reserved, __ATOMIC_RELAXED)
                  : __atomic_load_n(&idm__native_state.translator_count, __ATOMIC_RELAXED);
}

}  // namespace idm

#endif
