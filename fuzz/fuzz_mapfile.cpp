// Whole identity mapping files through idm__parse_mapfile.
//
// Input: the mechanism name, an LF, then the file's bytes (any bytes: NULs,
// CRs, lines longer than the 1023-character read buffer).  The file is read
// from an fmemopen stream, as the library reads a real file.
//
// Properties beyond "no crash":
//   - status 0, and the count matches the array;
//   - every entry's identifiers are non-empty and hold no blank, '#', LF or
//     '='(network identifier); a denial has no local identifier;
//   - the entries are exactly those that the reference judge (fuzz_common.h)
//     accepts, in order, when the file is cut into pieces as a 1024-byte
//     fgets cuts it and each piece is taken up to its first NUL;
//   - the library's pure line judge (idm::mapfile::judge_line) agrees with
//     the reference on every piece.
#include <cstring>
#include <string>
#include <vector>

#include "fuzz_common.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"

namespace {

fuzz::Verdict from_library(const idm::mapfile::LineVerdict &v) {
    fuzz::Verdict out;
    switch (v.kind) {
    case idm::mapfile::LineKind::kSkipped: out.kind = fuzz::Kind::kSkipped; break;
    case idm::mapfile::LineKind::kInvalid: out.kind = fuzz::Kind::kInvalid; break;
    case idm::mapfile::LineKind::kAffirmative: out.kind = fuzz::Kind::kAffirmative; break;
    case idm::mapfile::LineKind::kDenial: out.kind = fuzz::Kind::kDenial; break;
    }
    if (out.kind == fuzz::Kind::kAffirmative || out.kind == fuzz::Kind::kDenial) {
        out.network = std::string(v.network_id);
        out.local = std::string(v.local_id);
    }
    return out;
}

// The pieces a 1024-byte fgets hands over: at most 1023 bytes, ending after
// the first LF; each as a C string.
std::vector<std::string> pieces_of(std::string_view file) {
    std::vector<std::string> out;
    size_t at = 0;
    while (at < file.size()) {
        size_t n = 0;
        while (n < 1023 && at + n < file.size()) {
            ++n;
            if (file[at + n - 1] == '\n') break;
        }
        out.push_back(fuzz::c_text(file.substr(at, n)));
        at += n;
    }
    return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    fuzz::trace_for(size);
    fuzz::Split in = fuzz::split_first_line(data, size);
    const std::string mechanism = fuzz::c_text(in.head);
    if (mechanism.empty() || in.rest.empty()) return 0;

    std::vector<fuzz::Verdict> expected;
    for (const std::string &piece : pieces_of(in.rest)) {
        fuzz::Verdict ref = fuzz::reference_judge(mechanism, piece);
        fuzz::Verdict lib = from_library(idm::mapfile::judge_line(mechanism, piece));
        FUZZ_CHECK(lib == ref, piece);
        if (ref.kind == fuzz::Kind::kAffirmative || ref.kind == fuzz::Kind::kDenial) expected.push_back(ref);
    }

    FILE *stream = fmemopen(const_cast<char *>(in.rest.data()), in.rest.size(), "r");
    if (stream == nullptr) return 0;
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    const int32_t status = idm__parse_mapfile(mechanism.c_str(), "/fuzz/oxsec_map.local", stream, &count, &entries);
    std::fclose(stream);

    FUZZ_CHECK(status == 0, mechanism);
    FUZZ_CHECK(count >= 0 && (count == 0) == (entries == nullptr), mechanism);
    FUZZ_CHECK(static_cast<size_t>(count) == expected.size(), std::to_string(count));
    for (int32_t i = 0; i < count; ++i) {
        const idm_mapfile_entry &e = entries[i];
        fuzz::Verdict got;
        FUZZ_CHECK(e.kind == IDM_ENTRY_AFFIRMATIVE || e.kind == IDM_ENTRY_DENIAL, mechanism);
        got.kind = e.kind == IDM_ENTRY_DENIAL ? fuzz::Kind::kDenial : fuzz::Kind::kAffirmative;
        FUZZ_CHECK(e.network_id != nullptr, mechanism);
        got.network = e.network_id;
        FUZZ_CHECK((e.local_id == nullptr) == (e.kind == IDM_ENTRY_DENIAL), mechanism);
        if (e.local_id != nullptr) got.local = e.local_id;
        FUZZ_CHECK(e.rule_index == 0, mechanism);
        fuzz::check_identifiers(got);
        FUZZ_CHECK(got == expected[static_cast<size_t>(i)], got.network);
    }
    idm__native_release_entry_list(count, entries);
    return 0;
}
