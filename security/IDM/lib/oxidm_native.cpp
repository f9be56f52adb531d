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
#include "oxidm_natfile.h"
#include "oxidm_natmap.h"

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

// Releases an entry list detached from a record when the scope ends; no
// call into an MPM happens here, so it is safe during a cancellation unwind.
struct idm_entry_list_release {
    int32_t count;
    idm_mapfile_entry *entries;
    ~idm_entry_list_release() { idm__native_release_entry_list(count, entries); }
};

// Maps `network_id` of mechanism `mnemonic` to a local user in `local`
// (cleared by the caller; written only by a matching rule).  Returns
//   0   the first matching entry's local name in `local` (the caller frees
//       local->value), or `local` empty: the first match was a denial, no
//       entry matched and the last translation succeeded, or no entry was
//       translated at all;
//   22  no translator registered under `mnemonic` (2650-660);
//   >1  the map files could not be read (reported there); the record is
//       left without entries and rules;
//   31  the translator stopped the walk;
//   otherwise the status of the last translator call, when nothing matched.
// The record's mutex is held for the refresh and again for the walk,
// including every call of the MPM's routines; the holds are released if the
// thread is cancelled inside one of them.
int32_t idm__native_map_identity(const char *mnemonic, const char *network_id, idm_buffer *local) {
    static constexpr trace::ApiIds kIds{108, 110, 111, 112};
    trace::Api api(kIds, trace::text(mnemonic), trace::text(network_id), trace::ptr(local));
    pthread_once(&idm__native_init_once_block, idm__native_state_init);
    idm_translator *record = idm__native_find_translator(mnemonic);
    if (record == nullptr) return api.leave(report(22, kMsg660, mnemonic));

    // Refresh.  After a change or a read error the old entries and rules
    // go, and a new list is installed within the same hold.  The old ones
    // are detached before the MPM's cleanup routine sees them, so a thread
    // cancelled inside it leaves the record consistent.
    int32_t read_status;
    {
        MutexHold hold(&record->mutex);
        int32_t count = 0;
        idm_mapfile_entry *entries = nullptr;
        read_status = idm__native_read_mapfiles(mnemonic, &record->mapfiles, &count, &entries);
        if (read_status != 1) {
            idm_entry_list_release old_entries{record->entry_count, record->entries};
            int32_t old_rule_count = record->rule_count;
            idm_rule *old_rules = record->rules;
            record->rule_count = 0;
            record->rules = nullptr;
            record->entry_count = 0;
            record->entries = nullptr;
            if (read_status == 0) {
                record->entry_count = count;
                record->entries = entries;
            }
            idm__native_release_rule_list(record->cleanup, old_rule_count, old_rules);
        }
    }
    if (read_status > 1) return api.leave(read_status);

    // Walk, first match wins.  A cached rule gets only the id translated;
    // an unusable one costs the state test.  A new rule is cached whatever
    // its verdict for statuses 0, 31, 38 and 39; the cache then owns its
    // contents and only the id is released.
    int32_t status = 0;
    {
        MutexHold hold(&record->mutex);
        const idm_translator_routine translate = record->translator;
        const idm_cleanup_routine cleanup = record->cleanup;
        idm_id id{};
        const int32_t n = record->entry_count;
        for (int32_t i = 0; i < n; ++i) {
            idm_mapfile_entry *entry = &record->entries[i];
            idm_rule rule{};
            int32_t match = -1;
            if (int32_t k = entry->rule_index; k != 0) {
                if (k < 0 || k > record->rule_count) continue;
                idm_rule *cached = &record->rules[k - 1];
                if ((cached->rule_state & 0xFFFEu) != 0) continue;
                status = translate(nullptr, network_id, cached, &id);
                if (status == 0) match = idm__native_apply_rule(cached, &id, local);
                (void)cleanup(nullptr, &id);
            } else {
                status = translate(entry, network_id, &rule, &id);
                switch (status) {
                case 0:
                    match = idm__native_apply_rule(&rule, &id, local);
                    break;
                case 39:
                    (void)cleanup(&rule, nullptr);
                    rule = idm_rule{};
                    rule.rule_state = IDM_RULE_MULTI_WILDCARD;
                    break;
                case 38:
                case 31:
                    (void)idm__native_check_rule(&rule);
                    break;
                default:
                    continue;
                }
                if (idm__native_cache_rule(record, entry, &rule) == 0) (void)cleanup(nullptr, &id);
                else (void)cleanup(&rule, &id);
            }
            if (status == 31 || (status == 0 && match == 0)) break;
        }
    }
    return api.leave(status);
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
