// The checkers of `oxidm check` against the library itself, on generated
// files: every map file entry the checker predicts is the entry the
// library's parser makes, in the same order, and every line it calls
// invalid is one the parser ignores as invalid; every node information text
// the checker accepts loads, with each host answering as the checker's host
// table says, and every text it rejects fails to load with 2650-690.
#include <arpa/inet.h>

#include <algorithm>
#include <cstdio>
#include <random>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm.h"
#include "oxidm_check.h"
#include "oxidm_natfile.h"
#include "oxidm_natmap.h"

namespace {

using oxidm_tool::check::EntryKind;
using oxidm_tool::check::MapEntry;

constexpr int kFiles = 220;
constexpr int kLinesPerFile = 50;  // 11,000 lines of each kind in all

class Gen {
  public:
    explicit Gen(unsigned seed) : rng_(seed) {}
    int pick(int n) { return std::uniform_int_distribution<int>(0, n - 1)(rng_); }
    bool chance(int percent) { return pick(100) < percent; }
    template <class T>
    const T &one(const std::vector<T> &v) { return v[static_cast<size_t>(pick(static_cast<int>(v.size())))]; }

    std::string blanks() {
        static const std::vector<std::string> k = {"", "", "", " ", "  ", "\t", " \t "};
        return one(k);
    }
    std::string ident() {
        static const std::vector<std::string> k = {"alice@node1", "*@node1", "bob@*.example.org", "*", "root@*",
                                                   "a*b@n", "x", "al=ice", "a!b", "c:d", "e#f", "**@n", "A@B"};
        std::string s = one(k);
        if (chance(5)) s += "\r";
        return s;
    }
    std::string map_line() {
        static const std::vector<std::string> mechs = {"host", "host", "host", "hostx", "HOST", "ho", "kerb", ""};
        std::string line = blanks();
        int sel = pick(20);
        if (sel == 0) line += "host ";       // blank before the colon
        else if (sel != 1) line += one(mechs);  // 1: no selector text at all
        if (!chance(4)) line += ":";
        line += blanks();
        switch (pick(9)) {
            case 0: line += "!" + blanks() + ident() + (chance(30) ? " trailing" : ""); break;
            case 1: line += "!" + blanks() + (chance(50) ? "x=y" : ""); break;
            case 2: line += "=" + ident(); break;
            case 3: line += ident() + blanks() + "="; break;
            case 4: line += ident() + blanks() + "=" + blanks(); break;
            case 5: line += ident() + " junk=" + ident(); break;
            default: line += ident() + blanks() + "=" + blanks() + ident() + (chance(20) ? " extra # c" : ""); break;
        }
        if (chance(3)) line.insert(static_cast<size_t>(pick(static_cast<int>(line.size()) + 1)), "#");
        if (chance(1)) line.insert(static_cast<size_t>(pick(static_cast<int>(line.size()) + 1)), std::string(1, '\0'));
        if (chance(2)) line = "# " + line;
        if (chance(2)) line = "";
        if (chance(1)) line += std::string(static_cast<size_t>(1000 + pick(1200)), 'z') + "host:w@long=w";
        return line;
    }
    std::string map_file() {
        std::string text;
        for (int i = 0; i < kLinesPerFile; ++i) text += map_line() + (i + 1 < kLinesPerFile || chance(70) ? "\n" : "");
        return text;
    }

    std::string node_file(bool &meant_valid) {
        static const std::vector<std::string> names = {"h0", "h1", "h2", "h3", "H0", "10.0.0.9", "h4"};
        static const std::vector<std::string> addrs = {"10.0.0.1", "10.0.0.2", "fd00::1", "fd00:0::1", "10.0.0.3"};
        static const std::vector<std::string> clusters = {"c0", "c1", "c2", "C0", "c3"};
        meant_valid = chance(60);
        std::string text;
        int lines = 0;
        auto add = [&](const std::string &l) {
            text += l + "\n";
            ++lines;
        };
        auto list = [&](const std::vector<std::string> &from) {
            std::string s;
            int n = 1 + pick(3);
            for (int i = 0; i < n; ++i) s += (i ? std::string(1 + pick(2), ' ') : "") + one(from);
            if (chance(10)) s += " \r";
            return s;
        };
        while (lines < kLinesPerFile) {
            int r = pick(12);
            if (r == 0) add("# comment " + list(names));
            else if (r == 1) add(blanks());
            else {
                bool inline_name = chance(15);
                add(blanks() + one(std::vector<std::string>{"NODE:", "node:", "Nodes:", "NODE :"}) +
                    (inline_name ? " NAME: " + list(names) : ""));
                if (!inline_name && chance(80)) {
                    std::string kw = one(std::vector<std::string>{"NAME:", "name:", "NAMES =:"});
                    add(blanks() + kw + " " + list(names));
                }
                if (chance(60)) add("ADDRESS: " + list(addrs));
                if (chance(10)) add("CLUSTER:");
                add(one(std::vector<std::string>{"CLUSTER:", "cluster:", "Clusters:"}) + " " + list(clusters) +
                    (chance(5) ? " # old" : ""));
            }
            if (!meant_valid && chance(8)) {
                static const std::vector<std::string> faults = {"bogus", "NAME: extra", "NODE", "CLUSTER c1",
                                                                "ADDRESS 10.0.0.1", "NODE:"};
                add(one(faults));
            }
        }
        return text;
    }

