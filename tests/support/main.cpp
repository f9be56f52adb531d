// Test main: enters the private mount namespace before GoogleTest (or
// anything else) starts a thread.
#include "harness.h"

int main(int argc, char **argv) {
    ::testing::InitGoogleTest(&argc, argv);
    if (!oxtest::enter_private_namespace())
        std::fprintf(stderr, "note: no private mount namespace; tests that need one are skipped\n");
    return RUN_ALL_TESTS();
}
