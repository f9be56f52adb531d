// Node information text through the parser and the loader that rebuilds the
// two trees.  Input: the file's bytes.  Properties beyond "no crash":
//   - a text without its final LF is judged as if it had one;
//   - every value is non-empty, holds no blank or LF, and neither begins nor
//     ends with whitespace;
//   - idm__construct_clcfg fails exactly when the parse does (21 invalid, or
//     6 the record budget) and then leaves both trees empty; otherwise they
//     hold exactly the names and addresses of the records, each with the
//     clusters of the first record listing it.
#include <cctype>

#include "../tests/support/reference_nodeinfo.h"
#include "fuzz_common.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    static bool once = [] { return pthread_once(&idm__init_once_block, idm__state_init) == 0; }();
    (void)once;
    fuzz::trace_for(size);
    const std::string input(reinterpret_cast<const char *>(data), size), text = input + '\n';
    const refnode::Result lib = refnode::library_parse(input), lib_lf = refnode::library_parse(text);
    FUZZ_CHECK(lib == lib_lf, "the final LF changes the verdict");
    auto space = [](char c) { return std::isspace(static_cast<unsigned char>(c)) != 0; };
    for (const refnode::Event &e : lib.events)
        FUZZ_CHECK(e.record || (!e.value.empty() && e.value.find_first_of(" \n") == std::string::npos &&
                                !space(e.value.front()) && !space(e.value.back())),
                   e.value);
    const int32_t status = refnode::construct(text);
    FUZZ_CHECK(status == 0 || status == 6 || status == 21, std::to_string(status));
    FUZZ_CHECK((status == 21) == (lib.status == 21), std::to_string(status));
    FUZZ_CHECK(refnode::library_trees() == (status == 0 ? refnode::expected_trees(lib) : refnode::Trees{}), "trees");
    return 0;
}
