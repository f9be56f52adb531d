#!/usr/bin/env python3
"""Golden cases of the oxidm command (golden.txt): each case is a command
line "$ ARGS", the exact stdout ("> " lines), stderr ("! " lines) and exit
status ("= N").  ARGS may start with VAR=value settings and with @nobody
(run as user 65534, root only).  {t} is a scratch directory holding a copy
of the examples ({t}/ex) and the trees below; paths under it are written
{t} in the outputs.  --update rewrites golden.txt from the actual outputs.

usage: test_cli.py OXIDM EXAMPLES_DIR [--update]
"""
import os, shlex, shutil, subprocess, sys, tempfile

OXIDM, EXAMPLES = map(os.path.abspath, sys.argv[1:3])
GOLDEN = os.path.join(os.path.dirname(os.path.abspath(__file__)), "golden.txt")
TREES = {  # relative path: text (None: a FIFO); modes 644/755 unless named in MODES
    "long/var/ox/cfg/oxsec_map.local": "# head\nprinc:" + "a" * 1500 + "@R=x\nprinc:!c@R\nprinc:*@R=y\n",
    "walk/var/ox/cfg/oxsec_map.local": "".join(
        f"host:!u{i}@n{i}\n" if i % 7 == 3 else f"host:u{i}@n{i}=local{i}\n" for i in range(20)),
    "walk/var/ox/cfg/oxsec_map.global": "".join(f"host:u{i}@n{i}=global{i}\n" for i in range(40)) + "host:*@*=guest\n",
    "opt/opt/helvo/cfg/oxsec_map.global": "princ:*@*=fromopt\n",
    "both/opt/helvo/cfg/oxsec_map.global": "princ:*@*=fromopt\n",
    "both/var/ox/cfg/oxsec_map.global": "princ:*@*=fromvar\n",
    "rules/var/ox/cfg/oxsec_map.local": "# rules\nprinc:joe@OTHER.ORG=joe\nprinc:broken\n\nprinc:*@EXAMPLE.ORG=*\n",
    "rules/var/ox/cfg/oxsec_map.global": "princ:!a@R\nprinc:bad\n",
    "badnode/var/ox/cfg/oxsec.nodeinfo": "NODE:\nNAME: a\n",
    "badnode/var/ox/cfg/active_cluster": "x\n",
    "noactive/var/ox/cfg/oxsec.nodeinfo": "NODE:\nNAME: a\nCLUSTER: c\n",
    "hosts/var/ox/cfg/oxsec.nodeinfo": "".join(
        f"NODE:\n NAME: n{i}\n ADDRESS: 10.9.0.{i}\n CLUSTER: c{i % 3}\n" for i in range(9)),
    "hosts/var/ox/cfg/active_cluster": "c1\n",
    "check/open/map": "host:*@node1=root\nhost:ann@node1=ann\n",
    "check/bad.nodeinfo": "NODE:\nNAME: a\nCLUSTER: c\nNAME: b\nNODE:\nbogus\nNODE:\nNAME: c\n",
    "check/warn.nodeinfo": "NODE:\nNAME: a 10.1.1.1\nCLUSTER: c # old\nNODE:\nNAME: a\nCLUSTER: d\n",
    "check/fifo": None,
    "empty/var/ox/cfg/.keep": "",
}
MODES = {"check/open": 0o777, "check/open/map": 0o666}


def make_tree(t):
    shutil.copytree(EXAMPLES, os.path.join(t, "ex"))
    for rel, text in TREES.items():
        path = os.path.join(t, rel)
        os.makedirs(os.path.dirname(path), exist_ok=True)
        if text is None:
            os.mkfifo(path)
        else:
            with open(path, "w") as f:
                f.write(text)
    for d, dirs, files in os.walk(t):
        for name in dirs + files:
            p = os.path.join(d, name)
            os.chmod(p, MODES.get(os.path.relpath(p, t), 0o755 if name in dirs else 0o644))
    os.chmod(t, 0o755)


def run(line, t):
    args = shlex.split(line.replace("{t}", t))
    env = dict(os.environ)
    while args and "=" in args[0] and not args[0].startswith("-"):
        key, value = args.pop(0).split("=", 1)
        env[key] = value
    cmd = [OXIDM, *args]
    if args and args[0] == "@nobody":
        if os.geteuid() != 0 or not shutil.which("setpriv"):
            return None
        cmd = ["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", OXIDM, *args[1:]]
    p = subprocess.run(cmd, capture_output=True, text=True, env=env, timeout=120)
    lines = [(">", l) for l in p.stdout.replace(t, "{t}").splitlines()]
    lines += [("!", l) for l in p.stderr.replace(t, "{t}").splitlines()]
    return [f"{k} {l}".rstrip() for k, l in lines] + [f"= {p.returncode}"]


def main():
    host_had_cfg = os.path.exists("/var/ox/cfg")
    t = tempfile.mkdtemp(prefix="oxidm-cli-")
    make_tree(t)
    out, failed, case = [], [], {"command": None, "expected": []}

    def finish():
        if case["command"] is None:
            return
        got = run(case["command"], t)
        if got is not None and got != case["expected"]:
            failed.append(case["command"])
            print(f"FAILED  $ {case['command']}\n  wanted: {case['expected']}\n  got:    {got}")
        out.extend(got if got is not None else case["expected"])
        case.update(command=None, expected=[])

    try:
        for line in open(GOLDEN).read().splitlines():
            if case["command"] is not None and line[:1] and line[:1] in ">!=":
                case["expected"].append(line)
                continue
            finish()
            if line == "$" or line.startswith("$ "):
                case["command"] = line[2:]
            out.append(line)
        finish()
    finally:
        shutil.rmtree(t)
    if "--update" in sys.argv:
        open(GOLDEN, "w").write("\n".join(out) + "\n")
    if os.path.exists("/var/ox/cfg") != host_had_cfg:
        failed.append("--root changed the host's /var/ox/cfg")
    print(f"{sum(l[:2] in ('$', '$ ') for l in out)} cases, {len(failed)} failed")
    return 1 if failed else 0


sys.exit(main())
