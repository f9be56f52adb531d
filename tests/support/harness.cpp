#include "harness.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <fstream>

namespace oxtest {

void write_file(const std::string &path, const std::string &content, int64_t mtime) {
    // The file gets its time before it takes the path, as a careful writer
    // does: a reader never sees the new version change under it.
    const std::string tmp = path + ".tmp";
    std::ofstream(tmp, std::ios::binary | std::ios::trunc) << content;
    if (mtime >= 0) set_mtime(tmp, mtime);
    if (std::rename(tmp.c_str(), path.c_str()) != 0) ADD_FAILURE() << "cannot write " << path;
}

void set_mtime(const std::string &path, int64_t mtime) {
    const struct timespec times[2] = {{mtime, 0}, {mtime, 0}};
    if (utimensat(AT_FDCWD, path.c_str(), times, 0) != 0) ADD_FAILURE() << "utimensat " << path;
}

void remove_file(const std::string &path) { unlink(path.c_str()); }

Error last_error() {
    Error e{cux_error_status(), cux_error_msgno(), {}};
    for (int i = 1; i <= cux_error_insert_count(); ++i) e.inserts.emplace_back(cux_error_insert(i));
    return e;
}

::testing::AssertionResult reported(int status, int msgno, const std::vector<std::string> &inserts) {
    if (!cux_error_pending()) return ::testing::AssertionFailure() << "no error reported";
    const Error e = last_error();
    if (e.status != status || e.msgno != msgno || e.inserts != inserts)
        return ::testing::AssertionFailure() << "reported status " << e.status << " message " << e.msgno << " inserts "
                                             << ::testing::PrintToString(e.inserts) << "; expected " << status
                                             << " " << msgno << " " << ::testing::PrintToString(inserts);
    if (std::strcmp(cux_error_catalog(), "oxseclib.cat") != 0 || cux_error_set() != 1 || cux_error_reserved() != 0)
        return ::testing::AssertionFailure() << "catalogue/set/reserved arguments wrong";
    return ::testing::AssertionSuccess();
}

static unsigned long g_error_mark = 0;

void clear_errors() {
    cux_clear_error();
    g_error_mark = cux_error_count();
}

unsigned long reports_since_clear() { return cux_error_count() - g_error_mark; }

static ::testing::AssertionResult nothing_but(int status, int msgno) {
    if (cux_error_count() == g_error_mark) return ::testing::AssertionSuccess();
    const Error e = last_error();
    if (e.status == status && e.msgno == msgno) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure() << "unexpected report: status " << e.status << " message " << e.msgno;
}
::testing::AssertionResult nothing_reported() { return nothing_but(-1, -1); }
::testing::AssertionResult nothing_but_list_ends() { return nothing_but(21, 315); }

int32_t TraceRecord::i32(size_t j) const {
    int32_t v = 0;
    if (j < items.size() && items[j].size() == sizeof v) std::memcpy(&v, items[j].data(), sizeof v);
    return v;
}
std::string TraceRecord::text(size_t j) const {
    if (j >= items.size() || items[j].empty() || items[j].back() != '\0') return "<not a text>";
    return items[j].substr(0, items[j].size() - 1);
}

std::vector<TraceRecord> trace_records() {
    std::vector<TraceRecord> out;
    int n = 0;
    for (TraceRecord r{}; trx_record(out.size(), &r.id, &r.kind, &n) == 0; r = {}) {
        for (int j = 0; j < n; ++j) {
            size_t len = 0;
            const void *p = trx_item(out.size(), j, &len);
            r.items.emplace_back(static_cast<const char *>(p), len);
        }
        out.push_back(std::move(r));
    }
    return out;
}

void set_trace_levels(unsigned char error, unsigned char api, unsigned char mapping, unsigned char milestone,
                      unsigned char diag) {
    const unsigned char levels[5] = {error, api, mapping, milestone, diag};
    for (int i = 0; i < 5; ++i) trx_set_level("_SEI", i, levels[i]);
}

void reset_trace() {
    set_trace_levels(0, 0, 0, 0, 0);
    trx_clear();
}

void Test::SetUp() {
    reset_trace();
    clear_errors();
    mssx_reset();
    mssx_set_lock_wait_ms(200);
    cux_set_clock(0);
    cux_set_active_cluster(nullptr);
    cux_fail_cluster_info(0);
    fresh_config_dirs();
}

void Test::TearDown() {
    reset_trace();
    EXPECT_EQ(mssx_locks_held(), 0) << "a map file lock was left held";
}

int run_in_child(void (*body)(void *), void *arg) {
    fflush(nullptr);
    const pid_t pid = fork();
    if (pid == 0) {
        body(arg);
        _exit(0);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

}  // namespace oxtest
