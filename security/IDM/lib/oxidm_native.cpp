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
#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <cerrno>

#include "oxidm_diag.h"
#include "oxidm_holds.h"
#include "oxidm_state.h"
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
    static constexpr trace::ApiIds kIds{tp::kNativeRegisterEntry, tp::kNativeRegisterEntryData, tp::kNativeRegisterExit, tp::kNativeRegisterExitData};
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
                else if (r == EAGAIN) status = report(kInternal, kMsg661, kName);
                else status = report(kInternal, kMsg655, "pthread_mutex_init", r, kName);
            } else {
                mutex_made = true;
                created->mnemonic = xstrdup(mnemonic);
                if (created->mnemonic == nullptr) {
                    status = report_no_memory(kName, std::strlen(mnemonic) + 1);
                } else {
                    {
                        // Not yet published; locked so that the fields are
                        // only ever written under their mutex.
                        MutexHold record(&created->mutex);
                        created->translator = translator;
                        created->cleanup = cleanup;
                    }
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
    static constexpr trace::ApiIds kIds{tp::kNativeMapEntry, tp::kNativeMapEntryData, tp::kNativeMapExit, tp::kNativeMapExitData};
    trace::Api api(kIds, trace::text(mnemonic), trace::text(network_id), trace::ptr(local));
    pthread_once(&idm__native_init_once_block, idm__native_state_init);
    idm_translator *record = idm__native_find_translator(mnemonic);
    if (record == nullptr) return api.leave(report(kNoTranslator, kMsg660, mnemonic));

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
        MappingHold result(local);
        const idm_translator_routine translate = record->translator;
        const idm_cleanup_routine cleanup = record->cleanup;
        idm_id id{};
        const int32_t n = record->entry_count;
        for (int32_t i = 0; i < n; ++i) {
            idm_mapfile_entry *entry = &record->entries[i];
            int32_t match = -1;
            if (int32_t k = entry->rule_index; k != 0) {
                if (k < 0 || k > record->rule_count) continue;
                idm_rule *cached = &record->rules[k - 1];
                if ((cached->rule_state & 0xFFFEu) != 0) continue;
                status = translate(nullptr, network_id, cached, &id);
                if (status == 0) match = idm__native_apply_rule(cached, &id, local);
                (void)cleanup(nullptr, &id);
            } else {
                idm_rule rule{};
                status = translate(entry, network_id, &rule, &id);
                switch (status) {
                case 0:
                    match = idm__native_apply_rule(&rule, &id, local);
                    break;
                case kTranslatorRefused:
                    (void)cleanup(&rule, nullptr);
                    rule = idm_rule{};
                    rule.rule_state = IDM_RULE_MULTI_WILDCARD;
                    break;
                case kRuleInvalid:
                case kTranslatorStop:
                    (void)idm__native_check_rule(&rule);
                    break;
                default:
                    continue;
                }
                if (idm__native_cache_rule(record, entry, &rule) == 0) (void)cleanup(nullptr, &id);
                else (void)cleanup(&rule, &id);
            }
            if (status == kTranslatorStop || (status == kOk && match == 0)) break;
        }
        result.keep();
    }
    return api.leave(status);
}

// ---------------------------------------------------------------------------
// Group membership lookup
// ---------------------------------------------------------------------------

// The system's group enumeration (setgrent, getgrent_r, endgrent) keeps one
// position for the whole process, so two scans at once would each see only
// part of the database.  This mutex serialises the scans of the library: it
// is held from setgrent to endgrent and no other lock is taken under it, so
// it stands outside the lock order above.  Code outside the library that
// enumerates groups is not covered (the public header says so).
static pthread_mutex_t idm__native_group_scan_mutex = PTHREAD_MUTEX_INITIALIZER;

// Cancellation clean-up of a group scan: closes the enumeration and releases
// the scan mutex.  endgrent may be a cancellation point and this runs inside
// a destructor (possibly during the unwind of a cancellation), so it runs
// with cancellation disabled.
static void idm__thread_cleanup_group_scan(void *mutex) {
    int old_state = 0;
    pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &old_state);
    endgrent();
    pthread_setcancelstate(old_state, nullptr);
    idm__thread_cleanup_mutex(mutex);
}

}  // extern "C"

