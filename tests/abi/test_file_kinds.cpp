// A local map file path, and the node information file path, that are not
// a regular file, through the shipped library, with a global map file that
// would grant anyone: the mapping neither blocks nor grants and the cluster
// query neither blocks nor answers; each failure stands at the next call
// (never "no match" or "not listed").  Each row runs in a child process under an alarm, so a call that
// blocks or spins fails its row instead of stalling the suite.
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include "harness.h"
#include "oxidm.h"
#include "oxmpm_principal.h"
#include "oxseclib_msg.h"

namespace {

const struct Row {
    const char *label;
    int (*make)(const char *path);
    int node_msgno;  // what a cluster query reports for such a node file (0: nothing)
} kRows[] = {
    {"FIFO", [](const char *p) { return mkfifo(p, 0644); }, idm::kMsg693},
    {"directory", [](const char *p) { return mkdir(p, 0755); }, idm::kMsg693},
    {"link to /dev/zero", [](const char *p) { return symlink("/dev/zero", p); }, idm::kMsg693},
    {"link to nothing", [](const char *p) { return symlink("/nowhere", p); }, idm::kMsg693},
    // Kernel files: regular, of size 0, which the node file load takes for empty.
    {"a read error", [](const char *p) { return symlink("/proc/self/mem", p); }, 0},  // EIO
    {"a file that never ends", [](const char *p) { return symlink("/proc/self/pagemap", p); }, 0},
};

void probe(void *arg) {
    const Row &row = *static_cast<const Row *>(arg);
    alarm(5);
    for (int call = 0; call < 2; ++call) {
        cux_clear_error();
        idm_buffer local{};
        const int32_t status = sec_idm_map_identity("princ", "alice@EX", &local);
        const bool granted = local.value != nullptr;
        std::free(local.value);
        if (granted || status != IDM_E_INTERNAL || cux_error_msgno() != idm::kMsg655) _exit(1 + call);
        cux_clear_error();
        const int32_t answer = sec_is_in_any_cluster("node1");
        if (answer != -1 || cux_error_msgno() != row.node_msgno) _exit(3 + call);
    }
    _exit(0);
}

class FileKinds : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        ASSERT_EQ(oxmpm_principal_register(), 0);
    }
};

TEST_F(FileKinds, NoCallBlocksOrAnswersOnAPathThatIsNoRegularFile) {
    for (const Row &row : kRows) {
        SCOPED_TRACE(row.label);
        oxtest::fresh_config_dirs();
        oxtest::write_file(oxtest::kVarGlobalMap, "princ:*@EX=granted\n");
        ASSERT_EQ(row.make(oxtest::kLocalMap), 0);
        ASSERT_EQ(row.make(oxtest::kNodeInfo), 0);
        EXPECT_EQ(oxtest::run_in_child(probe, const_cast<Row *>(&row)), 0) << "128+14: it did not return";
    }
}

}  // namespace
