// End to end through libox_idm.so with the two sample plug-ins and real map
// files: each identity's answer on the first call (rules translated) and on the
// second (rules from the cache).
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "harness.h"
#include "oxidm.h"
#include "oxmpm_host.h"
#include "oxmpm_principal.h"

namespace {

struct Answer { const char *mnemonic, *identity; int32_t status; const char *name; };

void expect_answers(std::initializer_list<Answer> answers) {
    for (int round = 1; round <= 2; ++round)
        for (const Answer &a : answers) {
            idm_buffer local{};
            EXPECT_EQ(sec_idm_map_identity(a.mnemonic, a.identity, &local), a.status) << a.identity << round;
            EXPECT_EQ(local.value != nullptr ? local.value : "", std::string(a.name)) << a.identity << round;
            EXPECT_EQ(local.length, local.value ? std::strlen(local.value) + 1 : 0);
            std::free(local.value);
        }
}

TEST(MappingPlugins, HostAndPrincipalIdentities) {
    OXTEST_REQUIRE_NAMESPACE();
    // Ids past the plug-ins' small per-thread block are translated on the heap.
    const std::string long_user(250, 'u'), long_host = long_user + "@node1", long_princ = long_user + "@EXAMPLE.ORG";
    ASSERT_EQ(oxmpm_host_register() + oxmpm_principal_register(), 0);
    oxtest::write_file(oxtest::kLocalMap,
                       "host:!mallory@*\nhost:alice@node1=alice\nhost:not-an-identity=x\nhost:*@node1=*\n"
                       "host:*@*.Example.ORG=guest\nhost:root@*=admin\n"
                       "princ:a/b/c@EXAMPLE.ORG=x\nprinc:joe@EXAMPLE.ORG=joe\nprinc:!*/root@*\n"
                       "princ:*/admin@EXAMPLE.ORG=root\nprinc:joe/*@EXAMPLE.ORG=*\n"
                       "princ:*/*@EXAMPLE.ORG=*\nprinc:*@EXAMPLE.ORG=*\nprinc:*@*.EXAMPLE.ORG=guest\n",
                       1'000'000);
    oxtest::write_file(oxtest::kVarGlobalMap, "host:*=nobody\n", 1'000'000);
    expect_answers({
        {"host", "alice@node1", 0, "alice"},  {"host", "bob@NODE1", 0, "bob"},  // host names are folded
        {"host", "Bob@node1", 0, "Bob"},      {"host", "mallory@node1", 0, ""},  // the denial comes first
        {"host", "carol@web.example.org", 0, "guest"}, {"host", "root@db", 0, "admin"},
        {"host", "dave@elsewhere", 0, "nobody"},       {"host", "a@b@c", IDM_E_RULE, ""},
        {"host", "@node1", IDM_E_RULE, ""},            {"host", "alice@", IDM_E_RULE, ""},
        {"host", "*", 0, "nobody"},                    {"host", long_host.c_str(), 0, long_user.c_str()},
        {"princ", "joe@EXAMPLE.ORG", 0, "joe"},        {"princ", "amy/root@EXAMPLE.ORG", 0, ""},
        {"princ", "amy/admin@EXAMPLE.ORG", 0, "root"}, {"princ", "joe/web@EXAMPLE.ORG", 0, "web"},
        {"princ", "ann@EXAMPLE.ORG", 0, "ann"},        {"princ", "ann@DEV.EXAMPLE.ORG", 0, "guest"},
        {"princ", "ann@example.org", 0, ""},           // realms are case-sensitive
        {"princ", "amy/web@EXAMPLE.ORG", 0, ""},       // two tokens could name the user: unusable
        {"princ", "no-realm", IDM_E_RULE, ""},         {"princ", "/root@EXAMPLE.ORG", IDM_E_RULE, ""},
        {"princ", "joe/@EXAMPLE.ORG", IDM_E_RULE, ""}, {"princ", "a/b/c@EXAMPLE.ORG", IDM_E_RULE, ""},
        {"princ", "joe@", IDM_E_RULE, ""},             {"princ", "joe@A@EXAMPLE.ORG", IDM_E_RULE, ""},
        {"princ", "ann@X/Y.EXAMPLE.ORG", 0, "guest"},  // a realm may hold a '/'
        {"princ", long_princ.c_str(), 0, long_user.c_str()},
    });
}

// The plug-ins read an id sixteen bytes at a time: one that ends just before
// an inaccessible page must be read up to its NUL and no further (fourteen
// characters: its first block would end one byte past the page).
TEST(MappingPlugins, IdsEndingAtAPageBoundary) {
    OXTEST_REQUIRE_NAMESPACE();
    ASSERT_EQ(oxmpm_host_register() + oxmpm_principal_register(), 0);
    oxtest::write_file(oxtest::kLocalMap, "host:alice@node1234=alice\nprinc:jo@EXAMPLE.ORG=joe\n");
    const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    auto *pages = static_cast<char *>(mmap(nullptr, 2 * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
    ASSERT_NE(pages, MAP_FAILED);
    ASSERT_EQ(mprotect(pages + page, page, PROT_NONE), 0);
    for (const char *id : {"alice@node1234", "jo@EXAMPLE.ORG"}) {
        char *at_end = pages + page - std::strlen(id) - 1;
        std::memcpy(at_end, id, std::strlen(id) + 1);
        idm_buffer local{};
        EXPECT_EQ(sec_idm_map_identity(id[0] == 'a' ? "host" : "princ", at_end, &local), 0) << id;
        EXPECT_STREQ(local.value, id[0] == 'a' ? "alice" : "joe");
        std::free(local.value);
    }
    munmap(pages, 2 * page);
}

}  // namespace
