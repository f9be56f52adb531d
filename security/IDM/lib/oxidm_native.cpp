// The native mapping service (mapping type 1): the translator registry, the
// mapping walk over a mechanism's entries, and group lookup.
//
// Owns the translator list of idm__native_state.  Lock order: the native
// mutex first, then a record's mutex.  Registration and
// _sec_idm_get_translator hold both while comparing one record; mapping holds
// the native mutex only while searching, then the record's mutex for the
// refresh and again for the walk (including every call into the MPM).
// Records are never freed, so a record found under the native mutex stays
// valid after it is released.
#include "oxidm_internal.h"

using namespace idm;

extern "C" {

// ---------------------------------------------------------------------------
// Translator registry
// ---------------------------------------------------------------------------

// Creates the record for `mnemonic`, or replaces the routines of the existing
// one (its map files, entries and rule cache stay).  Returns 0, 6 (2650-654)
// or 23 (2650-661, 2650-655); a failed creation leaves the list unchanged.
int32_t idm__native_register_translator(const char *mnemonic, idm_translator_routine translator,
                                        idm_cleanup_routine cleanup) {
    static constexpr trace::ApiIds kIds{103, 105, 106, 107};
    static constexpr const char kName[] = "idm__native_register_translator";
    trace::Api api(kIds, trace::text(mnemonic), trace::ptr(translator), trace::ptr(cleanup));
    pthread_once(&idm__native_init_once_block, idm__native_state_init);

    int32_t status = 0;
    idm_translator *created = nullptr;
    bool mutex_made = false;
    {
        MutexHold native(&idm__native_state.mutex);
        bool found = false;
        for (idm_translator *t = idm__native_state.translators; t != nullptr && !found; t = t->next) {
            MutexHold record(&t->mutex);
            if (std::strcmp(mnemonic, t->mnemonic) == 0) {
                t->translator = translator;
                t->cleanup = cleanup;
                found = true;
            }
        }
        if (!found) {
            created = static_cast<idm_translator *>(xcalloc(1, sizeof(idm_translator)));
            if (created == nullptr) {
                status = report_no_memory(kName, sizeof(idm_translator));
            } else if (int r = mutex_init(&created->mutex); r != 0) {
                if (r == ENOMEM) status = report_no_memory(kName, sizeof(pthread_mutex_t));
                else if (r == EAGAIN) status = report(23, kMsg661, kName);
                else status = report(23, kMsg655, "pthread_mutex_init", r, kName);
            } else {
                mutex_made = true;
                created->mnemonic = xstrdup(mnemonic);
                if (created->mnemonic == nullptr) {
                    status = report_no_memory(kName, std::strlen(mnemonic) + 1);
                } else {
                    created->translator = translator;
                    created->cleanup = cleanup;
                    created->next = idm__native_state.translators;
                    idm__native_state.translators = created;
                    __atomic_store_n(&idm__native_state.translator_count,
                                     idm__native_state.translator_count + 1, __ATOMIC_RELAXED);
                }
            }
        }
    }
    if (status != 0 && created != nullptr) {
        if (mutex_made) pthread_mutex_destroy(&created->mutex);
        std::free(created);
    }
    return api.leave(status);
}

// Lookup for _sec_idm_get_translator: copies the routines when found.
int32_t idm__native_get_translator(const char *mnemonic, idm_translator_routine *translator,
                                   idm_cleanup_routine *cleanup) {
    MutexHold native(&idm__native_state.mutex);
    for (idm_translator *t = idm__native_state.translators; t != nullptr; t = t->next) {
        MutexHold record(&t->mutex);
        if (std::strcmp(mnemonic, t->mnemonic) == 0) {
            *translator = t->translator;
            *cleanup = t->cleanup;
            break;
        }
    }
    return 0;
}

// Lookup for mapping: compares mnemonics under the native mutex only (a
// record's `mnemonic` and `next` never change once it is listed).
idm_translator *idm__native_find_translator(const char *mnemonic) {
    MutexHold native(&idm__native_state.mutex);
    for (idm_translator *t = idm__native_state.translators; t != nullptr; t = t->next)
        if (std::strcmp(mnemonic, t->mnemonic) == 0) return t;
    return nullptr;
}

// ---------------------------------------------------------------------------
// Native identity mapping
// ---------------------------------------------------------------------------

int32_t idm__native_map_identity(const char *mnemonic, const char *network_id, idm_buffer *local) {
    static constexpr trace::ApiIds kIds{108, 110, 111, 112};
    trace::Api api(kIds, trace::text(mnemonic), trace::text(network_id), trace::ptr(local));
    pthread_once(&idm__native_init_once_block, idm__native_state_init);
    idm_translator *record = idm__native_find_translator(mnemonic);
    if (record == nullptr) return api.leave(report(22, kMsg660, mnemonic));
    // The refresh and the walk arrive with the map file and rule modules.
    return api.leave(0);
}

// ---------------------------------------------------------------------------
// Group membership lookup
// ---------------------------------------------------------------------------

int32_t idm__native_get_groups(idm_buffer *user, uint32_t *count, idm_buffer **groups) {
    static constexpr trace::ApiIds kIds{113, 115, 116, 117};
    trace::Api api(kIds, trace::ptr(user), trace::ptr(count), trace::ptr(groups));
    *count = 0;
    *groups = nullptr;
    // The database walk arrives with the group module.
    return api.leave(0);
}

}  // extern "C"