namespace {

constexpr const char kGroupsName[] = "idm__native_get_groups";

// Working size of a lookup buffer when sysconf gives no suggestion (-1):
// 16 KiB holds any ordinary entry; a longer one fails its lookup as it would
// when it exceeds a suggested size.
constexpr int32_t kUnsuggestedSize = 16384;

// The suggested buffer size for `which`, taken as a 32-bit signed number.
size_t suggested_size(int which) {
    int32_t n = static_cast<int32_t>(sysconf(which));
    return static_cast<size_t>(n > 0 ? n : kUnsuggestedSize);
}

// The error number of a failed getgrent_r, the number the scan acts on
// (EINTR: call again; 0 or ENOENT: complete; else 2650-700).  The caller
// clears errno before each call, as the scan is defined in terms of errno,
// but glibc's getgrent_r returns the error number as its result (ENOENT at
// the end of the database) and need not set errno; an NSS layer preloaded in
// front of it may instead return -1 and set errno.  So a positive result is
// the error number, and otherwise errno is (still 0 when nothing was set).
// getpwnam_r and getgrgid_r need no such reading: any non-zero result or a
// missing entry fails their lookup alike.
int enumeration_error(int result) { return result > 0 ? result : errno; }

// Holds the group-scan mutex for one enumeration; the destructor (normal
// exit or cancellation) calls endgrent and unlocks.
class GroupScanHold : Pinned {
  public:
    GroupScanHold() { pthread_mutex_lock(&idm__native_group_scan_mutex); }
    ~GroupScanHold() { idm::forget_dead_frames(); idm__thread_cleanup_group_scan(&idm__native_group_scan_mutex); }
};

// One failure point of the allocation seam where no block is allocated:
// the fault-injection build fails it in its turn, so that a lookup keeps the
// failure points (and the reports) of one allocation per work buffer and per
// appended element whatever the blocks underneath do.
bool seam_refuses() {
#ifdef OXIDM_FAULT_INJECTION
    return fault_alloc_fires();
#else
    return false;
#endif
}

// The work space of the three lookups.  The user lookup, the primary group
// lookup and the scan run one after the other, and none reads the entry of
// the one before (the primary group's name is copied into the result before
// the scan), so one region serves all three; each call is given exactly the
// size it is defined with.  With the usual suggested sizes the region is on
// the stack; a larger size takes a heap block, replaced when a later lookup
// needs more.  It holds database entries (user names, home directories), so
// every byte handed out is zeroed when the region is released, also on
// cancellation.
class WorkArea : Pinned {
  public:
    WorkArea() = default;
    ~WorkArea() {
        idm::forget_dead_frames();
        release();
    }
    // Makes data() a buffer of `size` bytes for the next lookup: 0, or 6
    // (2650-654 with the size).
    int32_t take(size_t size) {
        if (size <= capacity_) {
            if (seam_refuses()) return report_no_memory(kGroupsName, size);
        } else {
            release();
            heap_ = static_cast<char *>(xmalloc(size));
            if (heap_ == nullptr) return report_no_memory(kGroupsName, size);
            data_ = heap_;
            capacity_ = size;
        }
        if (size > used_) used_ = size;
        return 0;
    }
    char *data() const { return data_; }

  private:
    static constexpr size_t kStackBytes = 4096;

    void release() {
        if (heap_ != nullptr) {
            free_zeroed(heap_, used_);
            heap_ = nullptr;
        } else if (used_ != 0) {
            explicit_bzero(stack_, used_);
#ifdef OXIDM_FAULT_INJECTION
            fault_note_secret_free(stack_, used_);
#endif
        }
        data_ = stack_;
        capacity_ = kStackBytes;
        used_ = 0;
    }

    char stack_[kStackBytes];
    char *data_ = stack_;
    char *heap_ = nullptr;
    size_t capacity_ = kStackBytes;
    size_t used_ = 0;
};

// The result array under construction.  Unless handed over, the destructor
// frees every element's value and then the array.
struct GroupList : Pinned {
    // Elements the array block has room for before it is first enlarged:
    // more than most users' groups.
    static constexpr size_t kFirstCapacity = 16;

