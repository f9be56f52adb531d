// Node information text through the parser and the loader that rebuilds the
// two trees.  Input: the file's bytes.  Properties beyond "no crash":
//   - idm::clmap::parse hands over exactly the values and records, and fails
//     at exactly the trace point and line, that the reference parser finds;
//   - a text without its final LF is judged as if it had one;
//   - every value is non-empty, holds no blank or LF, and neither begins nor
//     ends with whitespace;
//   - after idm__construct_clcfg the trees hold exactly the names and
//     addresses of the records, each with the clusters of the first record
//     listing it; after a failure (21 invalid, 6 the record budget) both are
//     empty.
#include "../tests/support/reference_nodeinfo.h"
#include "fuzz_common.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    static bool once = [] { return pthread_once(&idm__init_once_block, idm__state_init) == 0; }();
    (void)once;
    fuzz::trace_for(size);
    const std::string input(reinterpret_cast<const char *>(data), size), text = input + '\n';
    const refnode::Result lib = refnode::library_parse(input), lib_lf = refnode::library_parse(text),
                          ref = refnode::parse(input);
    FUZZ_CHECK(lib == ref, std::to_string(lib.point) + " line " + std::to_string(lib.line));
    FUZZ_CHECK(lib == lib_lf, "the final LF changes the verdict");
    for (const refnode::Event &e : lib.events)
        FUZZ_CHECK(e.record || (!e.value.empty() && e.value.find_first_of(" \n") == std::string::npos &&
                                !refnode::space(e.value.front()) && !refnode::space(e.value.back())),
                   e.value);
    idm::clmap::MapHold hold(&idmutex);
    const int32_t status = idm__construct_clcfg(hold, text.data(), text.size());
    FUZZ_CHECK(status == 0 || status == 6 || status == 21, std::to_string(status));
    FUZZ_CHECK((status == 21) == (ref.status == 21), std::to_string(status));
    FUZZ_CHECK(refnode::library_trees() == (status == 0 ? refnode::expected_trees(ref) : refnode::Trees{}), "trees");
    return 0;
}
