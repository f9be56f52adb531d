// `oxidm check`: reads a file and prints what the checkers found.  The file
// walk and the verdicts are in liboxidm-check (oxidm_check.cpp); this part
// adds what needs the system: file ownership and modes, the user database
// for uid-0 accounts, the mechanisms' translators for exact field matching.
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "oxidm_check.h"
#include "oxidm_cli.h"
#include "oxidm_json.h"
#include "oxidm_plugins.h"

namespace oxidm_tool {

namespace {

constexpr const char kCheckHelp[] =
    "usage: oxidm check [--json] mapfile FILE [--mech MECH]\n"
    "       oxidm check [--json] nodeinfo FILE\n"
    "\n"
    "mapfile: every line of an identity mapping file that libox_idm would\n"
    "ignore or reject, with its line number and the reason, judged by the\n"
    "library's own line judge: invalid rules (errors), lines without a\n"
    "mechanism selector, selectors that differ only in case or blanks, text\n"
    "the parser skips, lines over 1023 characters.  Warnings besides: the file\n"
    "or its directory writable by anyone but root; a wildcard identifier that\n"
    "maps to root or another uid-0 account; a denial that can never take\n"
    "effect because an earlier line matches everything it names.  With --mech\n"
    "only MECH's lines are judged; without it, each line for the mechanism its\n"
    "selector names.\n"
    "\n"
    "nodeinfo: the node information file as the cluster map loads it.  One\n"
    "invalid statement makes the library load nothing (2650-690); the checker\n"
    "reports it and looks on from the next NODE for more.  Warnings: a host\n"
    "listed twice, '#' taken as a value, tabs inside values, a NAME that reads\n"
    "as an address.\n"
    "\n"
    "exit status: 0 no errors (warnings allowed), 1 the file has errors,\n"
    "2 the file cannot be read.\n";

bool read_file(const std::string &path, std::string &out, std::string &error) {
    FILE *f = std::fopen(path.c_str(), "re");
    if (f == nullptr) {
        error = path + ": " + std::strerror(errno);
        return false;
    }
    char buf[65536];
    size_t n;
    while ((n = std::fread(buf, 1, sizeof buf, f)) > 0) out.append(buf, n);
    bool ok = !std::ferror(f);
    std::fclose(f);
    if (!ok) error = path + ": read error";
    return ok;
}

// Who besides root can change `path`: its owner when not root, its group
// when group-writable and not root's, everyone when world-writable.
std::string writers(const struct stat &st) {
    std::string who;
    auto add = [&](const std::string &w) { who += (who.empty() ? "" : ", ") + w; };
    if (st.st_uid != 0) {
        struct passwd *pw = getpwuid(st.st_uid);
        add("its owner " + (pw ? std::string(pw->pw_name) : std::to_string(st.st_uid)));
    }
    if ((st.st_mode & S_IWGRP) && st.st_gid != 0) add("group " + std::to_string(st.st_gid));
    if (st.st_mode & S_IWOTH) add("everyone");
    return who;
}

void permission_findings(const std::string &path, std::vector<check::Finding> &out) {
    struct stat st;
    if (stat(path.c_str(), &st) == 0) {
        std::string who = writers(st);
        if (!who.empty())
            out.push_back({0, check::Severity::kWarning, "file-writable",
                           "the file is writable by someone other than root (" + who + ")"});
    }
    std::string dir = path.find('/') == std::string::npos ? "." : path.substr(0, path.rfind('/'));
    if (dir.empty()) dir = "/";
    if (char *real = realpath(dir.c_str(), nullptr)) {
        dir = real;
        std::free(real);
    }
    if (stat(dir.c_str(), &st) == 0) {
        std::string who = writers(st);
        bool sticky = (st.st_mode & S_ISVTX) != 0;
        if (!who.empty())
            out.push_back({0, check::Severity::kWarning, "directory-writable",
                           "its directory " + dir + " is writable by someone other than root (" + who + ")" +
                               (sticky ? "; the sticky bit keeps others from replacing the file only if root owns it"
                                       : ": the file can be replaced")});
    }
}

bool uid0_account(const std::string &name) {
    struct passwd *pw = getpwnam(name.c_str());
    return pw != nullptr && pw->pw_uid == 0;
}

void print_findings(const std::string &path, const std::vector<check::Finding> &findings) {
    for (const check::Finding &f : findings) {
        if (f.line == 0) std::printf("%s: %s: %s [%s]\n", path.c_str(), check::severity_name(f.severity),
                                     f.message.c_str(), f.code.c_str());
        else std::printf("%s:%zu: %s: %s [%s]\n", path.c_str(), f.line, check::severity_name(f.severity),
                         f.message.c_str(), f.code.c_str());
    }
}

void findings_json(const std::vector<check::Finding> &findings, Json &json) {
    json.begin_array("findings");
    for (const check::Finding &f : findings) {
        json.begin_object();
        if (f.line == 0) json.null("line");
        else json.num("line", static_cast<int64_t>(f.line));
        json.str("severity", check::severity_name(f.severity)).str("code", f.code).str("message", f.message);
        json.end_object();
    }
    json.end_array();
}

int check_mapfile(Context &ctx, const std::string &path, const std::string *mech) {
    std::string text, error;
    if (!read_file(path, text, error)) {
        complain("check mapfile", error);
        return kExitError;
    }
    check::FieldSplitter split = [](const check::MapEntry &e, std::vector<std::string> &fields) {
        return rule_fields(e.mechanism, e.network_id, e.kind == check::EntryKind::kDenial, fields);
    };
    std::vector<std::string> known;
    for (const Mechanism &m : mechanisms()) known.push_back(m.mnemonic);
    check::MapfileReport r = check::check_mapfile_text(text, mech, uid0_account, split, &known);
    std::vector<check::Finding> all;
    permission_findings(path, all);
    all.insert(all.end(), r.findings.begin(), r.findings.end());
    if (ctx.json) {
        Json json;
        json.begin_object().str("file", path).str("kind", "mapfile");
        if (mech) json.str("mechanism", *mech);
        else json.null("mechanism");
        json.num("lines", static_cast<int64_t>(r.lines)).num("errors", static_cast<int64_t>(r.errors()));
        json.num("warnings", static_cast<int64_t>(r.warnings() + all.size() - r.findings.size()));
        json.begin_array("entries");
        for (const check::MapEntry &e : r.entries) {
            json.begin_object().num("line", static_cast<int64_t>(e.line)).str("mechanism", e.mechanism);
            json.str("kind", e.kind == check::EntryKind::kDenial ? "denial" : "affirmative");
            json.str("network_id", e.network_id);
            if (e.kind == check::EntryKind::kDenial) json.null("local_id");
            else json.str("local_id", e.local_id);
            json.end_object();
        }
        json.end_array();
        findings_json(all, json);
        json.end_object().print();
    } else {
        print_findings(path, all);
        std::printf("%s: %zu line%s, %zu entr%s, %zu error%s, %zu warning%s\n", path.c_str(), r.lines,
                    r.lines == 1 ? "" : "s", r.entries.size(), r.entries.size() == 1 ? "y" : "ies", r.errors(),
                    r.errors() == 1 ? "" : "s", r.warnings() + all.size() - r.findings.size(),
                    r.warnings() + all.size() - r.findings.size() == 1 ? "" : "s");
    }
    return r.errors() > 0 ? kExitNoAnswer : kExitAnswer;
}

int check_nodeinfo(Context &ctx, const std::string &path) {
    std::string text, error;
    if (!read_file(path, text, error)) {
        complain("check nodeinfo", error);
        return kExitError;
    }
    check::NodeinfoReport r = check::check_nodeinfo_text(text);
    std::vector<check::Finding> all;
    permission_findings(path, all);
    size_t extra = all.size();
    all.insert(all.end(), r.findings.begin(), r.findings.end());
    if (ctx.json) {
        Json json;
        json.begin_object().str("file", path).str("kind", "nodeinfo").boolean("loads", r.loads);
        json.num("lines", static_cast<int64_t>(r.lines)).num("records", static_cast<int64_t>(r.records));
        json.num("errors", static_cast<int64_t>(r.errors())).num("warnings", static_cast<int64_t>(r.warnings() + extra));
        json.begin_array("hosts");
        for (const check::NodeHost &h : r.hosts) {
            json.begin_object().str("host", h.key).str("listed_as", h.address ? "address" : "name");
            json.num("line", static_cast<int64_t>(h.line)).begin_array("clusters");
            for (const std::string &c : h.clusters) json.str({}, c);
            json.end_array().end_object();
        }
        json.end_array();
        findings_json(all, json);
        json.end_object().print();
    } else {
        print_findings(path, all);
        if (r.loads)
            std::printf("%s: loads: %zu host record%s, %zu name%s and address%s, %zu warning%s\n", path.c_str(),
                        r.records, r.records == 1 ? "" : "s", r.hosts.size(), r.hosts.size() == 1 ? "" : "s",
                        r.hosts.size() == 1 ? "" : "es", r.warnings() + extra, r.warnings() + extra == 1 ? "" : "s");
        else
            std::printf("%s: does not load (first error at line %zu): %zu error%s, %zu warning%s\n", path.c_str(),
                        r.first_error_line, r.errors(), r.errors() == 1 ? "" : "s", r.warnings() + extra,
                        r.warnings() + extra == 1 ? "" : "s");
    }
    return r.errors() > 0 ? kExitNoAnswer : kExitAnswer;
}

}  // namespace

int cmd_check(Context &ctx, const Args &in) {
    if (wants_help(in)) {
        std::fputs(kCheckHelp, stdout);
        return 0;
    }
    Args args = take_json(ctx, in);
    std::string mech;
    bool has_mech = false;
    Args rest;
    for (size_t i = 0; i < args.size(); ++i) {
        if (args[i] == "--mech" && i + 1 < args.size()) {
            mech = args[++i];
            has_mech = true;
        } else if (args[i].rfind("--mech=", 0) == 0) {
            mech = args[i].substr(7);
            has_mech = true;
        } else {
            rest.push_back(args[i]);
        }
    }
    if (rest.size() != 2 || (rest[0] != "mapfile" && rest[0] != "nodeinfo") ||
        (has_mech && (rest[0] != "mapfile" || mech.empty()))) {
        std::fputs(kCheckHelp, stderr);
        return kExitError;
    }
    if (rest[0] == "mapfile") return check_mapfile(ctx, rest[1], has_mech ? &mech : nullptr);
    return check_nodeinfo(ctx, rest[1]);
}

}  // namespace oxidm_tool
