#!/usr/bin/env python3
"""End-to-end tests of the oxidm command: every subcommand against the
bundled examples and against generated configurations, exit statuses,
--json output parsed back, --root as root and as an unprivileged user.

usage: test_cli.py OXIDM EXAMPLES_DIR
"""
import json
import os
import shutil
import subprocess
import sys
import tempfile

OXIDM = os.path.abspath(sys.argv[1])
EXAMPLES = os.path.abspath(sys.argv[2])
results = {"passed": 0, "failed": 0, "skipped": 0}


def run(*args, env=None, user=None):
    cmd = [OXIDM, *args]
    if user is not None:
        cmd = ["setpriv", f"--reuid={user}", f"--regid={user}", "--clear-groups", *cmd]
    full_env = dict(os.environ)
    full_env.update(env or {})
    # Sanitizer reports must fail the test, not hide in the output.
    p = subprocess.run(cmd, capture_output=True, text=True, env=full_env, timeout=120)
    return p.returncode, p.stdout, p.stderr


def case(name):
    def wrap(fn):
        try:
            fn()
            results["passed"] += 1
            print(f"ok      {name}")
        except Skip as s:
            results["skipped"] += 1
            print(f"skipped {name}: {s}")
        except Exception as e:  # a failed expectation: report and go on
            results["failed"] += 1
            print(f"FAILED  {name}: {e}")
        return fn
    return wrap


class Skip(Exception):
    pass


def expect(cond, what):
    if not cond:
        raise AssertionError(what)


def expect_run(args, status, out=None, err=None, **kw):
    rc, so, se = run(*args, **kw)
    expect(rc == status, f"{' '.join(args)}: exit {rc}, wanted {status}\nstdout: {so}\nstderr: {se}")
    if out is not None:
        expect(out in so, f"{' '.join(args)}: {out!r} not in stdout:\n{so}")
    if err is not None:
        expect(err in se, f"{' '.join(args)}: {err!r} not in stderr:\n{se}")
    return so, se


def json_of(args, status, **kw):
    so, _ = expect_run(["--json", *args], status, **kw)
    return json.loads(so)


def make_root(files):
    """A configuration tree: {relative path: text}."""
    root = tempfile.mkdtemp(prefix="oxidm-cli-")
    os.chmod(root, 0o755)
    for rel, text in files.items():
        path = os.path.join(root, rel)
        os.makedirs(os.path.dirname(path), exist_ok=True)
        with open(path, "w") as f:
            f.write(text)
    for dirpath, dirnames, filenames in os.walk(root):
        for d in dirnames:
            os.chmod(os.path.join(dirpath, d), 0o755)
        for n in filenames:
            os.chmod(os.path.join(dirpath, n), 0o644)
    return root


EX = ["--root", EXAMPLES]
host_had_cfg = os.path.exists("/var/ox/cfg")

# ---- help and usage ----


@case("every subcommand has --help (exit 0, a usage line)")
def _():
    for sub in ["map", "explain", "groups", "cluster", "check", "trace", "mechanisms"]:
        so, _ = expect_run([sub, "--help"], 0)
        expect("usage: oxidm" in so, f"{sub} --help: no usage line")
    expect_run(["--help"], 0, out="commands:")
    expect_run(["help", "map"], 0, out="usage: oxidm map")


@case("bad usage exits 2")
def _():
    expect_run([], 2)
    expect_run(["map", "princ"], 2)
    expect_run(["cluster", "some", "host"], 2)
    expect_run(["nosuchcommand"], 2, err="unknown command")
    expect_run(["--bogus", "map"], 2)
    expect_run(["check", "nodeinfo", "x", "--mech", "princ"], 2)
    expect_run(["--root", "/nonexistent/dir", "map", "princ", "a@B"], 2, err="not a directory")


# ---- map ----


@case("map: examples, each outcome and its exit status")
def _():
    expect_run(EX + ["map", "princ", "alice@EXAMPLE.ORG"], 0, out="alice@EXAMPLE.ORG -> alice")
    expect_run(EX + ["map", "princ", "joe/admin@EXAMPLE.ORG"], 0, out="-> root")
    expect_run(EX + ["map", "princ", "mallory@EXAMPLE.ORG"], 1, out="a denial matched")
    expect_run(EX + ["map", "princ", "eve@OTHER.ORG"], 1, out="no line matched")
    expect_run(EX + ["map", "host", "ann@NODE1.example.org"], 0, out="-> ann")
    expect_run(EX + ["map", "nosuch", "a@b"], 2, err="unknown mechanism")


