#!/usr/bin/env python3
"""Prints the benchmark table: each figure next to its limit or peer from the
same run, the ratio and the target verdict.

Usage: report.py RESULTS_DIR ROWS_FILE [--markdown]

RESULTS_DIR holds one Google Benchmark JSON file per family.  Every
benchmark ran with repetitions, randomly interleaved with the other
benchmarks of its family, so that a figure and its limit sample the same
moments.  A figure is taken from the least disturbed repetition (the one
with the least time; noise on a shared machine only adds time): CPU time per
iteration for ordinary benchmarks (they run on one thread: its user and
system time), the family's own measured time for manual-time benchmarks, or
a counter of that repetition.  The table's last column but one shows the
spread (median over minimum of the repetitions) of the figure.

ROWS_FILE (bench/ratios.txt), one row per line, fields separated by '|':
    label | figure | baseline | target | note
  figure, baseline:  a benchmark name (its time per iteration),
                     NAME@COUNTER (the median of that user counter),
                     =25ns, =100ms (a fixed time budget) or =1e7 (a fixed value),
                     or - (no baseline).
                     A - B (a difference), A + B (a sum), N*A (a multiple),
                     N*(A - B).
  target:            <=X   figure / baseline must be at most X
                     >=X   figure / baseline must be at least X
                     Xx    the figure must be at least X times faster
                           (baseline / figure >= X); a bare x only shows
                           the ratio that way
                     -     no target (context only)
                     (a bare number X means <=X, a negative one -X means Xx:
                     the older form.)
Lines starting with '#' are comments; '## Title' starts a section.
"""
import json
import os
import re
import statistics
import sys

UNITS = {'ns': 1.0, 'us': 1e3, 'ms': 1e6, 's': 1e9}
SKIP = {'name', 'run_name', 'run_type', 'repetitions', 'repetition_index', 'threads', 'iterations',
        'real_time', 'cpu_time', 'time_unit', 'family_index', 'per_family_instance_index',
        'aggregate_name', 'aggregate_unit', 'label', 'error_occurred', 'error_message'}


def load(folder):
    """name -> {'reps': [(ns, {counter: value})...], 'error': text}"""
    runs = {}
    for f in sorted(os.listdir(folder)):
        if not f.endswith('.json'):
            continue
        try:
            data = json.load(open(os.path.join(folder, f)))
        except ValueError:
            continue
        for b in data.get('benchmarks', []):
            if b.get('run_type') == 'aggregate':
                continue
            name = b.get('run_name', b['name'])
            r = runs.setdefault(name, {'reps': [], 'error': None})
            if b.get('error_occurred'):
                r['error'] = b.get('error_message', 'error')
                continue
            # CPU time of the process for ordinary benchmarks (they run on one
            # thread, so this is that thread's user and system time, which
            # other load on the machine does not inflate); the measured time
            # for manual-time ones (wall time of thread batches, or a
            # difference a family computed itself).
            t = b['real_time'] if 'manual_time' in name else b['cpu_time']
            counters = {k: float(v) for k, v in b.items() if k not in SKIP and isinstance(v, (int, float))}
            r['reps'].append((t * UNITS[b.get('time_unit', 'ns')], counters))
    return runs


def best(r):
    """The least disturbed repetition: the one with the least time."""
    return min(r['reps'], key=lambda rep: rep[0])


def spread(r):
    """Median over minimum of the repetitions' times: how noisy the figure was."""
    times = [rep[0] for rep in r['reps']]
    return statistics.median(times) / min(times) if times and min(times) > 0 else 1.0


def fmt_time(ns):
    if ns >= 1e9: return '%.2f s' % (ns / 1e9)
    if ns >= 1e6: return '%.2f ms' % (ns / 1e6)
    if ns >= 1e3: return '%.2f us' % (ns / 1e3)
    return '%.1f ns' % ns


def fmt_value(v):
    for limit, suffix in ((1e9, 'G'), (1e6, 'M'), (1e3, 'k')):
        if abs(v) >= limit:
            return '%.3g%s' % (v / limit, suffix)
    return '%.3g' % v


