// `oxidm check`: reads a file and prints what the checkers found.  The file
// walk and the verdicts are in liboxidm-check (oxidm_check.cpp); this part
// adds what needs the system: file ownership and modes, the user database
// for uid-0 accounts, the mechanisms' translators for exact field matching.
#include <fcntl.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "ox_cu.h"
#include "oxidm_check.h"
#include "oxidm_cli.h"
#include "oxidm_json.h"
#include "oxidm_plugins.h"

namespace oxidm_tool {

namespace {

constexpr const char kCheckHelp[] =
    "usage: oxidm check [--json] mapfile FILE [--mech MECH]\n"
    "       oxidm check [--json] nodeinfo FILE\n"
    "       oxidm check [--json] [config]\n"
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
    "config (or no arguments): every file the library would read now, with\n"
    "--root the files under DIR: the map files in the order the library uses\n"
    "them (a global line that a local line shadows is pointed out), whether the\n"
    "/opt/helvo/cfg global file is superseded, the node information file, the\n"
    "active cluster's name.\n"
    "\n"
    "exit status: 0 no errors (warnings allowed), 1 the file has errors,\n"
    "2 the file cannot be read.\n";

bool read_file(const std::string &path, std::string &out, std::string &error) {
    // Only regular files: a device or a pipe could be endless or block
    // (opened without waiting, so that a FIFO cannot hold the command).
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (fd < 0) {
        error = path + ": " + std::strerror(errno);
        return false;
    }
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        close(fd);
        error = path + ": not a regular file";
        return false;
    }
    FILE *f = fdopen(fd, "r");
    if (f == nullptr) {
        error = path + ": " + std::strerror(errno);
        close(fd);
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

size_t count(const std::vector<check::Finding> &findings, check::Severity s) {
    size_t n = 0;
    for (const check::Finding &f : findings) n += f.severity == s;
    return n;
}

std::string plural(size_t n, const char *one, const char *many) {
    return std::to_string(n) + " " + (n == 1 ? one : many);
}

// One checked file: what the checker found plus the file's own findings
// (modes, and for a global map file, what the local file shadows).
struct Checked {
    std::string path;
    bool map = true;
    check::MapfileReport map_report;
    check::NodeinfoReport node_report;
    std::vector<check::Finding> findings;  // all, in line order
    size_t errors() const { return count(findings, check::Severity::kError); }
    size_t warnings() const { return count(findings, check::Severity::kWarning); }
};

check::FieldSplitter mechanism_fields() {
    return [](const check::MapEntry &e, std::vector<std::string> &fields) {
        return rule_fields(e.mechanism, e.network_id, e.kind == check::EntryKind::kDenial, fields);
    };
}

void sort_findings(std::vector<check::Finding> &f) {
    std::stable_sort(f.begin(), f.end(), [](const check::Finding &a, const check::Finding &b) { return a.line < b.line; });
}

bool check_map(const std::string &path, const std::string *mech, Checked &out, std::string &error) {
    std::string text;
    if (!read_file(path, text, error)) return false;
    std::vector<std::string> known;
    for (const Mechanism &m : mechanisms()) known.push_back(m.mnemonic);
    out.path = path;
    out.map = true;
    out.map_report = check::check_mapfile_text(text, mech, uid0_account, mechanism_fields(), &known);
    permission_findings(path, out.findings);
    out.findings.insert(out.findings.end(), out.map_report.findings.begin(), out.map_report.findings.end());
    return true;
}

bool check_node(const std::string &path, Checked &out, std::string &error) {
    std::string text;
    if (!read_file(path, text, error)) return false;
    out.path = path;
    out.map = false;
    out.node_report = check::check_nodeinfo_text(text);
    permission_findings(path, out.findings);
    out.findings.insert(out.findings.end(), out.node_report.findings.begin(), out.node_report.findings.end());
    return true;
}

// The members of one file's JSON object.
void checked_json(const Checked &c, const std::string *mech, Json &json) {
    json.str("file", c.path).str("kind", c.map ? "mapfile" : "nodeinfo");
    if (c.map) {
        const check::MapfileReport &r = c.map_report;
        if (mech) json.str("mechanism", *mech);
        else json.null("mechanism");
        json.num("lines", static_cast<int64_t>(r.lines));
        json.num("errors", static_cast<int64_t>(c.errors())).num("warnings", static_cast<int64_t>(c.warnings()));
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
    } else {
        const check::NodeinfoReport &r = c.node_report;
        json.boolean("loads", r.loads);
        json.num("lines", static_cast<int64_t>(r.lines)).num("records", static_cast<int64_t>(r.records));
        json.num("errors", static_cast<int64_t>(c.errors())).num("warnings", static_cast<int64_t>(c.warnings()));
        json.begin_array("hosts");
        for (const check::NodeHost &h : r.hosts) {
            json.begin_object().str("host", h.key).str("listed_as", h.address ? "address" : "name");
            json.num("line", static_cast<int64_t>(h.line)).begin_array("clusters");
            for (const std::string &cl : h.clusters) json.str({}, cl);
            json.end_array().end_object();
        }
        json.end_array();
    }
    findings_json(c.findings, json);
}

void checked_text(const Checked &c) {
    print_findings(c.path, c.findings);
    std::string counts = plural(c.errors(), "error", "errors") + ", " + plural(c.warnings(), "warning", "warnings");
    if (c.map) {
        std::printf("%s: %s, %s, %s\n", c.path.c_str(), plural(c.map_report.lines, "line", "lines").c_str(),
                    plural(c.map_report.entries.size(), "entry", "entries").c_str(), counts.c_str());
    } else if (c.node_report.loads) {
        std::printf("%s: loads: %s, %s, %s\n", c.path.c_str(),
                    plural(c.node_report.records, "host record", "host records").c_str(),
                    plural(c.node_report.hosts.size(), "name or address", "names and addresses").c_str(),
                    counts.c_str());
    } else {
        std::printf("%s: does not load (first error at line %zu): %s\n", c.path.c_str(),
                    c.node_report.first_error_line, counts.c_str());
    }
}

int check_one(Context &ctx, const std::string &what, const std::string &path, const std::string *mech) {
    Checked c;
    std::string error;
    if (!(what == "mapfile" ? check_map(path, mech, c, error) : check_node(path, c, error))) {
        complain("check " + what, error);
        return kExitError;
    }
    if (ctx.json) {
        Json json;
        json.begin_object();
        checked_json(c, mech, json);
        json.end_object().print();
    } else {
        checked_text(c);
    }
    return c.errors() > 0 ? kExitNoAnswer : kExitAnswer;
}

bool exists(const std::string &path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0;
}

// Every configuration file the library would read now, judged together:
// the map files in the order the library uses them (and whether it uses
// them at all), the node information file, the active cluster's name.
int check_config(Context &ctx) {
    struct Candidate {
        const char *path;
        const char *role;
    };
    static constexpr Candidate kMaps[] = {
        {"/var/ox/cfg/oxsec_map.local", "local map file, read first"},
        {"/var/ox/cfg/oxsec_map.global", "global map file, read after the local one"},
        {"/opt/helvo/cfg/oxsec_map.global", "global map file, read only while /var/ox/cfg/oxsec_map.global is absent"}};
    static constexpr char kNode[] = "/var/ox/cfg/oxsec.nodeinfo";
    int status = kExitAnswer;
    std::vector<Checked> checked;
    std::vector<std::string> roles;
    std::vector<bool> used;
    std::vector<std::string> notes;
    bool has_local = false;
    bool var_global = exists(kMaps[1].path);
    for (int i = 0; i < 3; ++i) {
        if (!exists(kMaps[i].path)) {
            notes.push_back(std::string(kMaps[i].path) + ": absent");
            continue;
        }
        Checked c;
        std::string error;
        if (!check_map(kMaps[i].path, nullptr, c, error)) {
            complain("check", error);
            status = kExitError;
            continue;
        }
        bool in_use = i != 2 || !var_global;
        if (!in_use)
            c.findings.insert(c.findings.begin(), {0, check::Severity::kNote, "superseded",
                                                   "not read: /var/ox/cfg/oxsec_map.global exists"});
        checked.push_back(std::move(c));
        roles.push_back(kMaps[i].role);
        used.push_back(in_use);
        if (i == 0) has_local = true;
    }
    // A rule of the global file that the local file shadows never fires.
    for (size_t k = 0; k < checked.size(); ++k) {
        if (!used[k] || checked[k].path == kMaps[0].path || !has_local) continue;
        check::shadowing(checked[0].map_report.entries, checked[0].path, checked[k].map_report.entries,
                         mechanism_fields(), checked[k].findings);
        sort_findings(checked[k].findings);
    }
    if (exists(kNode)) {
        Checked c;
        std::string error;
        if (check_node(kNode, c, error)) {
            checked.push_back(std::move(c));
            roles.push_back("node information file");
            used.push_back(true);
        } else {
            complain("check", error);
            status = kExitError;
        }
    } else {
        notes.push_back(std::string(kNode) + ": absent: every cluster query answers -1");
    }
    cu_cluster_info_t info{};
    std::string active = cu_get_cluster_info_1(&info) == 0
                             ? std::string(info.cluster_name, strnlen(info.cluster_name, sizeof info.cluster_name))
                             : "";
    notes.push_back(active.empty() ? std::string("no active cluster is known (" CU_ACTIVE_CLUSTER_FILE ")")
                                   : "active cluster: " + active);

    size_t errors = 0;
    for (const Checked &c : checked) errors += c.errors();
    if (ctx.json) {
        Json json;
        json.begin_object().begin_array("files");
        for (size_t k = 0; k < checked.size(); ++k) {
            json.begin_object();
            checked_json(checked[k], nullptr, json);
            json.str("role", roles[k]).boolean("used", used[k]);
            json.end_object();
        }
        json.end_array();
        if (active.empty()) json.null("active_cluster");
        else json.str("active_cluster", active);
        json.num("errors", static_cast<int64_t>(errors));
        json.begin_array("notes");
        for (const std::string &n : notes) json.str({}, n);
        json.end_array().end_object().print();
    } else {
        for (size_t k = 0; k < checked.size(); ++k) {
            std::printf("== %s (%s)\n", checked[k].path.c_str(), roles[k].c_str());
            checked_text(checked[k]);
        }
        for (const std::string &n : notes) std::printf("-- %s\n", n.c_str());
    }
    if (status == kExitError) return status;
    return errors > 0 ? kExitNoAnswer : kExitAnswer;
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
    if (rest.empty() || (rest.size() == 1 && rest[0] == "config")) {
        if (has_mech) {
            std::fputs(kCheckHelp, stderr);
            return kExitError;
        }
        return check_config(ctx);
    }
    if (rest.size() != 2 || (rest[0] != "mapfile" && rest[0] != "nodeinfo") ||
        (has_mech && (rest[0] != "mapfile" || mech.empty()))) {
        std::fputs(kCheckHelp, stderr);
        return kExitError;
    }
    return check_one(ctx, rest[0], rest[1], has_mech ? &mech : nullptr);
}

}  // namespace oxidm_tool
