// The watched translator and one mapping request (declared in tool.h).
#include "tool.h"

#include <cstdlib>

#include "ox_cu.h"
#include "ox_tr.h"

namespace oxidm_tool {

namespace {

const Mechanism *g_mech = nullptr;
Watch g_watch;
bool g_called = false;
unsigned long g_errors_after = 0;  // cu_set_error_1 calls when the last call returned

int32_t watched_translate(const idm_mapfile_entry *entry, const char *network_id, idm_rule *rule, idm_id *id) {
    drain_records();
    TranslatorCall c;
    if (g_called && cux_error_count() > g_errors_after && cux_error_pending()) {
        c.msgno_before = cux_error_msgno();
        c.message_before = library_error();
    }
    if (entry != nullptr) {
        c.has_entry = true;
        c.network_id = entry->network_id ? entry->network_id : "";
    }
    if (g_watch.on_call_start) g_watch.on_call_start(c);
    c.status = g_mech->routines.translate(entry, network_id, rule, id);
    g_called = true;
    g_errors_after = cux_error_count();
    if (g_watch.on_call_end) g_watch.on_call_end(c);
    return c.status;
}

int32_t watched_cleanup(idm_rule *rule, idm_id *id) { return g_mech->routines.cleanup(rule, id); }

}  // namespace

std::string register_watched(const std::string &mnemonic) {
    g_mech = find_mechanism(mnemonic);
    if (g_mech == nullptr) return "unknown mechanism \"" + mnemonic + "\" (see oxidm mechanisms)";
    clear_library_error();
    int32_t status = sec_idm_register_translator(IDM_MAPPING_NATIVE, mnemonic.c_str(), watched_translate,
                                                 watched_cleanup);
    if (status == 0) return "";
    std::string error = library_error();
    return error.empty() ? "registration failed with status " + std::to_string(status) : error;
}

MapOutcome map_watched(const Options &o, const std::string &mnemonic, const std::string &identity, bool full,
                       Watch watch) {
    // Category numbers of "_SEI": 1 API, 2 Mapping, 4 Diag.
    if (full) {
        trx_set_level("_SEI", 1, 8);
        trx_set_level("_SEI", 2, 8);
        trx_set_level("_SEI", 4, 1);
    } else if (unsigned char m = o.tracing ? o.trace_levels.level[2] : 0; m != 1 && m != 2 && m != 8) {
        trx_set_level("_SEI", 2, 2);  // the match points only
    }
    g_watch = std::move(watch);
    g_called = false;
    // Under `oxidm trace` the records stay for it to print.
    stream_records(g_watch.on_record, !o.tracing, g_watch.wants);
    MapOutcome out;
    idm_buffer local{0, nullptr};
    clear_library_error();
    out.status = sec_idm_map_identity(mnemonic.c_str(), identity.c_str(), &local);
    drain_records();
    stream_records(nullptr, false);
    if (g_called && cux_error_count() > g_errors_after && cux_error_pending()) {
        out.msgno_after = cux_error_msgno();
        out.message_after = library_error();
    }
    if (out.status == 0 && local.value != nullptr) {
        out.granted = true;
        out.local = local.value;
    }
    std::free(local.value);
    if (out.status != 0) {
        out.error = library_error();
        if (out.error.empty())
            out.error = "the mechanism's translator answered status " + std::to_string(out.status) +
                        " (the library reported no message)";
    }
    g_watch = Watch{};
    return out;
}

}  // namespace oxidm_tool
