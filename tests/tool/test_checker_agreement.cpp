// The checkers of `oxidm check` against the library itself, on texts built
// from tables of fragments: the map file entries the checker predicts are
// the entries the library's parser makes, in order, and the lines it calls
// invalid are those the parser ignores as invalid; a node information text
// the checker accepts loads, every host answering as the checker's host
// table says, and one it rejects fails to load with 2650-690.
#include <arpa/inet.h>

#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm.h"
#include "oxidm_check.h"
#include "oxidm_natfile.h"
#include "oxidm_natmap.h"

namespace {

namespace check = oxidm_tool::check;
using Texts = std::vector<std::string>;

// Every selector with every rule body (and one of the leading blanks in
// turn), in files of 25 lines; the last file ends without a LF.
Texts map_files() {
    const Texts blanks = {"", " ", "\t", " \t "}, selectors = {"host:", "hostx:", "HOST:", "host :", ":", "kerb:", "host", "# host:"};
    const Texts bodies = {"a@n1=b", "*@n1 = x", " bob@*.org\t=\troot extra # c", "!a@n1", "! a@n1 trailing", "!", "!x=y", "=b",
                          "a=", "a =  ", "a junk=b", "a#b=c", "al=ice=x", "a\r=b\r", "**@n=*", "", "c:d=e!f", std::string("a=b\0c", 5)};
    Texts files;
    size_t n = 0;
    for (const std::string &s : selectors)
        for (const std::string &b : bodies) {
            if (n % 25 == 0) files.emplace_back();
            files.back() += blanks[n++ % blanks.size()] + s + b + "\n";
        }
    files.back() += std::string(1500, 'z') + "host:w@long=w";
    return files;
}

// An entry as one text: "!network=" or "network=local".
std::string entry(bool denial, const std::string &network, const char *local) {
    return (denial ? "!" : "") + network + "=" + (local != nullptr ? local : "");
}

class CheckerAgreement : public oxtest::Test {};

TEST_F(CheckerAgreement, MapFileEntriesAndInvalidLinesAreTheParsers) {
    const std::string path = "/tmp/oxidm-agreement.map";
    size_t entries = 0, invalid = 0;
    for (const std::string &text : map_files()) {
        oxtest::write_file(path, text);
        for (const std::string mech : {"host", "hostx", "kerb"}) {
            SCOPED_TRACE("mechanism " + mech + ", file:\n" + text);
            oxtest::set_trace_levels(0, 0, 0, 0, 1);  // Diag 56: a line ignored as invalid
            FILE *f = std::fopen(path.c_str(), "re");
            int32_t count = 0;
            idm_mapfile_entry *got = nullptr;
            ASSERT_EQ(idm__parse_mapfile(mech.c_str(), path.c_str(), f, &count, &got), 0);
            std::fclose(f);
            const std::vector<int> ids = oxtest::trace_ids();
            const size_t lib_invalid = std::count(ids.begin(), ids.end(), 56);
            oxtest::reset_trace();
            Texts lib, checker, all;
            for (int32_t i = 0; i < count; ++i)
                lib.push_back(entry(got[i].kind == IDM_ENTRY_DENIAL, got[i].network_id, got[i].local_id));
            idm__native_release_entry_list(count, got);
            const check::MapfileReport r = check::check_mapfile_text(text, &mech);
            for (const check::MapEntry &e : r.entries)
                checker.push_back(entry(e.kind == check::EntryKind::kDenial, e.network_id, e.local_id.c_str()));
            EXPECT_EQ(checker, lib);
            EXPECT_EQ(r.errors(), lib_invalid);
            // Judged without --mech, the mechanism's own lines give the same entries.
            for (const check::MapEntry &e : check::check_mapfile_text(text, nullptr).entries)
                if (e.mechanism == mech) all.push_back(entry(e.kind == check::EntryKind::kDenial, e.network_id, e.local_id.c_str()));
            EXPECT_EQ(all, lib);
            entries += lib.size();
            invalid += lib_invalid;
        }
    }
    EXPECT_GE(entries, 10u);  // both verdicts are exercised
    EXPECT_GE(invalid, 6u);
}

bool is_address(const std::string &host) {
    unsigned char buf[16];
    return inet_pton(AF_INET, host.c_str(), buf) == 1 || inet_pton(AF_INET6, host.c_str(), buf) == 1;
}

// Every pair of record fragments, valid and not, as one file.
TEST_F(CheckerAgreement, NodeInformationLoadsAndAnswersAsTheCheckerSays) {
    OXTEST_REQUIRE_NAMESPACE();
    const Texts records = {
        "NODE:\n  NAME: h0 h1\n  ADDRESS: 10.0.0.1 fd00::1\n  CLUSTER: c0 c1\n", "node: name: h2\ncluster: c2 C0\n",
        "Nodes:\nNAMES =: H0  10.0.0.9\nCLUSTER: c1 # old\n", "NODE:\nADDRESS: 10.0.0.2 fd00:0::1 \r\nCLUSTER: c3\n",
        "# comment NODE:\n\n \t\nNODE :\nNAME: h0\nCLUSTER: c9\n", "NODE:\nNAME: h3\nCLUSTER:\nCLUSTER: c0\n",
        "NODE:\nNAME: h4\n", "NODE:\nNAME: h4\nNAME: extra\nCLUSTER: c0\n", "bogus\n", "NODE\nNAME: h4\nCLUSTER: c0\n",
        "NODE:\nCLUSTER c1\n", "NODE:\nADDRESS 10.0.0.3\nCLUSTER: c0\n", "NODE:\n"};
    const Texts hosts = {"h0", "h1", "h2", "h3", "h4", "H0", "10.0.0.9", "10.0.0.1", "10.0.0.2", "10.0.0.3",
                         "fd00::1", "fd00:0::1", "#", "old", "extra", ""};
    const Texts clusters = {"c0", "c1", "c2", "C0", "c3", "c9"};
    size_t loaded = 0, rejected = 0, mtime = 1000;
    for (const std::string &a : records)
        for (const std::string &b : records) {
            const std::string text = a + b;
            SCOPED_TRACE(text);
            oxtest::write_file(oxtest::kNodeInfo, text, static_cast<int64_t>(mtime += 10));
            const check::NodeinfoReport r = check::check_nodeinfo_text(text);
            oxtest::clear_errors();
            cux_set_active_cluster(nullptr);
            const int32_t first = sec_is_in_any_cluster("h0");
            if (!r.loads) {
                ++rejected;
                EXPECT_EQ(first, -1);
                EXPECT_EQ(cux_error_msgno(), 315) << "the checker rejects, the library loaded";
                EXPECT_GT(r.errors(), 0u);
                continue;
            }
            ++loaded;
            EXPECT_TRUE(oxtest::nothing_but_list_ends()) << "the checker accepts, the library reported";
            for (const std::string &host : hosts) {
                const check::NodeHost *want = nullptr;
                for (const check::NodeHost &h : r.hosts)
                    if (h.key == host && h.address == is_address(host)) want = &h;
                EXPECT_EQ(sec_is_in_any_cluster(host.c_str()), want ? 1 : -1) << host;
                for (const std::string &c : clusters) {
                    cux_set_active_cluster(c.c_str());
                    const bool in = want && std::count(want->clusters.begin(), want->clusters.end(), c);
                    EXPECT_EQ(sec_is_in_active_cluster(host.c_str()), want ? in : -1) << host << " in " << c;
                }
                cux_set_active_cluster(nullptr);
            }
        }
    EXPECT_GT(loaded, 20u);
    EXPECT_GT(rejected, 20u);
}

// Every text over {a, b} (or {a, b, *}) of 1 to `max` characters.
Texts texts(size_t max, const std::string &alphabet) {
    Texts out, frontier{""};
    for (size_t len = 1; len <= max; ++len) {
        Texts next;
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
    Texts patterns;
    for (const std::string &t : texts(4, "ab*"))
        if (std::count(t.begin(), t.end(), '*') <= 1) patterns.push_back(t);
    const Texts literal = texts(6, "ab");
    size_t covering = 0;
    for (const std::string &p : patterns) {
        for (const std::string &t : literal)
            ASSERT_EQ(check::wildcard_match(p, t), idm::wildcard_match(p.c_str(), t.c_str())) << p << " on " << t;
        for (const std::string &inner : patterns) {
            if (!check::field_covers(p, inner)) continue;
            ++covering;
            for (const std::string &t : literal)
                ASSERT_TRUE(!idm::wildcard_match(inner.c_str(), t.c_str()) || idm::wildcard_match(p.c_str(), t.c_str()))
                    << p << " said to cover " << inner << ", but " << t << " escapes it";
        }
    }
    EXPECT_GT(covering, patterns.size());  // more than the identities
}

}  // namespace
