// Kerberos local-authorization module "oxidm": krb5_aname_to_localname and
// krb5_kuserok answered by libox_idm's identity mapping files.
//
// A principal is unparsed with krb5's own routine (name[/instance]@REALM,
// special characters escaped) and mapped with sec_idm_map_identity under one
// mechanism name, "princ" unless krb5.conf names another:
//     [plugins]
//         localauth = {
//             module = oxidm:/usr/lib/x86_64-linux-gnu/krb5/plugins/localauth/oxidm.so
//             enable_only = oxidm
//             oxidm_mechanism = princ
//         }
// When no translator holds the name "princ", the module registers the
// sample princ plug-in's.  It uses only libox_idm's exported interface.
//
// Outcomes (the library's "no local identity granted" covers both a denial
// and no matching line; the exported interface does not tell them apart):
//   mapping                         an2ln                  userok(lname)
//   grants NAME                     0, NAME                0 if lname is NAME, else EPERM
//   grants nothing                  KRB5_LNAME_NOTRANS     EPERM
//   principal not of the syntax     KRB5_LNAME_NOTRANS     KRB5_PLUGIN_NO_HANDLE
//   (translator status 38)
//   the call fails (a map file      EIO (ENOMEM for 6):    the same error
//   unreadable, memory, ...)        stops the lookup       (krb5 refuses)
// userok refuses with EPERM whenever the map files decided, so that no other
// module can authorise what they refused (EPERM from one module is final).
// an2ln cannot refuse without stopping every lookup, so a name the files do
// not grant is "no translation here": with `enable_only = oxidm` no other
// module maps it, which makes the map files the only authority.
//
// Thread and cancellation safety: the module keeps nothing but the
// mechanism name in its module data, which is read-only after init; every
// allocation of a call is owned by an object whose destructor frees it, so
// a thread cancelled inside the mapping leaks nothing.
#include <errno.h>
#include <krb5/localauth_plugin.h>
#include <profile.h>

#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "oxidm.h"
#include "oxmpm_principal.h"

namespace {

constexpr char kModuleName[] = "oxidm";
constexpr char kDefaultMechanism[] = OXMPM_PRINCIPAL_MNEMONIC;
constexpr int32_t kIdentityNotOfTheSyntax = 38;

struct ModuleData {
    std::string mechanism;
};

ModuleData *data_of(krb5_localauth_moddata data) { return reinterpret_cast<ModuleData *>(data); }

// The mechanism named in [plugins] localauth, or the default.
std::string configured_mechanism(krb5_context context) {
    std::string mechanism = kDefaultMechanism;
    profile_t profile = nullptr;
    if (krb5_get_profile(context, &profile) != 0) return mechanism;
    char *value = nullptr;
    if (profile_get_string(profile, "plugins", "localauth", "oxidm_mechanism", nullptr, &value) == 0 &&
        value != nullptr && value[0] != '\0')
        mechanism = value;
    profile_release_string(value);
    profile_release(profile);
    return mechanism;
}

// What one mapping said.
enum class Verdict { kGranted, kNothingGranted, kNotOfTheSyntax, kFailed };
struct Mapping {
    Verdict verdict = Verdict::kFailed;
    std::string local;  // the granted name
    int32_t status = 0; // the library's status when the call failed
};

struct UnparsedName {
    krb5_context context;
    char *text = nullptr;
    ~UnparsedName() { krb5_free_unparsed_name(context, text); }
};
struct LocalName {
    idm_buffer buffer{};
    ~LocalName() { std::free(buffer.value); }
};

Mapping map_principal(krb5_context context, const ModuleData &data, krb5_const_principal aname) {
    Mapping m;
    UnparsedName principal{context};
    if (krb5_unparse_name(context, aname, &principal.text) != 0) {
        m.status = 6;
        return m;
    }
    LocalName local;
    m.status = sec_idm_map_identity(data.mechanism.c_str(), principal.text, &local.buffer);
    if (m.status == kIdentityNotOfTheSyntax) {
        m.verdict = Verdict::kNotOfTheSyntax;
    } else if (m.status == 0 && local.buffer.value != nullptr) {
        m.verdict = Verdict::kGranted;
        m.local = local.buffer.value;
    } else if (m.status == 0) {
        m.verdict = Verdict::kNothingGranted;
    }
    return m;
}

krb5_error_code failure(const Mapping &m) { return m.status == 6 ? ENOMEM : EIO; }

krb5_error_code init(krb5_context context, krb5_localauth_moddata *data) {
    auto *d = new (std::nothrow) ModuleData;
    if (d == nullptr) return ENOMEM;
    d->mechanism = configured_mechanism(context);
    if (d->mechanism == kDefaultMechanism) {
        idm_translator_routine translator = nullptr;
        idm_cleanup_routine cleanup = nullptr;
        _sec_idm_get_translator(kDefaultMechanism, &translator, &cleanup);
        if (translator == nullptr && oxmpm_principal_register() != 0) {
            delete d;
            return ENOMEM;
        }
    }
    *data = reinterpret_cast<krb5_localauth_moddata>(d);
    return 0;
}

void fini(krb5_context, krb5_localauth_moddata data) { delete data_of(data); }

krb5_error_code userok(krb5_context context, krb5_localauth_moddata data, krb5_const_principal aname,
                       const char *lname) {
    const Mapping m = map_principal(context, *data_of(data), aname);
    switch (m.verdict) {
    case Verdict::kGranted: return lname != nullptr && m.local == lname ? 0 : EPERM;
    case Verdict::kNothingGranted: return EPERM;
    case Verdict::kNotOfTheSyntax: return KRB5_PLUGIN_NO_HANDLE;
    case Verdict::kFailed: break;
    }
    return failure(m);
}

krb5_error_code an2ln(krb5_context context, krb5_localauth_moddata data, const char *, const char *,
                      krb5_const_principal aname, char **lname_out) {
    *lname_out = nullptr;
    const Mapping m = map_principal(context, *data_of(data), aname);
    switch (m.verdict) {
    case Verdict::kGranted:
        *lname_out = strdup(m.local.c_str());
        return *lname_out != nullptr ? 0 : ENOMEM;
    case Verdict::kNothingGranted:
    case Verdict::kNotOfTheSyntax: return KRB5_LNAME_NOTRANS;
    case Verdict::kFailed: break;
    }
    return failure(m);
}

void free_string(krb5_context, krb5_localauth_moddata, char *str) { std::free(str); }

}  // namespace

extern "C" __attribute__((visibility("default"))) krb5_error_code
localauth_oxidm_initvt(krb5_context, int maj_ver, int, krb5_plugin_vtable vtable) {
    if (maj_ver != 1) return KRB5_PLUGIN_VER_NOTSUPP;
    auto *vt = reinterpret_cast<krb5_localauth_vtable>(vtable);
    vt->name = kModuleName;
    vt->an2ln_types = nullptr;  // asked for every principal, not for a rule type
    vt->init = init;
    vt->fini = fini;
    vt->userok = userok;
    vt->an2ln = an2ln;
    vt->free_string = free_string;
    return 0;
}
