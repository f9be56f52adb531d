// End to end through libox_idm.so with the two sample plug-ins and real map
// files: each identity's answer on the first call (rules translated) and on
// the second (rules from the cache), denials, wildcards, unusable lines and
// identities, and the answers after the files change.
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "harness.h"
#include "oxidm.h"
#include "oxmpm_host.h"
#include "oxmpm_principal.h"

namespace {

constexpr int64_t kOld = 1'000'000;
constexpr int kMsg662 = 283;

struct Answer {
    const char *identity;
    int32_t status;
    const char *name;  // "" for an empty result
};

class MappingPlugins : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        ASSERT_EQ(oxmpm_host_register(), 0);
        ASSERT_EQ(oxmpm_principal_register(), 0);
    }
    static void expect_answers(const char *mnemonic, const std::vector<Answer> &answers) {
        for (int round = 1; round <= 2; ++round)
            for (const Answer &a : answers) {
                idm_buffer local{};
                EXPECT_EQ(sec_idm_map_identity(mnemonic, a.identity, &local), a.status)
                    << a.identity << " round " << round;
                EXPECT_EQ(local.value != nullptr ? std::string(local.value) : std::string(), a.name)
                    << a.identity << " round " << round;
                if (local.value != nullptr) {
                    EXPECT_EQ(local.length, std::strlen(local.value) + 1);
                }
                std::free(local.value);
            }
    }
};

TEST_F(MappingPlugins, HostMechanism) {
    oxtest::write_file(oxtest::kLocalMap,
                       "# host-based identities\n"
                       "host:!mallory@*\n"
                       "host:alice@node1=alice\n"
                       "host:not-an-identity=x\n"  // refused, passed over
                       "host:*@node1=*\n"
                       "princ:*@node1=wrong-mechanism\n"
                       "host:*@*.Example.ORG=guest\n"
                       "host:root@*=admin\n",
                       kOld);
    oxtest::write_file(oxtest::kVarGlobalMap, "host:*=nobody\n", kOld);
    expect_answers("host", {
                               {"alice@node1", 0, "alice"},
                               {"bob@NODE1", 0, "bob"},  // host names are folded
                               {"Bob@node1", 0, "Bob"},  // user names are not
                               {"mallory@node1", 0, ""}, // the denial comes first
                               {"carol@web.example.org", 0, "guest"},
                               {"root@db", 0, "admin"},
                               {"dave@elsewhere", 0, "nobody"},
                               {"no-at-sign", 38, ""},
                               {"a@b@c", 38, ""},
                               {"@node1", 38, ""},
                           });
    // The files change: the new lines apply at once.
    oxtest::write_file(oxtest::kLocalMap, "host:alice@node1=alice2\n", kOld + 10);
    oxtest::remove_file(oxtest::kVarGlobalMap);
    expect_answers("host", {{"alice@node1", 0, "alice2"}, {"dave@elsewhere", 0, ""}});
}

TEST_F(MappingPlugins, PrincipalMechanism) {
    oxtest::write_file(oxtest::kLocalMap,
                       "princ:a/b/c@EXAMPLE.ORG=x\n"  // refused, passed over from then on
                       "princ:joe@EXAMPLE.ORG=joe\n"
                       "princ:!*/root@*\n"
                       "princ:*/admin@EXAMPLE.ORG=root\n"
                       "princ:joe/*@EXAMPLE.ORG=*\n"
                       "princ:*/*@EXAMPLE.ORG=*\n"  // two tokens could name the user: unusable
                       "princ:*@EXAMPLE.ORG=*\n"
                       "princ:*@*.EXAMPLE.ORG=guest\n",
                       kOld);
    expect_answers("princ", {
                                {"joe@EXAMPLE.ORG", 0, "joe"},
                                {"amy/root@EXAMPLE.ORG", 0, ""},
                                {"amy/admin@EXAMPLE.ORG", 0, "root"},
                                {"joe/web@EXAMPLE.ORG", 0, "web"},
                                {"ann@EXAMPLE.ORG", 0, "ann"},
                                {"ann@DEV.EXAMPLE.ORG", 0, "guest"},
                                {"ann@example.org", 0, ""},  // realms are case-sensitive
                                {"amy/web@EXAMPLE.ORG", 0, ""},
                                {"no-realm", 38, ""},
                                {"x/y/z@EXAMPLE.ORG", 38, ""},
                                {"/x@EXAMPLE.ORG", 38, ""},
                                {"x/@EXAMPLE.ORG", 38, ""},
                            });
}

TEST_F(MappingPlugins, UnusableLineIsReportedOnce) {
    oxtest::write_file(oxtest::kLocalMap, "princ:*/*@R=*\n", kOld);
    idm_buffer local{};
    oxtest::clear_errors();
    EXPECT_EQ(sec_idm_map_identity("princ", "a/b@R", &local), 0);
    EXPECT_TRUE(oxtest::reported(38, kMsg662, {}));
    oxtest::clear_errors();
    EXPECT_EQ(sec_idm_map_identity("princ", "a/b@R", &local), 0);
    EXPECT_TRUE(oxtest::nothing_reported()) << "the cached rule is passed over";
    EXPECT_EQ(local.value, nullptr);
}

