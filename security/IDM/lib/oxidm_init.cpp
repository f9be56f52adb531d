// Process-wide state of the front end and of the native mapping service, and
// their one-time initialisation.  Both records are zero at load and filled
// lazily under once-controls; nothing is ever torn down, so a thread still
// calling in while the process exits never meets a destroyed mutex.
//
// idm__state.mutex is held only inside idm__state_init.  The service table is
// written once there and read afterwards without a lock (the once-control
// orders the write before every read).
#include "oxidm_state.h"

extern "C" {

idm_state_t idm__state;
// All-zero is the static initialiser of a default mutex, so the native mutex
// is usable before idm__native_state_init runs (_sec_idm_get_translator
// relies on that).
idm_native_state_t idm__native_state = {0, 0, PTHREAD_MUTEX_INITIALIZER, nullptr};
pthread_once_t idm__init_once_block = PTHREAD_ONCE_INIT;
pthread_once_t idm__native_init_once_block = PTHREAD_ONCE_INIT;

void idm__state_init(void) {
    std::memset(&idm__state, 0, sizeof idm__state);
    pthread_mutex_init(&idm__state.mutex, nullptr);
    idm::MutexHold hold(&idm__state.mutex);
    idm_mapping_service &native = idm__state.services[0];
    native.state = &idm__native_state;
    native.register_translator = idm__native_register_translator;
    native.map_identity = idm__native_map_identity;
    native.get_groups = idm__native_get_groups;
    idm__state.mapping_type = IDM_MAPPING_NATIVE;
    sec__idm_clmap_init();
}

// The mutex itself is already a default mutex by static initialisation and
// is not initialised again here: _sec_idm_get_translator runs no once-control
// and may hold it at this very moment, and re-initialising a held mutex would
// silently break its exclusion.
void idm__native_state_init(void) {
    idm::MutexHold hold(&idm__native_state.mutex);
    idm__native_state.translators = nullptr;
    idm__native_state.reserved = 0;
    __atomic_store_n(&idm__native_state.translator_count, 0u, __ATOMIC_RELAXED);
}

int32_t idm__mapping_type_valid(int32_t mapping_type) { return mapping_type == IDM_MAPPING_NATIVE ? 1 : 0; }

}  // extern "C"
