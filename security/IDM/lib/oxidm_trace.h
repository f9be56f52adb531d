// Trace points of component "_SEI".
//
// The detail levels live in idm__trace_detail_levels, one byte per category,
// written by libox_tr after registration and read here without a lock.  Every
// trace point first runs the once-control that registers the component, then
// reads one level byte; records are built only when a level asks for them.
//
// Usage in a traced routine:
//     trace::Api api(kIds, trace::text(mnemonic), trace::ptr(buffer));
//     ...
//     return api.leave(status);
#ifndef OXIDM_TRACE_H
#define OXIDM_TRACE_H

#include <pthread.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <utility>

#include "ox_tr.h"
#include "oxidm_tracepoints.h"

extern "C" {
extern unsigned char idm__trace_detail_levels[5];
extern pthread_once_t idm__trace_register_once;
extern unsigned char idm__trace_registered;  // 1 once the once-control's routine has returned
extern const char *null_string;  // "<null>", recorded in place of a missing text
int idm__trace_register_oxidm(void);
int idm__trace_unregister_oxidm(void);
int idm__trace_routine_end(const char *name, int32_t status);
struct idm_rule;
struct idm_id;
void idm__trace_native_rule(const struct idm_rule *rule);
void idm__trace_native_id(const struct idm_id *id);
void idm__trace_register_once_routine(void);
}

namespace idm::trace {

inline constexpr const char kComponent[] = "_SEI";

// Runs the registration once-control and reads one level byte.  The
// once-control is checked inline first: once registration has run, a trace
// point is one flag test and one byte read, with no call.
inline unsigned char level(Category c) {
    if (__atomic_load_n(&idm__trace_registered, __ATOMIC_ACQUIRE) == 0)
        pthread_once(&idm__trace_register_once, idm__trace_register_once_routine);
    return __atomic_load_n(&idm__trace_detail_levels[c], __ATOMIC_RELAXED);
}
inline bool error_on() { return level(kError) != 0 || level(kDiag) != 0; }
inline bool diag_on() { return level(kDiag) != 0; }

// One data item: address and length.  A text's length (with its NUL) is
// taken only when the record is actually written.
struct Item {
    const void *p;
    size_t len;
};
inline constexpr size_t kTextLen = ~size_t{0};

inline Item text(const char *s, const char *if_null = "<null>") { return {s ? s : if_null, kTextLen}; }
inline Item i32(const int32_t &v) { return {&v, 4}; }
inline Item u32(const uint32_t &v) { return {&v, 4}; }
inline Item i64(const int64_t &v) { return {&v, 8}; }
// The 8 bytes of the variable that holds a pointer.
template <class T>
inline Item ptr(T *const &p) { return {&p, 8}; }

inline void record_id(tp::Id id) { tr_record_id_1(kComponent, id); }

template <size_t I, size_t N>
inline auto flat(const std::array<Item, N> &a) {
    if constexpr (I % 2 == 0) return a[I / 2].p;
    else return a[I / 2].len;
}
template <size_t N, size_t... I>
inline void record_flat(tp::Id id, const std::array<Item, N> &a, std::index_sequence<I...>) {
    tr_record_data_1(kComponent, id, static_cast<int>(N), flat<I>(a)...);
}

template <class... Items>
inline void record_data(tp::Id id, Items... items) {
    std::array<Item, sizeof...(Items)> a{items...};
    for (Item &it : a)
        if (it.len == kTextLen) it.len = std::strlen(static_cast<const char *>(it.p)) + 1;
    record_flat(id, a, std::make_index_sequence<2 * sizeof...(Items)>{});
}

template <class... Texts>
inline void record_strings(tp::Id id, Texts... texts) {
    tr_record_strings_1(kComponent, id, static_cast<int>(sizeof...(Texts)), static_cast<const char *>(texts)...);
}

// The entry and exit pattern: the entry point in the constructor, the exit
// point in leave(), which reads the API level afresh, as it may have changed
// meanwhile.  At level 1 the bare entry or exit id; at level 8 the data
// record with the items, or the bare id again where the routine names the
// same id for both levels.
class Api {
  public:
    template <class... Items>
    explicit Api(const ApiIds &ids, Items... items) : ids_(ids), entered_(level(kApi)) {
        if (entered_ == 0) [[likely]] return;
        if (entered_ == 1) record_id(ids_.entry);
        else if (entered_ == 8 && ids_.entry_data == ids_.entry) record_id(ids_.entry);
        else if (entered_ == 8) record_data(ids_.entry_data, items...);
    }
    // Whether the entry point was recorded with data (API level 8).
    bool entered_with_data() const { return entered_ == 8; }
    template <class... Items>
    int32_t leave(int32_t status, Items... more) const {
        const unsigned char l = level(kApi);
        if (l == 0) [[likely]] return status;
        if (l == 1) record_id(ids_.exit);
        else if (l == 8 && ids_.exit_data == ids_.exit) record_id(ids_.exit);
        else if (l == 8) record_data(ids_.exit_data, i32(status), more...);
        return status;
    }
    Api(const Api &) = delete;
    Api &operator=(const Api &) = delete;

  private:
    const ApiIds &ids_;
    const unsigned char entered_;
};

}  // namespace idm::trace

namespace idm {
namespace tp = trace::tp;
}

#endif