@case("map --json: one result per identity, decisions named")
def _():
    doc = json_of(EX + ["map", "princ", "alice@EXAMPLE.ORG", "mallory@EXAMPLE.ORG", "eve@OTHER.ORG",
                        "x/root@PARTNER.ORG", "pat@PARTNER.ORG"], 1)
    got = [(r["identity"], r["decision"], r["local"]) for r in doc["results"]]
    expect(got == [("alice@EXAMPLE.ORG", "mapped", "alice"), ("mallory@EXAMPLE.ORG", "denied", None),
                   ("eve@OTHER.ORG", "no match", None), ("x/root@PARTNER.ORG", "denied", None),
                   ("pat@PARTNER.ORG", "mapped", "guest")], f"results {got}")
    expect(doc["mechanism"] == "princ", "mechanism")


@case("map: a translator status passes through as an error with exit 2")
def _():
    root = make_root({"var/ox/cfg/oxsec_map.local": "princ:alice@EXAMPLE.ORG=alice\n"})
    try:
        # Not a principal name: the translator answers 38, the walk ends with it.
        doc = json_of(["--root", root, "map", "princ", "not-a-principal"], 2)
        expect(doc["results"][0]["status"] == 38, f"status {doc['results'][0]['status']}")
    finally:
        shutil.rmtree(root)


@case("map: generated configuration, first match wins over 200 lines")
def _():
    local = "".join(f"host:!user{i}@node{i}\n" if i % 7 == 3 else f"host:user{i}@node{i}=local{i}\n"
                    for i in range(100))
    glob = "".join(f"host:user{i}@node{i}=global{i}\n" for i in range(100)) + "host:*@*=guest\n"
    root = make_root({"var/ox/cfg/oxsec_map.local": local, "var/ox/cfg/oxsec_map.global": glob})
    try:
        ids = [f"user{i}@node{i}" for i in range(100)] + ["other@node1"]
        doc = json_of(["--root", root, "map", "host", *ids], 1)
        for i, r in enumerate(doc["results"][:100]):
            if i % 7 == 3:
                expect(r["decision"] == "denied", f"user{i}: {r}")
            else:
                expect(r["local"] == f"local{i}", f"user{i}: {r}")
        expect(doc["results"][100]["local"] == "guest", "fallback")
    finally:
        shutil.rmtree(root)


@case("map: the /opt/helvo global file is used only while /var/ox/cfg has none")
def _():
    root = make_root({"opt/helvo/cfg/oxsec_map.global": "princ:*@*=fromopt\n"})
    try:
        expect_run(["--root", root, "map", "princ", "a@R"], 0, out="-> fromopt")
        os.makedirs(os.path.join(root, "var/ox/cfg"))
        with open(os.path.join(root, "var/ox/cfg/oxsec_map.global"), "w") as f:
            f.write("princ:*@*=fromvar\n")
        os.chmod(os.path.join(root, "var/ox/cfg/oxsec_map.global"), 0o644)
        expect_run(["--root", root, "map", "princ", "a@R"], 0, out="-> fromvar")
    finally:
        shutil.rmtree(root)


# ---- explain ----


@case("explain: the deciding line, and why earlier lines did not match")
def _():
    so, _ = expect_run(EX + ["explain", "princ", "joe/root@EXAMPLE.ORG"], 1)
    expect("/var/ox/cfg/oxsec_map.global:3: princ:!*/root@*" in so, so)
    expect("<== decides" in so, so)
    expect("2650-666" in so and "2650-664" in so, so)
    doc = json_of(EX + ["explain", "princ", "joe/root@EXAMPLE.ORG"], 1)
    expect(doc["decided_by"] == {"file": "/var/ox/cfg/oxsec_map.global", "line": 3, "text": "princ:!*/root@*"},
           f"decided_by {doc['decided_by']}")
    lines = doc["lines"]
    expect([l["line"] for l in lines[:4]] == [8, 9, 10, 11], "local lines in order")
    expect(lines[0]["verdict"] == "no match" and lines[0]["message_number"] == 285, f"line 8: {lines[0]}")
    expect(lines[1]["message_number"] == 287 and "(admin)" in lines[1]["message"], f"line 9: {lines[1]}")
    expect(lines[5]["verdict"] == "not reached", f"after the decision: {lines[5]}")
    files = {f["path"]: (f["present"], f["read"]) for f in doc["files"]}
    expect(files.get("/opt/helvo/cfg/oxsec_map.global") == (True, False), f"files {files}")