    idm_buffer *items = nullptr;
    uint32_t count = 0;
    size_t capacity = 0;
    GroupList() = default;
    ~GroupList() {
        for (uint32_t i = 0; i < count; ++i) std::free(items[i].value);
        std::free(items);
    }
    // Appends a zeroed element and copies `name` into it.  Returns 0 or 6
    // (2650-654): when the array cannot grow it stays as it was; when the
    // name cannot be copied the zeroed element stays, counted.  The array
    // grows by one element per append as far as failures and their sizes
    // go, while its block grows geometrically, so appending stays cheap.
    int32_t append(const char *name) {
        const size_t bytes = (static_cast<size_t>(count) + 1) * sizeof(idm_buffer);
        if (count < capacity) {
            if (seam_refuses()) return report_no_memory(kGroupsName, bytes);
        } else {
            const size_t room = capacity == 0 ? kFirstCapacity : 2 * capacity;
            void *grown = xrealloc(items, room * sizeof(idm_buffer));
            if (grown == nullptr) return report_no_memory(kGroupsName, bytes);
            items = static_cast<idm_buffer *>(grown);
            capacity = room;
        }
        idm_buffer *added = &items[count++];
        std::memset(added, 0, sizeof *added);
        const size_t length = std::strlen(name) + 1;
        added->value = static_cast<char *>(xmalloc(length));
        if (added->value == nullptr) return report_no_memory(kGroupsName, length);
        std::memcpy(added->value, name, length);
        added->length = static_cast<uint32_t>(length);
        return 0;
    }
};

// User lookup and primary group: on 0, `list` holds the primary group as its
// only element unless the user's primary group id is -1 (`*primary` tells).
// Returns 0, 6 (2650-654) or 15 (2650-698, 2650-699).
int32_t lookup_primary_group(const char *name, size_t pw_size, size_t gr_size, WorkArea &work, GroupList &list,
                             bool *primary) {
    if (int32_t status = work.take(2 * pw_size); status != 0) return status;
    passwd pwd;
    passwd *user = nullptr;
    int result = getpwnam_r(name, &pwd, work.data(), 2 * pw_size, &user);
    if (result != 0 || user == nullptr || std::strncmp(pwd.pw_name, name, pw_size) != 0)
        return report(kGroupsUnavailable, kMsg698, name);
    const gid_t gid = pwd.pw_gid;
    if (gid == static_cast<gid_t>(-1)) return 0;

    // The group entry may overwrite the user entry: only its group id is
    // needed from here on.
    if (int32_t status = work.take(gr_size); status != 0) return status;
    group grp;
    group *found = nullptr;
    result = getgrgid_r(gid, &grp, work.data(), gr_size, &found);
    if (result != 0 || found == nullptr) return report(kGroupsUnavailable, kMsg699, static_cast<int>(gid));
    if (int32_t status = list.append(grp.gr_name); status != 0) return status;
    *primary = true;
    return 0;
}

// One pass over the group database, appending every group whose member list
// names `name`, once per naming.  Returns the status of the last failure
// recorded: 0, 6 (2650-654, the scan went on) or 15 (2650-700, it ended).
int32_t scan_groups(const char *name, size_t gr_size, bool primary, WorkArea &work, GroupList &list) {
    if (int32_t status = work.take(gr_size); status != 0) return status;
    char *const buffer = work.data();
    int32_t status = 0;
    GroupScanHold scan;  // endgrent and unlock when the scan ends
    setgrent();
    for (;;) {
        group grp;
        group *found = nullptr;
        errno = 0;
        int result = getgrent_r(&grp, buffer, gr_size, &found);
        if (result != 0) {
            int error = enumeration_error(result);
            if (error == EINTR) continue;
            if (error != 0 && error != ENOENT) status = report(kGroupsUnavailable, kMsg700, error);
            break;
        }
        if (found == nullptr) break;
        if (primary && std::strcmp(grp.gr_name, list.items[0].value) == 0) continue;
        if (grp.gr_mem == nullptr) continue;
        for (char **member = grp.gr_mem; *member != nullptr; ++member) {
            if (std::strcmp(*member, name) != 0) continue;
            if (int32_t appended = list.append(grp.gr_name); appended != 0) {
                status = appended;  // go on with the next group
                break;
            }
        }
    }
    return status;
}

}  // namespace

extern "C" {

// The groups of local user user->value: the primary group first (none when
// the primary group id is -1), then every group whose member list names the
// user, in enumeration order, once per naming; the primary group is not
// repeated.  On 0 the caller owns *groups (null when *count is 0) and frees
// each element's value, then the array.  Returns 0, 6 (2650-654) or 15
// (2650-698, 2650-699, 2650-700); on failure *count is 0 and *groups null
// and nothing of the call stays allocated.
int32_t idm__native_get_groups(idm_buffer *user, uint32_t *count, idm_buffer **groups) {
    static constexpr trace::ApiIds kIds{tp::kNativeGroupsEntry, tp::kNativeGroupsEntryData, tp::kNativeGroupsExit, tp::kNativeGroupsExitData};
    trace::Api api(kIds, trace::ptr(user), trace::ptr(count), trace::ptr(groups));
    *count = 0;
    *groups = nullptr;
    const size_t pw_size = suggested_size(_SC_GETPW_R_SIZE_MAX);
    const size_t gr_size = suggested_size(_SC_GETGR_R_SIZE_MAX);

    GroupList list;
    WorkArea work;
    bool primary = false;
    int32_t status = lookup_primary_group(user->value, pw_size, gr_size, work, list, &primary);
    if (status == 0) status = scan_groups(user->value, gr_size, primary, work, list);
    if (status == 0 && list.count != 0) {
        *groups = list.items;
        *count = list.count;
        list.items = nullptr;
        list.count = 0;
    }
    return api.leave(status);
}

}  // extern "C"