TEST_F(MappingPlugins, RegistrationStoresTheRoutines) {
    idm_translator_routine t = nullptr;
    idm_cleanup_routine c = nullptr;
    ASSERT_EQ(_sec_idm_get_translator("host", &t, &c), 0);
    EXPECT_EQ(t, &oxmpm_host_translate);
    EXPECT_EQ(c, &oxmpm_host_cleanup);
    ASSERT_EQ(_sec_idm_get_translator("princ", &t, &c), 0);
    EXPECT_EQ(t, &oxmpm_principal_translate);
    EXPECT_EQ(c, &oxmpm_principal_cleanup);
}

// The translators on their own: what they put into the structures.
TEST_F(MappingPlugins, TranslatorsFillRuleAndId) {
    struct Case {
        const char *label;
        idm_translator_routine translate;
        idm_cleanup_routine cleanup;
        const char *entry_id;  // null: no entry
        uint32_t kind;
        const char *local_id;
        const char *identity;
        int32_t status;
        const char *rgy;                   // rule's (or, without entry, the id's) registry
        std::vector<std::string> tokens;   // rule's (or id's) tokens
        const char *mapping;               // null: none
    } cases[] = {
        {"host entry", oxmpm_host_translate, oxmpm_host_cleanup, "*@Node*", IDM_ENTRY_AFFIRMATIVE, "root", "a@b", 0,
         "node*", {"*"}, "root"},
        {"host denial", oxmpm_host_translate, oxmpm_host_cleanup, "eve@x", IDM_ENTRY_DENIAL, nullptr, "a@b", 0, "x",
         {"eve"}, nullptr},
        {"host star alone", oxmpm_host_translate, oxmpm_host_cleanup, "*", IDM_ENTRY_AFFIRMATIVE, "n", "a@b", 0, "*",
         {"*"}, "n"},
        {"host bad identity keeps the rule", oxmpm_host_translate, oxmpm_host_cleanup, "a@b", IDM_ENTRY_AFFIRMATIVE,
         "n", "junk", 38, "b", {"a"}, "n"},
        {"host bad entry", oxmpm_host_translate, oxmpm_host_cleanup, "junk", IDM_ENTRY_AFFIRMATIVE, "n", "a@b", 39,
         nullptr, {}, nullptr},
        {"host id only", oxmpm_host_translate, oxmpm_host_cleanup, nullptr, 0, nullptr, "Ann@Web.Example", 0,
         "web.example", {"Ann"}, nullptr},
        {"princ entry", oxmpm_principal_translate, oxmpm_principal_cleanup, "*/admin@R", IDM_ENTRY_AFFIRMATIVE,
         "root", "a@R", 0, "R", {"*", "admin"}, "root"},
        {"princ id only", oxmpm_principal_translate, oxmpm_principal_cleanup, nullptr, 0, nullptr, "joe/web@R.ORG", 0,
         "R.ORG", {"joe", "web"}, nullptr},
        {"princ bad entry", oxmpm_principal_translate, oxmpm_principal_cleanup, "joe", IDM_ENTRY_AFFIRMATIVE, "n",
         "a@R", 39, nullptr, {}, nullptr},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.label);
        std::string nid = c.entry_id != nullptr ? c.entry_id : "";
        std::string lid = c.local_id != nullptr ? c.local_id : "";
        idm_mapfile_entry entry{};
        entry.kind = c.kind;
        entry.network_id = nid.data();
        entry.local_id = c.local_id != nullptr ? lid.data() : nullptr;
        idm_rule rule{};
        idm_id id{};
        EXPECT_EQ(c.translate(c.entry_id != nullptr ? &entry : nullptr, c.identity, &rule, &id), c.status);
        bool from_rule = c.entry_id != nullptr;
        const char *rgy = from_rule ? rule.rgy : id.rgy;
        int32_t count = from_rule ? rule.token_cnt : id.token_cnt;
        char **tokens = from_rule ? rule.tokens : id.tokens;
        if (c.rgy == nullptr) {
            EXPECT_EQ(rgy, nullptr);
        } else {
            ASSERT_NE(rgy, nullptr);
            EXPECT_STREQ(rgy, c.rgy);
            EXPECT_STREQ(from_rule ? rule.rgy_type : id.rgy_type,
                         c.translate == oxmpm_host_translate ? "host" : "princ");
        }
        ASSERT_EQ(count, static_cast<int32_t>(c.tokens.size()));
        for (int32_t i = 0; i < count; ++i) EXPECT_STREQ(tokens[i], c.tokens[i].c_str());
        if (c.mapping == nullptr) {
            EXPECT_EQ(rule.mapping, nullptr);
        } else {
            ASSERT_NE(rule.mapping, nullptr);
            EXPECT_STREQ(rule.mapping->value, c.mapping);
            EXPECT_EQ(rule.mapping->length, std::strlen(c.mapping) + 1);
        }
        if (c.status == 0 || c.status == 38) {
            EXPECT_EQ(id.tokens != nullptr, c.status == 0);
        }
        c.cleanup(&rule, &id);  // ASan: everything released, nothing twice
        EXPECT_EQ(rule.tokens, nullptr);
        EXPECT_EQ(id.tokens, nullptr);
        c.cleanup(&rule, &id);
    }
}

}  // namespace