@case("explain: invalid lines, registry mismatch, a match with its local name")
def _():
    root = make_root({"var/ox/cfg/oxsec_map.local":
                      "# rules\nprinc:joe@OTHER.ORG=joe\nprinc:broken\n\nprinc:*@EXAMPLE.ORG=*\n"})
    try:
        doc = json_of(["--root", root, "explain", "princ", "joe@EXAMPLE.ORG"], 0)
        expect(doc["local"] == "joe" and doc["granted"], f"answer {doc['answer']}")
        by_line = {l["line"]: l for l in doc["lines"]}
        expect(by_line[2]["message_number"] == 288, f"line 2: {by_line[2]}")
        expect(by_line[3]["verdict"] == "ignored", f"line 3: {by_line[3]}")
        expect(by_line[5]["decided"] and by_line[5]["verdict"] == "match", f"line 5: {by_line[5]}")
        expect(doc["decided_by"]["line"] == 5, "decided_by")
    finally:
        shutil.rmtree(root)


@case("explain: line numbers across a line longer than 1023 characters")
def _():
    long_line = "princ:" + "a" * 1500 + "@R=x"
    root = make_root({"var/ox/cfg/oxsec_map.local": "# head\n" + long_line + "\nprinc:!c@R\nprinc:*@R=y\n"})
    try:
        doc = json_of(["--root", root, "explain", "princ", "b@R"], 0)
        expect(doc["decided_by"]["line"] == 4 and doc["local"] == "y", f"decided_by {doc['decided_by']}")
        by_line = {l["line"]: l for l in doc["lines"]}
        expect(by_line[2]["verdict"] == "ignored", f"the long line's first piece: {by_line.get(2)}")
        expect(by_line[3]["kind"] == "denial", f"line 3: {by_line.get(3)}")
        check = json_of(["--root", root, "check"], 1)
        codes = {(f["line"], f["code"]) for f in check["files"][0]["findings"]}
        expect({(2, "long-line"), (2, "invalid-rule")} <= codes, f"{codes}")
    finally:
        shutil.rmtree(root)


@case("explain: no map file at all")
def _():
    root = make_root({})
    try:
        so, _ = expect_run(["--root", root, "explain", "princ", "a@B"], 1, out="hold no line of princ")
        doc = json_of(["--root", root, "explain", "princ", "a@B"], 1)
        expect(doc["lines"] == [] and doc["decided_by"] is None, "empty")
    finally:
        shutil.rmtree(root)


# ---- groups ----


@case("groups: root's primary group first; an unknown user is an error")
def _():
    doc = json_of(EX + ["groups", "root"], 0)
    expect(doc["users"][0]["groups"][0] == "root", f"groups {doc}")
    expect_run(["groups", "no-such-user-oxidm"], 2, err="2650-698")
    doc = json_of(["groups", "no-such-user-oxidm"], 2)
    expect(doc["users"][0]["status"] == 15 and "2650-698" in doc["users"][0]["error"], "json error")


# ---- cluster ----


@case("cluster any / active against the examples")
def _():
    expect_run(EX + ["cluster", "any", "node2", "192.0.2.13", "2001:db8::11"], 0, out="node2: 1")
    expect_run(EX + ["cluster", "any", "unknown.example.org"], 1, out="-1 (not listed)")
    expect_run(EX + ["cluster", "active", "node1", "node2.example.org"], 0)
    expect_run(EX + ["cluster", "active", "node3"], 1, out="node3: 0")
    doc = json_of(EX + ["cluster", "active", "node1", "node3", "nowhere"], 1)
    expect(doc["active_cluster"] == "prod", "active cluster")
    expect([r["answer"] for r in doc["results"]] == [1, 0, -1], f"answers {doc['results']}")


@case("cluster: an invalid node information file is an error with 2650-690")
def _():
    root = make_root({"var/ox/cfg/oxsec.nodeinfo": "NODE:\nNAME: a\n", "var/ox/cfg/active_cluster": "x\n"})
    try:
        _, se = expect_run(["--root", root, "cluster", "any", "a"], 2, err="2650-690")
        doc = json_of(["--root", root, "cluster", "any", "a"], 2)
        expect("2650-690" in doc["results"][0]["error"], "json error")
    finally:
        shutil.rmtree(root)


@case("cluster active: no active cluster known is an error")
def _():
    root = make_root({"var/ox/cfg/oxsec.nodeinfo": "NODE:\nNAME: a\nCLUSTER: c\n"})
    try:
        expect_run(["--root", root, "cluster", "active", "a"], 2, err="no active cluster")
        expect_run(["--root", root, "cluster", "any", "a"], 0)
    finally:
        shutil.rmtree(root)


