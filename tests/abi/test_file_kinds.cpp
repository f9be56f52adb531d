// What stands at a configured path that is not a regular file, through the
// shipped library: a mapping whose local map file is such a path, with a
// global file that would grant anyone, and cluster queries whose node file
// and active cluster file are such paths.  Each call runs in a child process
// under an alarm, so a call that blocks or spins fails its row instead of
// stalling the suite; none grants, and the failure stands at the next call.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "harness.h"
#include "oxidm.h"
#include "oxmpm_principal.h"

namespace {

constexpr int kMsg653 = 274;  // map file not accessible
constexpr int kMsg655 = 276;  // internal failure (a file that cannot be read)
constexpr int kMsg693 = 318;  // node file cannot be read
constexpr char kActiveCluster[] = "/var/ox/cfg/active_cluster";  // read by libox_cu

enum Kind { kFifo, kDevice, kDirectory, kLinkToFifo, kLinkToDevice, kDanglingLink, kUnreadable, kReadError, kEndless };

// Makes `path` the kind of thing a row names; false when this system cannot.
bool make(Kind kind, const std::string &path) {
    const std::string other = path + ".target";
    auto link = [&](const std::string &to) { return symlink(to.c_str(), path.c_str()) == 0; };
    switch (kind) {
    case kFifo: return mkfifo(path.c_str(), 0644) == 0;
    case kDevice: return mknod(path.c_str(), S_IFCHR | 0644, makedev(1, 5)) == 0;  // like /dev/zero
    case kDirectory: return mkdir(path.c_str(), 0755) == 0;
    case kLinkToFifo: return make(kFifo, other) && link(other);
    case kLinkToDevice: return link("/dev/zero");
    case kDanglingLink: return link(other);
    case kReadError: return link("/proc/self/mem");    // reads fail with EIO
    case kEndless: return link("/proc/self/pagemap");  // size 0, never ends
    case kUnreadable:
        oxtest::write_file(path, path == oxtest::kNodeInfo ? "NODE:\nNAME: hosta\nCLUSTER: c\n" : "princ:!*@EX\n");
        return chmod(path.c_str(), 0) == 0;
    }
    return false;
}

const struct Row {
    const char *label;
    Kind kind;
    int32_t map_status;  // the mapping's status (nothing granted)
    int map_msgno;
    int node_msgno;      // the cluster query answers -1 with this report (0: none)
} kRows[] = {
    {"FIFO", kFifo, 23, kMsg655, kMsg693},
    {"character device", kDevice, 23, kMsg655, kMsg693},
    {"directory", kDirectory, 23, kMsg655, kMsg693},
    {"link to a FIFO", kLinkToFifo, 23, kMsg655, kMsg693},
    {"link to /dev/zero", kLinkToDevice, 23, kMsg655, kMsg693},
    {"link to nothing", kDanglingLink, 23, kMsg655, kMsg693},
    {"mode 000, caller not root", kUnreadable, 36, kMsg653, kMsg693},
    // Kernel files: regular, of size 0, which the node file takes for empty.
    {"a read error", kReadError, 23, kMsg655, 0},
    {"a file that never ends", kEndless, 23, kMsg655, 0},
};

// Child: the calls under a watchdog; exit 0 when the row's answers came back.
struct Probe {
    const Row *row;
    bool node;
};
void probe(void *arg) {
    const Probe &p = *static_cast<Probe *>(arg);
    alarm(5);
    if (p.row->kind == kUnreadable && setresuid(65534, 65534, 65534) != 0) _exit(3);
    cux_clear_error();
    if (p.node) {
        if (sec_is_in_any_cluster("hosta") != -1 || cux_error_msgno() != p.row->node_msgno) _exit(1);
        _exit(sec_is_in_active_cluster("hosta") == -1 ? 0 : 2);
    }
    for (int call = 0; call < 2; ++call) {  // a failure never becomes "no match"
        cux_clear_error();
        idm_buffer local{};
        const int32_t status = sec_idm_map_identity("princ", "alice@EX", &local);
        const bool granted = local.value != nullptr;
        std::free(local.value);
        if (granted || status != p.row->map_status || cux_error_msgno() != p.row->map_msgno) _exit(1 + call);
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

TEST_F(FileKinds, NoCallBlocksOrGrantsOnAPathThatIsNoRegularFile) {
    for (const Row &row : kRows) {
        SCOPED_TRACE(row.label);
        if (row.kind == kUnreadable && getuid() != 0) continue;  // needs a uid to drop to
        oxtest::fresh_config_dirs();
        oxtest::write_file(oxtest::kVarGlobalMap, "princ:*@EX=granted\n");
        ASSERT_TRUE(make(row.kind, oxtest::kLocalMap) && make(row.kind, oxtest::kNodeInfo) &&
                    make(row.kind, kActiveCluster));
        for (bool node : {false, true}) {
            Probe p{&row, node};
            EXPECT_EQ(oxtest::run_in_child(probe, &p), 0)
                << (node ? "cluster query" : "mapping") << " (128+14: it did not return)";
        }
    }
}

// A file rewritten in place, read between the writer's two writes: the cut
// last line is never acted on, and the whole file is read at the next call.
TEST_F(FileKinds, ACutLastLineIsNeverActedOn) {
    auto map = [] {
        idm_buffer local{};
        const int32_t status = sec_idm_map_identity("princ", "alice@EX", &local);
        std::string name = status == 0 && local.value != nullptr ? local.value : "-";
        std::free(local.value);
        return name;
    };
    const std::string rule = "princ:*@EX=rootless\n", node = "NODE:\nCLUSTER: c\nNAME: hostabc\n";
    const struct {
        const char *path;
        const std::string &text;
        size_t cut;  // where the first write ends
    } cases[] = {{oxtest::kLocalMap, rule, rule.find("=root") + 5}, {oxtest::kNodeInfo, node, node.find("hosta") + 5}};
    oxtest::write_file(oxtest::kLocalMap, "princ:*@EX=before\n", 1000);
    oxtest::write_file(oxtest::kNodeInfo, "NODE:\nNAME: before\nCLUSTER: c\n", 1000);
    ASSERT_EQ(map(), "before");
    ASSERT_EQ(sec_is_in_any_cluster("before"), 1);
    for (const auto &c : cases) {
        const int fd = open(c.path, O_WRONLY | O_TRUNC | O_CLOEXEC);
        ASSERT_EQ(write(fd, c.text.data(), c.cut), static_cast<ssize_t>(c.cut));
        if (c.path == cases[0].path) {
            EXPECT_NE(map(), "root");
        } else {
            EXPECT_EQ(sec_is_in_any_cluster("hosta"), -1);
            EXPECT_EQ(sec_is_in_any_cluster("before"), 1) << "the previous trees stand";
        }
        const size_t rest = c.text.size() - c.cut;
        ASSERT_EQ(write(fd, c.text.data() + c.cut, rest), static_cast<ssize_t>(rest));
        close(fd);
    }
    EXPECT_EQ(map(), "rootless");
    EXPECT_EQ(sec_is_in_any_cluster("hostabc"), 1);
    EXPECT_EQ(sec_is_in_any_cluster("hosta"), -1);
}

}  // namespace
