// Files rewritten while the library reads them: version v of a file, renamed
// into place with its own modification time, and the checks that what one
// answer was built from carries one version.
#ifndef OXIDM_TEST_VERSIONED_FILE_H
#define OXIDM_TEST_VERSIONED_FILE_H

#include <cstdio>
#include <cstdlib>
#include <string>

#include "harness.h"
#include "oxidm_clmap.h"
#include "test_mpm.h"

namespace vfile {

// Writes `text` as version v of `path`: whole, modified at time 1000 + v.
inline void write(const std::string &path, const std::string &text, int v) { oxtest::write_file(path, text, 1000 + v); }

// The versions seen by one answer: one, or a mixture.
struct OneVersion {
    long version = -1;
    bool mixed = false;
    void saw(long v) { mixed |= version != -1 && v != version, version = v; }
};

// Node information version v: hosts h0..h9 with addresses 10.0.0.0..9, each
// in clusters "v<v>" and one letter, "a" to "g" by v % 7.  All versions have the same length, so
// a load that stats one version and reads the next still reads it whole.
inline std::string node_text(int v) {
    char line[128];
    std::string t;
    for (int h = 0; h < 10; ++h)
        t.append(line, std::snprintf(line, sizeof line, "NODE:\nNAME: h%d\nADDRESS: 10.0.0.%d\nCLUSTER: v%07d %c\n", h, h, v, 'a' + v % 7));
    return t;
}

// Under a read share of idmutex: the clusters of `key` in the trees ("" for
// none), and the version of node_text() that all hosts and addresses of both
// trees come from: -1 for empty trees, -2 for partial trees or a mixture.
inline std::string clusters_of(const std::string &key) {
    idm_clnode probe{const_cast<char *>(key.c_str()), nullptr, 0};
    void *item = &probe;
    if (sec__rst_find(key[0] == 'h' ? &nametree : &iptree, &item) != 1) return "";
    const auto *n = static_cast<const idm_clnode *>(item);
    return n->count == 2 ? std::string(n->clusters[0]) + " " + n->clusters[1] : "?";
}
inline int tree_version() {
    if (nametree.rst_node_cnt == 0 && iptree.rst_node_cnt == 0) return -1;
    const std::string first = clusters_of("h0");
    const int v = first[0] == 'v' ? std::atoi(first.c_str() + 1) : -2;
    char want[32];
    std::snprintf(want, sizeof want, "v%07d %c", v, char('a' + v % 7));
    for (int h = 0; h < 20; ++h)
        if (clusters_of(oxtest::num(h < 10 ? "h" : "10.0.0.", h % 10)) != want) return -2;
    return nametree.rst_node_cnt == 10 && iptree.rst_node_cnt == 10 ? v : -2;
}

}  // namespace vfile

#endif