@case("cluster: generated node information file with 60 hosts in 3 clusters")
def _():
    text = "".join(f"NODE:\n NAME: n{i}\n ADDRESS: 10.9.0.{i}\n CLUSTER: c{i % 3}\n" for i in range(60))
    root = make_root({"var/ox/cfg/oxsec.nodeinfo": text, "var/ox/cfg/active_cluster": "c1\n"})
    try:
        hosts = [f"n{i}" for i in range(60)] + [f"10.9.0.{i}" for i in range(60)]
        doc = json_of(["--root", root, "cluster", "active", *hosts], 1)
        for r in doc["results"]:
            i = int(r["host"].rsplit(".", 1)[-1]) if r["host"][0].isdigit() else int(r["host"][1:])
            expect(r["answer"] == (1 if i % 3 == 1 else 0), f"{r}")
    finally:
        shutil.rmtree(root)


# ---- check ----


@case("check mapfile: the examples are clean, the mistakes are found")
def _():
    expect_run(["check", "mapfile", os.path.join(EXAMPLES, "var/ox/cfg/oxsec_map.local")], 0, out="0 errors")
    doc = json_of(["check", "mapfile", os.path.join(EXAMPLES, "mistakes.map")], 1)
    codes = {(f["line"], f["code"]) for f in doc["findings"]}
    for want in [(3, "wildcard-root"), (4, "dead-denial"), (5, "selector-mismatch"), (6, "invalid-rule"),
                 (7, "ignored-text"), (8, "invalid-rule"), (9, "no-selector")]:
        expect(want in codes, f"{want} not in {sorted(codes)}")
    expect(doc["errors"] == 2, f"errors {doc['errors']}")
    doc = json_of(["check", "mapfile", os.path.join(EXAMPLES, "mistakes.map"), "--mech", "princ"], 1)
    expect(all(e["mechanism"] == "princ" for e in doc["entries"]), "only princ entries")


@case("check mapfile: writable file and directory, uid-0 account, unreadable file")
def _():
    d = tempfile.mkdtemp(prefix="oxidm-check-")
    try:
        path = os.path.join(d, "map")
        with open(path, "w") as f:
            f.write("host:*@node1=root\nhost:ann@node1=ann\n")
        os.chmod(d, 0o777)
        os.chmod(path, 0o666)
        doc = json_of(["check", "mapfile", path], 0)
        codes = {f["code"] for f in doc["findings"]}
        expect({"file-writable", "directory-writable", "wildcard-root", "shadowed-entry"} <= codes, f"{codes}")
        expect_run(["check", "mapfile", os.path.join(d, "missing")], 2)
        expect_run(["check", "mapfile", "/dev/zero"], 2, err="not a regular file")
        os.mkfifo(os.path.join(d, "fifo"))
        expect_run(["check", "nodeinfo", os.path.join(d, "fifo")], 2, err="not a regular file")
    finally:
        shutil.rmtree(d)


@case("check nodeinfo: valid, invalid, warnings")
def _():
    expect_run(["check", "nodeinfo", os.path.join(EXAMPLES, "var/ox/cfg/oxsec.nodeinfo")], 0, out="loads")
    d = tempfile.mkdtemp(prefix="oxidm-check-")
    try:
        bad = os.path.join(d, "bad")
        with open(bad, "w") as f:
            f.write("NODE:\nNAME: a\nCLUSTER: c\nNAME: b\nNODE:\nbogus\nNODE:\nNAME: c\n")
        doc = json_of(["check", "nodeinfo", bad], 1)
        errs = [(f["line"], f["code"]) for f in doc["findings"] if f["severity"] == "error"]
        expect(errs[0] == (4, "invalid-statement") and not doc["loads"], f"errors {errs}")
        expect(len(errs) >= 2, f"resumed: {errs}")
        warn = os.path.join(d, "warn")
        with open(warn, "w") as f:
            f.write("NODE:\nNAME: a 10.1.1.1\nCLUSTER: c # old\nNODE:\nNAME: a\nCLUSTER: d\n")
        doc = json_of(["check", "nodeinfo", warn], 0)
        codes = {(f["line"], f["code"]) for f in doc["findings"]}
        expect({(2, "name-is-address"), (3, "hash-value"), (5, "host-repeated")} <= codes, f"{codes}")
        expect(doc["hosts"][0] == {"host": "a", "listed_as": "name", "line": 2, "clusters": ["c", "#", "old"]},
               f"hosts {doc['hosts']}")
    finally:
        shutil.rmtree(d)