def resolve(cell, runs):
    """(value, is_time, shown text) or (None, ..., why).  A cell may also be
    a difference "A - B" or carry a factor "3*A"."""
    m = re.fullmatch(r'([0-9.eE+-]+)\*\((.+)\)', cell)
    if m:
        v, is_time, why = resolve(m.group(2), runs)
        if v is None:
            return v, is_time, why
        v *= float(m.group(1))
        return v, is_time, fmt_time(v) if is_time else fmt_value(v)
    if ' + ' in cell:
        parts = [resolve(x.strip(), runs) for x in cell.split(' + ')]
        for v, _, why in parts:
            if v is None:
                return None, True, why
        v = sum(p[0] for p in parts)
        return v, parts[0][1], fmt_time(v) if parts[0][1] else fmt_value(v)
    if ' - ' in cell:
        parts = [resolve(x.strip(), runs) for x in cell.split(' - ')]
        for v, _, why in parts:
            if v is None:
                return None, True, why
        v = parts[0][0] - sum(p[0] for p in parts[1:])
        return v, parts[0][1], fmt_time(v) if parts[0][1] else fmt_value(v)
    m = re.fullmatch(r'([0-9.]+)\*(.+)', cell)
    if m:
        v, is_time, why = resolve(m.group(2), runs)
        if v is None:
            return v, is_time, why
        v *= float(m.group(1))
        return v, is_time, (fmt_time(v) if is_time else fmt_value(v)) + ' (%sx)' % m.group(1)
    if cell in ('', '-'):
        return None, True, ''
    if cell.startswith('='):
        m = re.fullmatch(r'=([0-9.eE+-]+)\s*(ns|us|ms|s)?', cell)
        if not m:
            return None, True, 'bad constant ' + cell
        if m.group(2):
            v = float(m.group(1)) * UNITS[m.group(2)]
            return v, True, 'budget ' + fmt_time(v)
        v = float(m.group(1))
        return v, False, 'target ' + fmt_value(v)
    name, _, counter = cell.partition('@')
    r = runs.get(name)
    if r is None:
        return None, True, 'missing: ' + name
    if r['error']:
        return None, True, 'skipped: ' + r['error']
    if not r['reps']:
        return None, True, 'no result: ' + name
    t, counters = best(r)
    if counter:
        if counter not in counters:
            return None, False, 'no counter ' + cell
        v = counters[counter]
        return v, False, fmt_value(v)
    return t, True, fmt_time(t)


def parse_target(t):
    t = t.strip()
    if t in ('', '-'):
        return None
    m = re.fullmatch(r'(<=|>=)\s*([0-9.]+)', t)
    if m:
        return m.group(1), float(m.group(2))
    m = re.fullmatch(r'([0-9.]*)\s*x', t)
    if m:
        return 'x', float(m.group(1)) if m.group(1) else None
    v = float(t)
    return ('x', -v) if v < 0 else ('<=', v)


def rows(path, runs):
    out = []
    for line in open(path):
        line = line.strip()
        if not line or (line.startswith('#') and not line.startswith('## ')):
            continue
        if line.startswith('## '):
            out.append(('section', line[3:].strip()))
            continue
        label, fig, base, target, note = [x.strip() for x in (line.split('|') + [''] * 4)[:5]]
        fv, _, fshown = resolve(fig, runs)
        bv, _, bshown = resolve(base, runs)
        ratio = verdict = ''
        goal = parse_target(target)
        if fv is not None and bv is not None and fv > 0 and bv > 0:
            r = fv / bv
            if goal and goal[0] == 'x':
                ratio = '%.1fx faster' % (bv / fv) if bv / fv >= 1 else '%.2fx slower' % (fv / bv)
                if goal[1] is not None:
                    ok = bv / fv >= goal[1]
                    verdict = ('ok' if ok else 'MISSED') + ' (>= %gx faster)' % goal[1]
            else:
                ratio = '%.2f' % r if r < 100 else '%.0f' % r
                if goal:
                    ok = r <= goal[1] if goal[0] == '<=' else r >= goal[1]
                    verdict = ('ok' if ok else 'MISSED') + ' (%s %g)' % goal
        elif fv is None and fshown:
            fshown = fshown
        noise = ''
        plain = fig.partition('@')[0]
        if plain in runs and runs[plain]['reps'] and len(runs[plain]['reps']) > 1:
            noise = '%.2f' % spread(runs[plain])
        out.append(('row', label, fshown, bshown, ratio, verdict, noise, note))
    return out


HEAD = ('figure', 'measured', 'limit or peer', 'ratio', 'target', 'spread')


def print_text(table):
    body = [r for r in table if r[0] == 'row']
    w = [max([len(h)] + [len(r[i + 1]) for r in body]) for i, h in enumerate(HEAD)]
    line = '  '.join(h.ljust(w[i]) for i, h in enumerate(HEAD))
    print(line)
    print('-' * len(line))
    for r in table:
        if r[0] == 'section':
            print('\n[%s]' % r[1])
            continue
        print('  '.join(r[i + 1].ljust(w[i]) for i in range(len(HEAD))) + ('  ' + r[7] if r[7] else ''))


def print_markdown(table):
    head = HEAD + ('note',)
    print('| ' + ' | '.join(head) + ' |')
    print('|' + '---|' * len(head))
    for r in table:
        if r[0] == 'section':
            print('| **%s** |' % r[1] + ' |' * (len(head) - 1))
            continue
        print('| ' + ' | '.join(x.replace('|', '/') for x in r[1:1 + len(head)]) + ' |')


def main():
    args = [a for a in sys.argv[1:] if not a.startswith('--')]
    if len(args) != 2:
        sys.exit(__doc__)
    runs = load(args[0])
    table = rows(args[1], runs)
    if '--markdown' in sys.argv:
        print_markdown(table)
    else:
        print_text(table)
    missed = sum(1 for r in table if r[0] == 'row' and r[5].startswith('MISSED'))
    met = sum(1 for r in table if r[0] == 'row' and r[5].startswith('ok'))
    print('\ntargets: %d met, %d missed' % (met, missed))


main()
