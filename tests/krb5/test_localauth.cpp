// The Kerberos local-authorization module through the real krb5 library:
// krb5_aname_to_localname and krb5_kuserok under a krb5.conf that makes the
// map files the only authority (enable_only = oxidm).  No KDC is needed.
#include <dlfcn.h>
#include <krb5/krb5.h>
#include <sys/stat.h>

#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "harness.h"

namespace {

constexpr krb5_error_code kNoMapping = KRB5_LNAME_NOTRANS;

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
        oxtest::write_file(conf, "[libdefaults]\n  default_realm = EX.ORG\n"
                                 "[plugins]\n  localauth = {\n    module = oxidm:" OXIDM_LOCALAUTH_MODULE "\n"
                                 "    enable_only = oxidm\n  }\n");
        setenv("KRB5_CONFIG", conf.c_str(), 1);
        oxtest::write_file(oxtest::kLocalMap,
                           "princ:!mallory@EX.ORG            # a denial before the broad rule\n"
                           "princ:*/admin@EX.ORG=root\n"
                           "princ:alice@OTHER.ORG=alice2\n",
                           1000);
        oxtest::write_file(oxtest::kVarGlobalMap, "princ:*@EX.ORG=*\n", 1000);
        ASSERT_EQ(krb5_init_context(&context_), 0);
    }
    void TearDown() override {
        if (context_ != nullptr) krb5_free_context(context_);
        oxtest::Test::TearDown();
    }
    // krb5_aname_to_localname: the name, or "error <code>".
    static std::string local_name(krb5_context context, const char *principal) {
        krb5_principal p = nullptr;
        if (krb5_parse_name(context, principal, &p) != 0) return "unparsable";
        char name[256] = {};
        const krb5_error_code e = krb5_aname_to_localname(context, p, sizeof name, name);
        krb5_free_principal(context, p);
        return e == 0 ? std::string(name) : "error " + std::to_string(e);
    }
    std::string local_name(const char *principal) { return local_name(context_, principal); }
    bool userok(const char *principal, const char *user) {
        krb5_principal p = nullptr;
        if (krb5_parse_name(context_, principal, &p) != 0) return false;
        const bool ok = krb5_kuserok(context_, p, user) != FALSE;
        krb5_free_principal(context_, p);
        return ok;
    }
    krb5_context context_ = nullptr;
};

const std::string kNotMapped = "error " + std::to_string(kNoMapping);

TEST_F(Krb5Bridge, PrincipalsAreMappedAndAuthorisedByTheMapFiles) {
    const struct Row {
        const char *principal;
        std::string local;   // what krb5_aname_to_localname gives
        const char *user;    // krb5_kuserok(principal, user) ...
        bool ok;             // ... is this
    } rows[] = {
        {"alice@EX.ORG", "alice", "alice", true},        // broad rule of the global file
        {"alice@EX.ORG", "alice", "bob", false},         // another account
        {"joe/admin@EX.ORG", "root", "root", true},      // wildcard name, with instance
        {"joe/admin@EX.ORG", "root", "joe", false},
        {"mallory@EX.ORG", kNotMapped, "mallory", false},  // denied before the broad rule
        {"alice@OTHER.ORG", "alice2", "alice2", true},   // literal rule, second realm
        {"alice@OTHER.ORG", "alice2", "alice", false},
        {"bob@OTHER.ORG", kNotMapped, "bob", false},     // no line for the principal
        {"a/b/c@EX.ORG", kNotMapped, "a", false},        // not a name[/instance]@REALM
    };
    for (const Row &r : rows) {
        SCOPED_TRACE(std::string(r.principal) + " as " + r.user);
        EXPECT_EQ(local_name(r.principal), r.local);
        EXPECT_EQ(userok(r.principal, r.user), r.ok);
    }
}

TEST_F(Krb5Bridge, AChangedMapFileDecidesTheNextCall) {
    EXPECT_EQ(local_name("alice@EX.ORG"), "alice");
    oxtest::write_file(oxtest::kVarGlobalMap, "princ:*@EX.ORG=guest\n", 2000);
    EXPECT_EQ(local_name("alice@EX.ORG"), "guest");
    EXPECT_TRUE(userok("alice@EX.ORG", "guest"));
    EXPECT_FALSE(userok("alice@EX.ORG", "alice"));
}

// A map file that cannot be read stops the lookup: no other rule decides.
TEST_F(Krb5Bridge, AnUnreadableMapFileRefusesEveryone) {
    oxtest::remove_file(oxtest::kLocalMap);
    ASSERT_EQ(mkdir(oxtest::kLocalMap, 0755), 0);
    EXPECT_EQ(local_name("alice@EX.ORG"), "error " + std::to_string(EIO));
    EXPECT_FALSE(userok("alice@EX.ORG", "alice"));
}

TEST_F(Krb5Bridge, ThreadsMapAtOnce) {
    std::vector<std::thread> threads;
    std::atomic<int> wrong{0};
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&, t] {
            krb5_context context = nullptr;
            if (krb5_init_context(&context) != 0) {
                wrong.fetch_add(1);
                return;
            }
            for (int i = 0; i < 200; ++i) {
                const bool admin = (i + t) % 2 == 0;
                if (local_name(context, admin ? "x/admin@EX.ORG" : "x@EX.ORG") != (admin ? "root" : "x"))
                    wrong.fetch_add(1);
            }
            krb5_free_context(context);
        });
    for (auto &t : threads) t.join();
    EXPECT_EQ(wrong.load(), 0);
}

}  // namespace
