// The Kerberos local-authorization module through the real krb5 library:
// krb5_aname_to_localname and krb5_kuserok under a krb5.conf that makes the
// map files the only authority (enable_only = oxidm).  No KDC is needed.
#include <dlfcn.h>
#include <krb5/krb5.h>
#include <sys/stat.h>

#include <cstdlib>
#include <string>

#include "harness.h"

namespace {

// Loaded before the test enters its mount namespace, whose private /tmp may
// hide the build tree: krb5's later dlopen of the same path finds it loaded.
void *const g_module = dlopen(OXIDM_LOCALAUTH_MODULE, RTLD_NOW | RTLD_GLOBAL);

class Krb5Bridge : public oxtest::Test {
  protected:
    void SetUp() override {
        oxtest::Test::SetUp();
        OXTEST_REQUIRE_NAMESPACE();
        ASSERT_NE(g_module, nullptr) << dlerror();
        const std::string conf = std::string(oxtest::kVarCfg) + "/krb5.conf";
        oxtest::write_file(conf, "[libdefaults]\n  default_realm = EX.ORG\n[plugins]\n  localauth = {\n"
                                 "    module = oxidm:" OXIDM_LOCALAUTH_MODULE "\n    enable_only = oxidm\n  }\n");
        setenv("KRB5_CONFIG", conf.c_str(), 1);
        oxtest::write_file(oxtest::kLocalMap,
                           "princ:!mallory@EX.ORG            # a denial before the broad rule\n"
                           "princ:*/admin@EX.ORG=root\nprinc:alice@OTHER.ORG=alice2\n", 1000);
        oxtest::write_file(oxtest::kVarGlobalMap, "princ:*@EX.ORG=*\n", 1000);
        ASSERT_EQ(krb5_init_context(&context_), 0);
    }
    void TearDown() override {
        if (context_ != nullptr) krb5_free_context(context_);
        oxtest::Test::TearDown();
    }
    // krb5_aname_to_localname: the name or "error <code>"; then what
    // krb5_kuserok(principal, user) says.
    std::string ask(const char *principal, const char *user) {
        krb5_principal p = nullptr;
        if (krb5_parse_name(context_, principal, &p) != 0) return "unparsable";
        char name[256] = {};
        const krb5_error_code e = krb5_aname_to_localname(context_, p, sizeof name, name);
        std::string answer = e == 0 ? std::string(name) : "error " + std::to_string(e);
        answer += krb5_kuserok(context_, p, user) ? ", ok" : ", not ok";
        krb5_free_principal(context_, p);
        return answer;
    }
    krb5_context context_ = nullptr;
};

const std::string kNotMapped = "error " + std::to_string(KRB5_LNAME_NOTRANS);

TEST_F(Krb5Bridge, PrincipalsAreMappedAndAuthorisedByTheMapFiles) {
    const struct {
        const char *principal, *user;
        std::string answer;
    } rows[] = {
        {"alice@EX.ORG", "alice", "alice, ok"},  // broad rule of the global file
        {"alice@EX.ORG", "bob", "alice, not ok"},
        {"joe/admin@EX.ORG", "root", "root, ok"},  // wildcard name, with instance
        {"joe/admin@EX.ORG", "joe", "root, not ok"},
        {"mallory@EX.ORG", "mallory", kNotMapped + ", not ok"},  // denied before the broad rule
        {"alice@OTHER.ORG", "alice2", "alice2, ok"},  // literal rule, second realm
        {"alice@OTHER.ORG", "alice", "alice2, not ok"},
        {"bob@OTHER.ORG", "bob", kNotMapped + ", not ok"},  // no line for the principal
        {"a/b/c@EX.ORG", "a", kNotMapped + ", not ok"},     // not a name[/instance]@REALM
    };
    for (const auto &r : rows) EXPECT_EQ(ask(r.principal, r.user), r.answer) << r.principal << " as " << r.user;
}

// A map file that cannot be read stops the lookup: no other rule decides.
TEST_F(Krb5Bridge, AnUnreadableMapFileRefusesEveryone) {
    oxtest::remove_file(oxtest::kLocalMap);
    ASSERT_EQ(mkdir(oxtest::kLocalMap, 0755), 0);
    EXPECT_EQ(ask("alice@EX.ORG", "alice"), "error " + std::to_string(EIO) + ", not ok");
}

}  // namespace
