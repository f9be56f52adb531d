// Whole identity mapping files through idm__parse_mapfile.
//
// Input: the mechanism name, an LF, then the file's bytes (any bytes), read
// from an fmemopen stream as the library reads a real file.
//
// Properties beyond "no crash": the file is cut into the pieces a 1024-byte
// fgets hands over (at most 1023 bytes, ending after the first LF), each
// taken up to its first NUL; the library's line judge agrees with the
// reference judge (fuzz_common.h) on every piece, and the parser yields, with
// status 0, exactly the entries the reference accepts, in order, each with
// clean identifiers and a local identifier exactly when it is no denial.
#include <algorithm>
#include <string>
#include <vector>

#include "fuzz_common.h"
#include "oxidm_state.h"
#include "oxidm_natfile.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    fuzz::trace_for(size);
    const fuzz::Split in = fuzz::split_first_line(data, size);
    const std::string mechanism = fuzz::c_text(in.head);
    if (mechanism.empty() || in.rest.empty()) return 0;

    std::vector<fuzz::Verdict> expected;
    for (size_t at = 0, n = 0; at < in.rest.size(); at += n) {
        const size_t lf = in.rest.find('\n', at);
        n = std::min<size_t>(lf == std::string_view::npos ? in.rest.size() - at : lf - at + 1, 1023);
        const std::string piece = fuzz::c_text(in.rest.substr(at, n));
        const fuzz::Verdict ref = fuzz::reference_judge(mechanism, piece);
        const idm::mapfile::LineVerdict lib = idm::mapfile::judge_line(mechanism, piece);
        // The two kinds list the same cases in the same order.
        FUZZ_CHECK(static_cast<int>(lib.kind) == static_cast<int>(ref.kind), piece);
        FUZZ_CHECK(lib.network_id == ref.network && lib.local_id == ref.local, piece);
        fuzz::check_identifiers(ref);
        if (ref.kind == fuzz::Kind::kAffirmative || ref.kind == fuzz::Kind::kDenial) expected.push_back(ref);
    }

    FILE *stream = fmemopen(const_cast<char *>(in.rest.data()), in.rest.size(), "r");
    if (stream == nullptr) return 0;
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    FUZZ_CHECK(idm__parse_mapfile(mechanism.c_str(), "/fuzz/map", stream, &count, &entries) == 0, mechanism);
    std::fclose(stream);
    FUZZ_CHECK(static_cast<size_t>(count) == expected.size() && (count == 0) == (entries == nullptr), mechanism);
    for (int32_t i = 0; i < count; ++i) {
        const idm_mapfile_entry &e = entries[i];
        const fuzz::Verdict &want = expected[static_cast<size_t>(i)];
        const uint32_t kind = want.kind == fuzz::Kind::kDenial ? IDM_ENTRY_DENIAL : IDM_ENTRY_AFFIRMATIVE;
        FUZZ_CHECK(e.kind == kind, want.network);
        FUZZ_CHECK(want.network == e.network_id && e.rule_index == 0, want.network);
        FUZZ_CHECK(e.local_id == nullptr ? want.kind == fuzz::Kind::kDenial : want.local == e.local_id, want.local);
    }
    idm__native_release_entry_list(count, entries);
    return 0;
}
