// Trace component "_SEI": registration with libox_tr, the category table,
// the detail levels, and the dump routines for rules and ids.
//
// Owns: idm__trace_detail_levels (written by libox_tr, read by every trace
// point), idm__trace_categories and null_string (constant in practice).
// Registration runs once per process under idm__trace_register_once; the
// component is never unregistered by the library.
#include <iterator>

#include "oxidm_diag.h"

using namespace idm;

extern "C" {

unsigned char idm__trace_detail_levels[5];
pthread_once_t idm__trace_register_once = PTHREAD_ONCE_INIT;
unsigned char idm__trace_registered = 0;
const char *null_string = "<null>";

// Category table as libox_tr receives it: number, name, a null field.
static const tr_category_t idm__trace_categories[] = {
    {0, "Error", nullptr}, {1, "API", nullptr}, {2, "Mapping", nullptr},
    {3, "Milestone", nullptr}, {4, "Diag", nullptr},
};

// Registers "_SEI".  The error that was current before registration is made
// current again afterwards, whatever libox_tr recorded meanwhile.
int idm__trace_register_oxidm(void) {
    cu_error_t *pending = nullptr;
    cu_get_error_1(&pending);
    int rc = tr_register_component_1(trace::kComponent, idm__trace_detail_levels, idm__trace_categories,
                                    static_cast<int>(std::size(idm__trace_categories)));
    if (pending != nullptr) cu_pset_error_1(pending);
    return rc;
}

void idm__trace_register_once_routine(void) {
    (void)idm__trace_register_oxidm();
    __atomic_store_n(&idm__trace_registered, 1, __ATOMIC_RELEASE);
}

int idm__trace_unregister_oxidm(void) { return tr_unregister_component_1(trace::kComponent); }

int idm__trace_routine_end(const char *name, int32_t status) {
    unsigned char l = trace::level(trace::kApi);
    if (name == nullptr || *name == '\0') return 0;
    if (l == 1) return tr_record_strings_1(trace::kComponent, trace::tp::kRoutineEndName, 1, name);
    if (l == 8)
        return tr_record_data_1(trace::kComponent, trace::tp::kRoutineEndData, 2, static_cast<const void *>(name), std::strlen(name) + 1,
                                static_cast<const void *>(&status), size_t{4});
    return 0;
}

// Each dump records null_string in place of a missing text.
static void trace_tokens(int32_t count, char *const *tokens) {
    for (int32_t i = 1; i <= count; ++i)
        trace::record_data(tp::kDumpToken, trace::i32(i), trace::text(tokens != nullptr ? tokens[i - 1] : nullptr, null_string));
}

void idm__trace_native_rule(const idm_rule *rule) {
    if (rule == nullptr) return;
    trace::record_data(tp::kDumpRule, trace::u32(rule->rule_state), trace::text(rule->rgy_type, null_string),
                       trace::text(rule->rgy, null_string), trace::i32(rule->token_cnt));
    trace_tokens(rule->token_cnt, rule->tokens);
    if (rule->mapping != nullptr)
        trace::record_data(tp::kDumpRuleMapping, trace::u32(rule->mapping->length),
                           trace::text(rule->mapping->value, null_string));
}

void idm__trace_native_id(const idm_id *id) {
    if (id == nullptr) return;
    trace::record_data(tp::kDumpId, trace::text(id->rgy_type, null_string), trace::text(id->rgy, null_string),
                       trace::i32(id->token_cnt));
    trace_tokens(id->token_cnt, id->tokens);
}

}  // extern "C"