@case("check config: every file the library would read, in its order")
def _():
    doc = json_of(EX + ["check"], 0)
    used = {f["file"]: f["used"] for f in doc["files"]}
    expect(used == {"/var/ox/cfg/oxsec_map.local": True, "/var/ox/cfg/oxsec_map.global": True,
                    "/opt/helvo/cfg/oxsec_map.global": False, "/var/ox/cfg/oxsec.nodeinfo": True}, f"{used}")
    expect(doc["active_cluster"] == "prod", "active cluster")
    root = make_root({"var/ox/cfg/oxsec_map.local": "princ:*@*=x\n",
                      "var/ox/cfg/oxsec_map.global": "princ:!a@R\nprinc:bad\n"})
    try:
        doc = json_of(["--root", root, "check"], 1)
        glob = [f for f in doc["files"] if f["file"] == "/var/ox/cfg/oxsec_map.global"][0]
        codes = {(f["line"], f["code"]) for f in glob["findings"]}
        expect({(1, "dead-denial"), (2, "invalid-rule")} <= codes, f"{codes}")
        expect(doc["active_cluster"] is None and doc["errors"] == 1, "summary")
        expect_run(["--root", root, "check", "config", "--mech", "princ"], 2)
    finally:
        shutil.rmtree(root)


# ---- trace ----


@case("trace: records of a map request, decoded")
def _():
    doc = json_of(EX + ["trace", "map", "princ", "alice@EXAMPLE.ORG"], 0)
    expect(doc["exit_status"] == 0, "exit status")
    recs = doc["records"]
    entry = [r for r in recs if r["id"] == 95]
    expect(entry and entry[0]["routine"] == "sec_idm_map_identity", f"no 95 record")
    expect(entry[0]["items"][0] == {"name": "mnemonic", "text": "princ"}, f"95 items {entry[0]['items']}")
    expect(any(r["id"] == 43 and r["routine"] == "idm__parse_mapfile" for r in recs), "parser lines")
    so, _ = expect_run(EX + ["trace", "--levels", "API=1", "cluster", "any", "node1"], 0,
                       out="144 sec_is_in_any_cluster entry")
    expect_run(["trace", "--levels", "bogus=1", "groups", "root"], 2)


@case("trace decode: a file written by the stand-in through OX_TR_FILE")
def _():
    d = tempfile.mkdtemp(prefix="oxidm-trace-")
    try:
        path = os.path.join(d, "trace")
        expect_run(EX + ["cluster", "any", "node1"], 0,
                   env={"OX_TR_FILE": path, "OX_TR_LEVELS": "_SEI:API=8,Diag=1"})
        so, _ = expect_run(["trace", "decode", path], 0)
        expect('145 sec_is_in_any_cluster entry data: host="node1"' in so, so)
        expect("147 sec_is_in_any_cluster exit data: answer=1" in so, so)
        doc = json_of(["trace", "decode", path], 0)
        expect(any(r["id"] == 159 for r in doc["records"]), "Diag records of the parser")
        expect_run(["trace", "decode", os.path.join(d, "missing")], 2)
    finally:
        shutil.rmtree(d)


# ---- --root ----


@case("--root as an unprivileged user (user namespace)")
def _():
    if os.geteuid() != 0 or shutil.which("setpriv") is None:
        raise Skip("needs root and setpriv to become nobody")
    copy = make_root({})
    shutil.rmtree(copy)
    shutil.copytree(EXAMPLES, copy)
    for dirpath, dirnames, filenames in os.walk(copy):
        os.chmod(dirpath, 0o755)
        for n in filenames:
            os.chmod(os.path.join(dirpath, n), 0o644)
    try:
        rc, so, se = run("--version", user=65534)
        if rc != 0:
            raise Skip(f"nobody cannot run {OXIDM}: {se.strip()}")
        rc, so, se = run("--root", copy, "map", "princ", "alice@EXAMPLE.ORG", user=65534)
        if rc == 2 and "unshare" in se:
            raise Skip(f"no unprivileged user namespaces: {se.strip()}")
        expect(rc == 0 and "-> alice" in so, f"exit {rc}: {so} {se}")
        rc, so, se = run("--root", copy, "cluster", "active", "node1", user=65534)
        expect(rc == 0, f"cluster as nobody: exit {rc}: {se}")
    finally:
        shutil.rmtree(copy)


@case("--root leaves the host's directories alone")
def _():
    expect(os.path.exists("/var/ox/cfg") == host_had_cfg, "/var/ox/cfg appeared or vanished on the host")


total = results["passed"] + results["failed"]
print(f"{results['passed']} passed, {results['failed']} failed, {results['skipped']} skipped")
sys.exit(1 if results["failed"] else 0)
