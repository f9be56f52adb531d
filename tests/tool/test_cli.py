#!/usr/bin/env python3
"""Golden cases of the oxidm command, all in golden.txt.  A case is a
command line "$ ARGS" followed by the exact stdout ("> " lines), stderr
("! " lines) and exit status ("= N").  ARGS may start with VAR=value
settings and with @nobody (run as user 65534; skipped unless root).  {t} is
a scratch directory holding a copy of the examples ({t}/ex) and the files
given as "% PATH [MODE|fifo]" followed by their lines as "| " lines (a PATH
ending in "/" is a directory); paths under {t} are written {t} in outputs.
{mpm} is the build's directory of sample plug-ins.  Every case runs a second
time with --json added, and its stdout must be one JSON document.

usage: test_cli.py OXIDM EXAMPLES_DIR
"""
import json, os, shlex, shutil, subprocess, sys, tempfile

OXIDM, EXAMPLES = map(os.path.abspath, sys.argv[1:3])
MPM = os.path.join(os.path.dirname(os.path.dirname(OXIDM)), "mpm")
GOLDEN = os.path.join(os.path.dirname(os.path.abspath(__file__)), "golden.txt")


def make_tree(t, lines):
    shutil.copytree(EXAMPLES, os.path.join(t, "ex"))
    modes, files, path = {}, {}, None
    for line in lines:
        if line.startswith("% "):
            path, *mode = line[2:].split()
            modes[path.rstrip("/")] = mode[0] if mode else None
            files[path] = None if mode == ["fifo"] else ""
        elif line[:1] == "|" and path is not None:
            files[path] += line[2:] + "\n"
    for rel, text in files.items():
        full = os.path.join(t, rel)
        os.makedirs(os.path.dirname(full), exist_ok=True)
        if text is None:
            os.mkfifo(full)
        elif not rel.endswith("/"):
            open(full, "w").write(text)
    for d, dirs, names in os.walk(t):
        for name in dirs + names:
            mode = modes.get(os.path.relpath(os.path.join(d, name), t))
            os.chmod(os.path.join(d, name), int(mode, 8) if mode and mode != "fifo" else 0o755 if name in dirs else 0o644)
    os.chmod(t, 0o755)


def run(line, t, extra=()):
    args = shlex.split(line.replace("{t}", t).replace("{mpm}", MPM)) + list(extra)
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
    if extra:
        return json.loads(p.stdout)
    out = [f"> {l}".rstrip() for l in p.stdout.replace(t, "{t}").replace(MPM, "{mpm}").splitlines()]
    return out + [f"! {l}".rstrip() for l in p.stderr.replace(t, "{t}").replace(MPM, "{mpm}").splitlines()] + [f"= {p.returncode}"]


def main():
    host_had_cfg = os.path.exists("/var/ox/cfg")
    lines = open(GOLDEN).read().splitlines()
    cases, failed = [], []  # [command, expected lines]
    for line in lines:
        if line == "$" or line.startswith("$ "):
            cases.append([line[2:], []])
        elif cases and line[:1] and line[:1] in ">!=":
            cases[-1][1].append(line)
    t = tempfile.mkdtemp(prefix="oxidm-cli-")
    try:
        make_tree(t, lines)
        for command, expected in cases:
            got = run(command, t)
            if got is not None and got != expected:
                failed.append(command)
                print(f"FAILED  $ {command}\n  wanted: {expected}\n  got:    {got}")
        for command, expected in cases:  # after all text runs: cases may write files
            try:
                run(command, t, ["--json"])
            except ValueError as e:
                failed.append(command + " --json")
                print(f"FAILED  $ {command} --json: {e}")
    finally:
        shutil.rmtree(t)
    if os.path.exists("/var/ox/cfg") != host_had_cfg:
        failed.append("--root changed the host's /var/ox/cfg")
    print(f"{len(cases)} cases, {len(failed)} failed")
    return 1 if failed else 0


sys.exit(main())