  private:
    std::mt19937 rng_;
};

struct LibEntry {
    EntryKind kind;
    std::string network_id, local_id;
};

std::vector<LibEntry> library_parse(const std::string &mech, const std::string &path) {
    FILE *f = std::fopen(path.c_str(), "re");
    EXPECT_NE(f, nullptr);
    int32_t count = 0;
    idm_mapfile_entry *entries = nullptr;
    EXPECT_EQ(idm__parse_mapfile(mech.c_str(), path.c_str(), f, &count, &entries), 0);
    std::fclose(f);
    std::vector<LibEntry> out;
    for (int32_t i = 0; i < count; ++i)
        out.push_back({entries[i].kind == IDM_ENTRY_DENIAL ? EntryKind::kDenial : EntryKind::kAffirmative,
                       entries[i].network_id, entries[i].local_id ? entries[i].local_id : ""});
    idm__native_release_entry_list(count, entries);
    return out;
}

class CheckerAgreement : public oxtest::Test {};

TEST_F(CheckerAgreement, MapFileEntriesAndInvalidLinesAreTheParsers) {
    Gen gen(20261123);
    const std::string path = "/tmp/oxidm-agreement.map";
    size_t lines = 0, entries = 0, invalid = 0;
    for (int file = 0; file < kFiles; ++file) {
        std::string text = gen.map_file();
        oxtest::write_file(path, text);
        for (const std::string mech : {"host", "hostx", "kerb"}) {
            oxtest::set_trace_levels(0, 0, 0, 0, 1);
            std::vector<LibEntry> lib = library_parse(mech, path);
            size_t lib_invalid = 0;
            for (int id : oxtest::trace_ids()) lib_invalid += id == 56;
            oxtest::reset_trace();

            oxidm_tool::check::MapfileReport r = oxidm_tool::check::check_mapfile_text(text, &mech);
            ASSERT_EQ(r.entries.size(), lib.size()) << "file " << file << " mechanism " << mech;
            for (size_t i = 0; i < lib.size(); ++i) {
                EXPECT_EQ(r.entries[i].kind, lib[i].kind) << "file " << file << " entry " << i;
                EXPECT_EQ(r.entries[i].network_id, lib[i].network_id) << "file " << file << " entry " << i;
                EXPECT_EQ(r.entries[i].local_id, lib[i].local_id) << "file " << file << " entry " << i;
            }
            EXPECT_EQ(r.errors(), lib_invalid) << "file " << file << " mechanism " << mech;

            // Judged without --mech, the mechanism's own lines give the same entries.
            oxidm_tool::check::MapfileReport all = oxidm_tool::check::check_mapfile_text(text, nullptr);
            std::vector<MapEntry> mine;
            for (const MapEntry &e : all.entries)
                if (e.mechanism == mech) mine.push_back(e);
            ASSERT_EQ(mine.size(), lib.size()) << "file " << file << " mechanism " << mech << " (all mechanisms)";
            for (size_t i = 0; i < lib.size(); ++i) EXPECT_EQ(mine[i].network_id, lib[i].network_id);
            if (mech == "host") {
                entries += lib.size();
                invalid += lib_invalid;
                lines += r.lines;
            }
        }
    }
    EXPECT_GE(lines, 10000u);
    // The generator must exercise both verdicts.
    EXPECT_GT(entries, 1000u);
    EXPECT_GT(invalid, 200u);
}

bool is_address(const std::string &host) {
    unsigned char buf[16];
    return inet_pton(AF_INET, host.c_str(), buf) == 1 || inet_pton(AF_INET6, host.c_str(), buf) != 0;
}

TEST_F(CheckerAgreement, NodeInformationLoadsAndAnswersAsTheCheckerSays) {
    OXTEST_REQUIRE_NAMESPACE();
    Gen gen(4242);
    const std::vector<std::string> hosts = {"h0", "h1", "h2", "h3", "h4", "H0", "h9", "10.0.0.9", "10.0.0.1",
                                            "10.0.0.2", "10.0.0.3", "fd00::1", "fd00:0::1", "#", "old", ""};
    const std::vector<std::string> clusters = {"c0", "c1", "c2", "C0", "c3", "c9"};
    size_t lines = 0, loaded = 0, rejected = 0;
    for (int file = 0; file < kFiles; ++file) {
        bool meant_valid = false;
        std::string text = gen.node_file(meant_valid);
        oxtest::write_file(oxtest::kNodeInfo, text, 1000000 + file);
        oxidm_tool::check::NodeinfoReport r = oxidm_tool::check::check_nodeinfo_text(text);
        lines += r.lines;
        oxtest::clear_errors();
        cux_set_active_cluster(nullptr);
        int32_t first = sec_is_in_any_cluster("h0");
        if (!r.loads) {
            ++rejected;
            EXPECT_EQ(first, -1) << "file " << file;
            EXPECT_EQ(cux_error_msgno(), 315) << "file " << file << ": checker rejects, library loaded\n" << text;
            EXPECT_GT(r.errors(), 0u);
            continue;
        }
        ++loaded;
        EXPECT_TRUE(oxtest::nothing_but_list_ends()) << "file " << file << ": checker accepts, library reported\n"
                                                << text;
        for (const std::string &host : hosts) {
            const oxidm_tool::check::NodeHost *want = nullptr;
            for (const auto &h : r.hosts)
                if (h.key == host && h.address == is_address(host)) want = &h;
            EXPECT_EQ(sec_is_in_any_cluster(host.c_str()), want ? 1 : -1) << "file " << file << " host " << host;
            if (want == nullptr) continue;
            for (const std::string &c : clusters) {
                cux_set_active_cluster(c.c_str());
                bool in = std::find(want->clusters.begin(), want->clusters.end(), c) != want->clusters.end();
                EXPECT_EQ(sec_is_in_active_cluster(host.c_str()), in ? 1 : 0)
                    << "file " << file << " host " << host << " cluster " << c;
            }
            cux_set_active_cluster(nullptr);
        }
    }
    EXPECT_GE(lines, 10000u);
    EXPECT_GT(loaded, 40u);
    EXPECT_GT(rejected, 40u);
}

// Every text over {a, b} of up to `max` characters, the empty one excluded.
std::vector<std::string> texts(size_t max, const std::string &alphabet) {
    std::vector<std::string> out, frontier{""};
    for (size_t len = 1; len <= max; ++len) {
        std::vector<std::string> next;
        for (const std::string &t : frontier)
            for (char c : alphabet) next.push_back(t + c);
        out.insert(out.end(), next.begin(), next.end());
        frontier = next;
    }
    return out;
}

// The shadowing warnings rest on the checker's copy of the one-wildcard
// match: it must be the library's, and field_covers must never claim a
// pattern covers another that matches a text the first does not.
TEST(CheckerMatch, WildcardMatchIsTheLibrarysAndCoversIsSound) {
    std::vector<std::string> patterns;
    for (const std::string &t : texts(4, "ab*"))
        if (std::count(t.begin(), t.end(), '*') <= 1) patterns.push_back(t);
    std::vector<std::string> literal = texts(6, "ab");
    for (const std::string &p : patterns)
        for (const std::string &t : literal)
            ASSERT_EQ(oxidm_tool::check::wildcard_match(p, t), idm::wildcard_match(p.c_str(), t.c_str()))
                << "pattern " << p << " text " << t;
    size_t covering = 0;
    for (const std::string &outer : patterns)
        for (const std::string &inner : patterns) {
            if (!oxidm_tool::check::field_covers(outer, inner)) continue;
            ++covering;
            for (const std::string &t : literal) {
                if (idm::wildcard_match(inner.c_str(), t.c_str())) {
                    ASSERT_TRUE(idm::wildcard_match(outer.c_str(), t.c_str()))
                        << outer << " said to cover " << inner << ", but " << t << " escapes it";
                }
            }
        }
    EXPECT_GT(covering, patterns.size());  // more than the identities
}

}  // namespace
