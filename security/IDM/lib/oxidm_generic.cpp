// The exported identity-mapping entry points: argument checks in their fixed
// order, entry and exit trace points, and dispatch through the service table
// of idm__state.  These functions hold no lock themselves.
#include "oxidm_diag.h"
#include "oxidm_state.h"

using namespace idm;

namespace {

constexpr trace::ApiIds kRegisterIds{tp::kRegisterEntry, tp::kRegisterEntryData, tp::kRegisterExit, tp::kRegisterExitData};
constexpr trace::ApiIds kMapIds{tp::kMapEntry, tp::kMapEntryData, tp::kMapExit, tp::kMapExitData};
constexpr trace::ApiIds kGroupsIds{tp::kGroupsEntry, tp::kGroupsEntryData, tp::kGroupsExit, tp::kGroupsExitData};

// First or second 32-bit word of the state of the service for `type`, or -1
// when the type is not valid.
int32_t service_word(int32_t type, int word) {
    if (!idm__mapping_type_valid(type)) return -1;
    const auto *words = static_cast<const uint32_t *>(idm__state.services[type - 1].state);
    if (words == nullptr) return -1;
    return static_cast<int32_t>(__atomic_load_n(&words[word], __ATOMIC_RELAXED));
}

}  // namespace

extern "C" {

__attribute__((visibility("default"))) int32_t sec_idm_register_translator(int32_t mapping_type,
                                                                           const char *mnemonic,
                                                                           idm_translator_routine translator,
                                                                           idm_cleanup_routine cleanup) {
    trace::Api api(kRegisterIds, trace::i32(mapping_type), trace::text(mnemonic, null_string),
                   trace::ptr(translator), trace::ptr(cleanup));
    pthread_once(&idm__init_once_block, idm__state_init);
    static constexpr const char kName[] = "sec_idm_register_translator";
    int32_t status;
    if (!idm__mapping_type_valid(mapping_type))
        status = report_bad_param(kName, 1, hex(static_cast<uintptr_t>(static_cast<intptr_t>(mapping_type))));
    else if (mnemonic == nullptr || *mnemonic == '\0')
        status = report_bad_param(kName, 2, hex(mnemonic));
    else if (translator == nullptr)
        status = report_bad_param(kName, 3, hex(uintptr_t{0}));
    else if (cleanup == nullptr)
        status = report_bad_param(kName, 4, hex(uintptr_t{0}));
    else
        status = idm__state.services[mapping_type - 1].register_translator(mnemonic, translator, cleanup);
    const int32_t word0 = service_word(mapping_type, 0);
    const int32_t word1 = service_word(mapping_type, 1);
    return api.leave(status, trace::i32(word0), trace::i32(word1));
}

__attribute__((visibility("default"))) int32_t sec_idm_map_identity(const char *mnemonic, const char *network_id,
                                                                    idm_buffer *local) {
    trace::Api api(kMapIds, trace::text(mnemonic, null_string), trace::text(network_id, null_string),
                   trace::ptr(local));
    pthread_once(&idm__init_once_block, idm__state_init);
    static constexpr const char kName[] = "sec_idm_map_identity";
    const int32_t type = static_cast<int32_t>(idm__state.mapping_type);
    int32_t status;
    if (mnemonic == nullptr || *mnemonic == '\0') {
        status = report_bad_param(kName, 1, hex(mnemonic));
    } else if (network_id == nullptr || *network_id == '\0') {
        status = report_bad_param(kName, 2, hex(network_id));
    } else if (local == nullptr) {
        status = report_bad_param(kName, 3, hex(uintptr_t{0}));
    } else {
        local->length = 0;
        local->value = nullptr;
        MappingHold result(local);
        status = idm__state.services[type - 1].map_identity(mnemonic, network_id, local);
        const int32_t word0 = service_word(type, 0);
        const int32_t left = api.leave(status, trace::i32(word0));
        result.keep();
        return left;
    }
    const int32_t word0 = service_word(type, 0);
    return api.leave(status, trace::i32(word0));
}

__attribute__((visibility("default"))) int32_t sec_idm_get_groups(idm_buffer *user, uint32_t *count,
                                                                  idm_buffer **groups) {
    trace::Api api(kGroupsIds, trace::ptr(user), trace::ptr(count), trace::ptr(groups));
    pthread_once(&idm__init_once_block, idm__state_init);
    static constexpr const char kName[] = "sec_idm_get_groups";
    int32_t status;
    if (user == nullptr || user->length == 0 || user->value == nullptr)
        status = report_bad_param(kName, 1, hex(user));
    else if (count == nullptr)
        status = report_bad_param(kName, 2, hex(uintptr_t{0}));
    else if (groups == nullptr)
        status = report_bad_param(kName, 3, hex(uintptr_t{0}));
    else
        status = idm__state.services[idm__state.mapping_type - 1].get_groups(user, count, groups);
    return api.leave(status);
}

// No once-control and no trace point: usable before anything else ran.
__attribute__((visibility("default"))) int32_t _sec_idm_get_translator(const char *mnemonic,
                                                                       idm_translator_routine *translator,
                                                                       idm_cleanup_routine *cleanup) {
    if (translator == nullptr || cleanup == nullptr) return kBadParameter;
    return idm__native_get_translator(mnemonic, translator, cleanup);
}

}  // extern "C"
