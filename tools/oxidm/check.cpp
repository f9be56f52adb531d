// oxidm check [mapfile FILE [--mech M] | nodeinfo FILE | config]: every line
// the library would ignore or reject, and warnings an administrator wants.
#include "tool.h"

#include <fmt/core.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>

#include "ox_cu.h"

namespace oxidm_tool {

namespace {

using check::Finding;
using check::Severity;

// Who besides root can change what `st` describes: its owner when not root,
// its group when group-writable and not root's, everyone when world-writable.
std::string writers(const struct stat &st) {
    std::string who;
    auto add = [&](const std::string &w) { who += (who.empty() ? "" : ", ") + w; };
    if (st.st_uid != 0) {
        struct passwd *pw = getpwuid(st.st_uid);
        add("its owner " + (pw ? std::string(pw->pw_name) : std::to_string(st.st_uid)));
    }
    if ((st.st_mode & S_IWGRP) && st.st_gid != 0) add(fmt::format("group {}", st.st_gid));
    if (st.st_mode & S_IWOTH) add("everyone");
    return who;
}

std::string absolute(const std::string &path) {
    if (!path.empty() && path[0] == '/') return path;
    char cwd[4096];
    return getcwd(cwd, sizeof cwd) ? std::string(cwd) + "/" + path : path;
}

std::string parent_of(const std::string &path) {
    size_t slash = path.rfind('/');
    return slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
}

// Every directory from the one holding `path` up to '/': one that someone
// besides root may write lets them replace what lies below it.  A sticky
// directory lets them replace only their own entries.
void directory_findings(const std::string &path, std::vector<Finding> &out) {
    std::string child = absolute(path);
    for (std::string dir = parent_of(child);; dir = parent_of(dir)) {
        struct stat st, below;
        if (stat(dir.c_str(), &st) == 0) {
            std::string who = writers(st);
            bool safe_sticky = (st.st_mode & S_ISVTX) && lstat(child.c_str(), &below) == 0 && below.st_uid == 0;
            if (!who.empty() && !safe_sticky)
                out.push_back({0, Severity::kWarning, "directory-writable",
                               fmt::format("the directory {} is writable by someone other than root ({}): {} can be "
                                           "replaced",
                                           dir, who, child)});
        }
        if (dir == "/") break;
        child = dir;
    }
}

}  // namespace

void permission_findings(const std::string &path, std::vector<Finding> &out) {
    struct stat st;
    if (lstat(path.c_str(), &st) == 0 && S_ISLNK(st.st_mode)) {
        // The link, the directories above it, then whatever it leads to.
        directory_findings(path, out);
        char *real = realpath(path.c_str(), nullptr);
        if (real == nullptr) return;
        std::string target = real;
        std::free(real);
        out.push_back({0, Severity::kNote, "symbolic-link", "a symbolic link to " + target});
        if (stat(target.c_str(), &st) == 0 && !writers(st).empty())
            out.push_back({0, Severity::kWarning, "file-writable",
                           fmt::format("its target {} is writable by someone other than root ({})", target,
                                       writers(st))});
        directory_findings(target, out);
        return;
    }
    if (stat(path.c_str(), &st) == 0 && !writers(st).empty())
        out.push_back({0, Severity::kWarning, "file-writable",
                       "the file is writable by someone other than root (" + writers(st) + ")"});
    directory_findings(path, out);
}

namespace {

// UID_MIN of /etc/login.defs (1000 when it is not set there).
uint32_t uid_min() {
    std::ifstream defs("/etc/login.defs");
    std::string line;
    while (std::getline(defs, line)) {
        std::istringstream words(line);
        std::string key;
        uint32_t value = 0;
        if (words >> key && key == "UID_MIN" && words >> value) return value;
    }
    return 1000;
}

const std::vector<check::Account> &privileged_accounts() {
    static const std::vector<check::Account> accounts = [] {
        std::vector<check::Account> out;
        uint32_t limit = uid_min();
        setpwent();
        while (struct passwd *pw = getpwent())
            if (pw->pw_uid < limit) out.push_back({pw->pw_name, pw->pw_uid});
        endpwent();
        std::stable_sort(out.begin(), out.end(), [](const auto &a, const auto &b) { return a.uid < b.uid; });
        return out;
    }();
    return accounts;
}

const check::Translator *translator_for(const std::string &mnemonic) {
    const Mechanism *m = find_mechanism(mnemonic);
    return m ? &m->routines : nullptr;
}

void sort_findings(std::vector<Finding> &f) {
    std::stable_sort(f.begin(), f.end(), [](const Finding &a, const Finding &b) { return a.line < b.line; });
}

}  // namespace

size_t Checked::count(Severity s) const {
    return static_cast<size_t>(std::count_if(findings.begin(), findings.end(), [s](const Finding &f) { return f.severity == s; }));
}

Checked check_map_text(const std::string &path, const std::string &text, const std::string *mechanism,
                       const std::vector<check::MapEntry> *earlier, const std::string &earlier_file) {
    std::vector<std::string> known;
    for (const Mechanism &m : mechanisms()) known.push_back(m.mnemonic);
    check::MapContext ctx;
    ctx.mechanism = mechanism;
    ctx.translator_for = translator_for;
    ctx.known = &known;
    ctx.privileged = privileged_accounts();
    ctx.uid_min = uid_min();
    ctx.earlier = earlier;
    ctx.earlier_file = earlier_file;
    Checked c;
    c.path = path;
    c.map_report = check::check_mapfile_text(text, ctx);
    for (const std::string &m : c.map_report.parsed_only)
        c.findings.push_back({0, Severity::kNote, "parsed-only",
                              fmt::format("no translator is known for mechanism \"{}\": its lines are parsed only, "
                                          "not judged as rules (load its plug-in with --plugin)",
                                          printable(m))});
    permission_findings(path, c.findings);
    c.findings.insert(c.findings.end(), c.map_report.findings.begin(), c.map_report.findings.end());
    sort_findings(c.findings);
    return c;
}

Checked check_node_text(const std::string &path, const std::string &text) {
    Checked c;
    c.path = path;
    c.map = false;
    c.node_report = check::check_nodeinfo_text(text);
    permission_findings(path, c.findings);
    c.findings.insert(c.findings.end(), c.node_report.findings.begin(), c.node_report.findings.end());
    sort_findings(c.findings);
    return c;
}

Json checked_json(const Checked &c) {
    Json j{{"file", c.path}, {"kind", c.map ? "mapfile" : "nodeinfo"}};
    if (c.map) {
        j["lines"] = c.map_report.lines;
        j["entries"] = c.map_report.entries.size();
    } else {
        const check::NodeinfoReport &r = c.node_report;
        j["loads"] = r.loads;
        j["lines"] = r.lines;
        j["records"] = r.records;
        Json hosts = Json::array();
        for (const check::NodeHost &h : r.hosts)
            hosts.push_back({{"host", h.key}, {"listed_as", h.address ? "address" : "name"}, {"line", h.line},
                             {"clusters", h.clusters}});
        j["hosts"] = std::move(hosts);
        j["first_error_line"] = r.first_error_line;
    }
    j["errors"] = c.count(Severity::kError);
    j["warnings"] = c.count(Severity::kWarning);
    Json findings = Json::array();
    for (const Finding &f : c.findings)
        findings.push_back({{"line", f.line ? Json(f.line) : Json()}, {"severity", check::severity_name(f.severity)},
                            {"code", f.code}, {"message", f.message}});
    j["findings"] = std::move(findings);
    return j;
}

void checked_text(const Json &j) {
    std::string path = j["file"];
    for (const Json &f : j["findings"]) {
        std::string where = f["line"].is_null() ? path : fmt::format("{}:{}", path, f["line"].get<size_t>());
        fmt::print("{}: {}: {} [{}]\n", where, f["severity"].get<std::string>(), f["message"].get<std::string>(),
                   f["code"].get<std::string>());
    }
    auto plural = [](size_t n, const char *one, const char *many) { return fmt::format("{} {}", n, n == 1 ? one : many); };
    std::string counts = plural(j["errors"], "error", "errors") + ", " + plural(j["warnings"], "warning", "warnings");
    if (j["kind"] == "mapfile")
        fmt::print("{}: {}, {}, {}\n", path, plural(j["lines"], "line", "lines"), plural(j["entries"], "entry", "entries"),
                   counts);
    else if (j["loads"].get<bool>())
        fmt::print("{}: loads: {}, {}, {}\n", path, plural(j["records"], "host record", "host records"),
                   plural(j["hosts"].size(), "name or address", "names and addresses"), counts);
    else
        fmt::print("{}: does not load (first error at line {}): {}\n", path, j["first_error_line"].get<size_t>(), counts);
}

namespace {

struct CheckArgs {
    std::string what, file, mechanism;
};

Result check_one(const CheckArgs &a) {
    Result r;
    std::string text, error;
    if (!read_file(a.file, text, error)) {
        r.fail("check " + a.what, error);
        return r;
    }
    Checked c = a.what == "mapfile" ? check_map_text(a.file, text, a.mechanism.empty() ? nullptr : &a.mechanism)
                                    : check_node_text(a.file, text);
    r.json = checked_json(c);
    if (a.what == "mapfile") r.json["mechanism"] = a.mechanism.empty() ? Json() : Json(a.mechanism);
    r.exit = c.count(Severity::kError) > 0 ? kExitNoAnswer : kExitAnswer;
    return r;
}

// Every configuration file the library would read now, judged together:
// the map files in the order the library uses them (and whether it uses
// them at all), the node information file, the active cluster's name.
Result check_config() {
    struct Candidate {
        const char *path, *role, *absent;
    };
    static constexpr Candidate kFiles[] = {
        {kLocalMap, "local map file, read first", "absent"},
        {kVarGlobalMap, "global map file, read after the local one", "absent"},
        {kOptGlobalMap, "global map file, read only while /var/ox/cfg/oxsec_map.global is absent", "absent"},
        {kNodeInfo, "node information file", "absent: every cluster query answers -1"}};
    Result r;
    Json files = Json::array(), notes = Json::array();
    size_t errors = 0;
    bool present[4] = {};
    std::vector<check::MapEntry> local_entries;
    for (int i = 0; i < 4; ++i) {
        std::string text, error;
        if (!exists(kFiles[i].path, present[i], error)) r.fail("check", "cannot tell whether it exists: " + error);
        else if (!present[i]) notes.push_back(fmt::format("{}: {}", kFiles[i].path, kFiles[i].absent));
        else if (!read_file(kFiles[i].path, text, error)) r.fail("check", error);
        if (!present[i] || !error.empty()) continue;
        bool in_use = i != 2 || !present[1];
        // A rule of a global file that the local file shadows never fires.
        Checked c = i == 3 ? check_node_text(kNodeInfo, text)
                           : check_map_text(kFiles[i].path, text, nullptr, i > 0 && in_use ? &local_entries : nullptr,
                                            kLocalMap);
        if (!in_use)
            c.findings.insert(c.findings.begin(),
                              {0, Severity::kNote, "superseded", "not read: /var/ox/cfg/oxsec_map.global exists"});
        if (i == 0) local_entries = c.map_report.entries;
        errors += c.count(Severity::kError);
        Json one = checked_json(c);
        one["role"] = kFiles[i].role;
        one["used"] = in_use;
        files.push_back(std::move(one));
    }
    cu_cluster_info_t info{};
    std::string active = cu_get_cluster_info_1(&info) == 0
                             ? std::string(info.cluster_name, strnlen(info.cluster_name, sizeof info.cluster_name))
                             : "";
    notes.push_back(active.empty() ? std::string("no active cluster is known (" CU_ACTIVE_CLUSTER_FILE ")")
                                   : "active cluster: " + active);
    r.json["files"] = std::move(files);
    r.json["active_cluster"] = active.empty() ? Json() : Json(active);
    r.json["error_count"] = errors;
    r.json["notes"] = std::move(notes);
    if (errors > 0) r.at_least(kExitNoAnswer);
    return r;
}

void text_check(const Json &j) {
    if (!j.contains("files")) {
        if (j.contains("findings")) checked_text(j);
        return;
    }
    for (const Json &f : j["files"]) {
        fmt::print("== {} ({})\n", f["file"].get<std::string>(), f["role"].get<std::string>());
        checked_text(f);
    }
    for (const Json &n : j["notes"]) fmt::print("-- {}\n", n.get<std::string>());
}

}  // namespace

void add_check(CLI::App &app, Options &, CommandList &out) {
    auto a = std::make_shared<CheckArgs>();
    CLI::App *sub = app.add_subcommand("check", "check configuration files as the library reads them");
    sub->footer(
        "mapfile FILE, nodeinfo FILE, or config (every file the library would read now): each line judged as\n"
        "the library judges it, with warnings (see oxidm(1)).  Exit status: 0 no errors, 1 errors, 2 unreadable.");
    sub->add_option("WHAT", a->what, "mapfile, nodeinfo or config")
        ->check(CLI::IsMember({"mapfile", "nodeinfo", "config"}));
    sub->add_option("FILE", a->file, "the file to check (mapfile, nodeinfo)");
    sub->add_option("--mech", a->mechanism, "judge only this mechanism's lines (mapfile)")->type_name("MECH");
    auto run = [a] {
        if (a->what.empty() || a->what == "config") {
            Result r;
            if (!a->file.empty() || !a->mechanism.empty()) r.fail("usage", "check config takes no FILE and no --mech");
            return r.errors.empty() ? check_config() : r;
        }
        Result r;
        if (a->file.empty()) r.fail("usage", "check " + a->what + ": FILE is required");
        else if (a->what == "nodeinfo" && !a->mechanism.empty()) r.fail("usage", "check nodeinfo takes no --mech");
        return r.errors.empty() ? check_one(*a) : r;
    };
    out.push_back({sub, run, text_check});
}

}  // namespace oxidm_tool
