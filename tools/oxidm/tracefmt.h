// Readable trace records of component "_SEI": the table of the library's
// trace ids (routine, meaning, item names), capture of the records that the
// libox_tr stand-in keeps in memory, and decoding of the stand-in's text
// output (OX_TR_FILE).
#ifndef OXIDM_TOOL_TRACEFMT_H
#define OXIDM_TOOL_TRACEFMT_H

#include <cstdint>
#include <cstdio>
#include <functional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

namespace oxidm_tool {

// One trace id of the library.
struct TraceIdInfo {
    int id;
    const char *routine;
    const char *what;          // "entry", "exit data", "Diag: line skipped", ...
    const char *items[8];      // names of the data items, in order (null: unnamed)
};
// Null when the id is not one of the library's.
const TraceIdInfo *trace_id_info(int id);

// One record, items as raw bytes (texts with their NUL).
struct TraceRecord {
    int id = 0;
    int kind = 0;  // TRX_ID, TRX_DATA, TRX_STRINGS
    std::string component;
    std::vector<std::string> items;

    int32_t i32(size_t j) const;
    int64_t i64(size_t j) const;
    bool is_text(size_t j) const;
    std::string text(size_t j) const;  // without the NUL
};

// Records kept by the stand-in from index `from` on.
std::vector<TraceRecord> captured_records(size_t from = 0);
size_t captured_count();
// Hands every record to `sink` as soon as it is written and, with `forget`,
// drops it from the stand-in's memory, so that no cap on kept records
// limits a long walk (null: stop).  The sink must not call the library.
// `wants`, when given, picks the ids the sink is shown (no component set).
void stream_records(std::function<void(const TraceRecord &)> sink, bool forget, bool (*wants)(int id) = nullptr);
// Hands over the records written since the last call (streaming only).
void drain_records();

// Levels of "_SEI" in category order: Error, API, Mapping, Milestone, Diag.
struct TraceLevels {
    unsigned char level[5] = {0, 0, 0, 0, 0};
};
// Parses "API=8,Diag=1", "8,0,0,0,1" or "all=N"; false on a bad text.
bool parse_levels(const std::string &text, TraceLevels &out);
void apply_levels(const TraceLevels &levels);

// One item decoded as text: texts quoted, 4-byte items as integers, 8-byte
// items as integers or addresses (by the item's name).
std::string decode_item(const TraceRecord &r, size_t j);
// "  93 sec_idm_map_identity entry data: mnemonic=\"krb5\" ...".
std::string format_record(const TraceRecord &r);
// One JSON object per record (used by `trace --json`).
nlohmann::ordered_json records_json(const std::vector<TraceRecord> &records);

// Decodes a file written by the stand-in (lines "COMPONENT ID item...");
// returns the records it understood.  Lines it cannot read are kept as
// records with id -1 and the raw line as their only item.
std::vector<TraceRecord> read_trace_file(FILE *f);

}  // namespace oxidm_tool

#endif
