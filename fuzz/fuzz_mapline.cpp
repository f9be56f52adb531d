// One map file line, through every routine that judges a line.
//
// Input: the mechanism name, an LF, then the line (cut after its first LF,
// and at its first NUL, as a read piece is).
//
// Properties beyond "no crash":
//   - idm::mapfile::judge_line agrees with the reference judge
//     (fuzz_common.h) written from the line format;
//   - idm__test_entry_mech selects exactly the lines the reference selects;
//   - idm__read_mapfile_entries on the prepared line (line feed removed,
//     comment cut) appends one entry exactly when the reference accepts the
//     line, with the same kind and identifiers; appending the same line
//     repeatedly keeps count and array consistent across the ten-slot
//     growth;
//   - accepted identifiers hold no blank or '#', a network identifier no '='.
#include <string>

#include "fuzz_common.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    fuzz::trace_for(size);
    fuzz::Split in = fuzz::split_first_line(data, size);
    const std::string mechanism = fuzz::c_text(in.head);
    std::string_view rest = in.rest;
    if (size_t lf = rest.find('\n'); lf != std::string_view::npos) rest = rest.substr(0, lf + 1);
    const std::string piece = fuzz::c_text(rest);

    const fuzz::Verdict ref = fuzz::reference_judge(mechanism, piece);
    fuzz::check_identifiers(ref);
    const idm::mapfile::LineVerdict lib = idm::mapfile::judge_line(mechanism, piece);
    switch (ref.kind) {
    case fuzz::Kind::kSkipped: FUZZ_CHECK(lib.kind == idm::mapfile::LineKind::kSkipped, piece); break;
    case fuzz::Kind::kInvalid: FUZZ_CHECK(lib.kind == idm::mapfile::LineKind::kInvalid, piece); break;
    case fuzz::Kind::kAffirmative:
        FUZZ_CHECK(lib.kind == idm::mapfile::LineKind::kAffirmative, piece);
        FUZZ_CHECK(lib.network_id == ref.network && lib.local_id == ref.local, piece);
        break;
    case fuzz::Kind::kDenial:
        FUZZ_CHECK(lib.kind == idm::mapfile::LineKind::kDenial, piece);
        FUZZ_CHECK(lib.network_id == ref.network && lib.local_id.empty(), piece);
        break;
    }

    // The line as the file reader prepares it for the selector and the parser.
    std::string line = piece;
    if (!line.empty() && line.back() == '\n') line.pop_back();
    if (size_t hash = line.find('#'); hash != std::string::npos) line.resize(hash);
    if (line.find_first_not_of(" \t") == std::string::npos) {
        FUZZ_CHECK(ref.kind == fuzz::Kind::kSkipped, piece);
        return 0;
    }
    const bool selected = idm__test_entry_mech(mechanism.c_str(), line.c_str()) == 0;
    FUZZ_CHECK(selected == (ref.kind != fuzz::Kind::kSkipped), piece);
    if (!selected) return 0;

    // Append the line several times (1 to 21), crossing the growth points.
    const int rounds = 1 + static_cast<int>(size % 21);
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    for (int r = 0; r < rounds; ++r) {
        FUZZ_CHECK(idm__read_mapfile_entries(line.c_str(), &count, &entries) == 0, piece);
        const bool accepted = ref.kind == fuzz::Kind::kAffirmative || ref.kind == fuzz::Kind::kDenial;
        FUZZ_CHECK(count == (accepted ? r + 1 : 0), piece);
        if (!accepted) continue;
        const idm_mapfile_entry &e = entries[r];
        FUZZ_CHECK(e.network_id != nullptr && ref.network == e.network_id, piece);
        FUZZ_CHECK(e.rule_index == 0, piece);
        if (ref.kind == fuzz::Kind::kDenial) {
            FUZZ_CHECK(e.kind == IDM_ENTRY_DENIAL && e.local_id == nullptr, piece);
        } else {
            FUZZ_CHECK(e.kind == IDM_ENTRY_AFFIRMATIVE && e.local_id != nullptr && ref.local == e.local_id, piece);
        }
    }
    FUZZ_CHECK((count == 0) == (entries == nullptr), piece);
    idm__native_release_entry_list(count, entries);
    return 0;
}
