// One map file line, through the routines that take a prepared line.
//
// Input: the mechanism name, an LF, then the line (cut after its first LF,
// and at its first NUL, as a read piece is).
//
// Properties beyond "no crash": on the line as the file reader prepares it
// (line feed removed, comment cut), idm__test_entry_mech selects exactly the
// non-blank lines the reference judge (fuzz_common.h) does not skip, and
// idm__read_mapfile_entries appends an entry exactly when the reference
// accepts the line, with its kind and identifiers; appending the same line
// 1 to 21 times keeps count and array consistent across the ten-slot growth.
#include <string>

#include "fuzz_common.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    fuzz::trace_for(size);
    const fuzz::Split in = fuzz::split_first_line(data, size);
    const std::string mechanism = fuzz::c_text(in.head);
    const size_t lf = in.rest.find('\n');
    const std::string piece = fuzz::c_text(in.rest.substr(0, lf == std::string_view::npos ? lf : lf + 1));
    const fuzz::Verdict ref = fuzz::reference_judge(mechanism, piece);

    const std::string line = piece.substr(0, piece.find_first_of("\n#"));
    if (line.find_first_not_of(" \t") == std::string::npos) {
        FUZZ_CHECK(ref.kind == fuzz::Kind::kSkipped, piece);
        return 0;
    }
    const bool selected = idm__test_entry_mech(mechanism.c_str(), line.c_str()) == 0;
    FUZZ_CHECK(selected == (ref.kind != fuzz::Kind::kSkipped), piece);
    if (!selected) return 0;

    const bool accepted = ref.kind != fuzz::Kind::kInvalid;
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    for (int r = 0; r < 1 + static_cast<int>(size % 21); ++r) {
        FUZZ_CHECK(idm__read_mapfile_entries(line.c_str(), &count, &entries) == 0, piece);
        FUZZ_CHECK(count == (accepted ? r + 1 : 0) && (count == 0) == (entries == nullptr), piece);
        if (!accepted) continue;
        const idm_mapfile_entry &e = entries[r];
        FUZZ_CHECK(ref.network == e.network_id && e.rule_index == 0, piece);
        if (ref.kind == fuzz::Kind::kDenial) FUZZ_CHECK(e.kind == IDM_ENTRY_DENIAL && e.local_id == nullptr, piece);
        else FUZZ_CHECK(e.kind == IDM_ENTRY_AFFIRMATIVE && e.local_id != nullptr && ref.local == e.local_id, piece);
    }
    idm__native_release_entry_list(count, entries);
    return 0;
}
