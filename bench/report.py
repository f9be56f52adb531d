#!/usr/bin/env python3
"""Prints the benchmark table: figure, baseline from the same run, ratio, target.

ratios.txt, one line per row (fields separated by '|'):
    label | figure benchmark name | baseline benchmark name or - | target ratio or - | note
A ratio target t means figure/baseline must be <= t (t > 0), or baseline/figure
must be >= -t (t < 0, for "at least N times faster than" targets).
"""
import json, os, sys

def load(folder):
    times = {}
    for f in sorted(os.listdir(folder)):
        if not f.endswith('.json'):
            continue
        data = json.load(open(os.path.join(folder, f)))
        for b in data.get('benchmarks', []):
            if b.get('run_type') == 'aggregate':
                continue
            unit = {'ns': 1.0, 'us': 1e3, 'ms': 1e6, 's': 1e9}[b.get('time_unit', 'ns')]
            times[b['name']] = (b['real_time'] * unit, b)
    return times

def fmt(ns):
    if ns >= 1e6: return '%.2f ms' % (ns / 1e6)
    if ns >= 1e3: return '%.2f us' % (ns / 1e3)
    return '%.1f ns' % ns

def main():
    times = load(sys.argv[1])
    rows = []
    for line in open(sys.argv[2]):
        line = line.strip()
        if not line or line.startswith('#'):
            continue
        label, fig, base, target, note = [x.strip() for x in (line.split('|') + ['', '', '', ''])[:5]]
        if fig not in times:
            rows.append((label, 'missing', '', '', '', note)); continue
        f = times[fig][0]
        if base in ('', '-') or base not in times:
            rows.append((label, fmt(f), '', '', '', note)); continue
        b = times[base][0]
        ratio = f / b
        verdict = ''
        if target not in ('', '-'):
            t = float(target)
            ok = ratio <= t if t > 0 else (b / f) >= -t
            verdict = ('ok' if ok else 'MISSED') + (' (<= %.2fx)' % t if t > 0 else ' (>= %gx faster)' % -t)
        shown = '%.2fx' % ratio if ratio >= 0.01 else '1/%.0f' % (1 / ratio)
        rows.append((label, fmt(f), fmt(b) + ' ' + base.split('/')[0], shown, verdict, note))
    w = [max(len(r[i]) for r in rows + [('figure', 'time', 'baseline', 'ratio', 'target', '')]) for i in range(5)]
    head = ('figure', 'time', 'baseline', 'ratio', 'target')
    print('  '.join(h.ljust(w[i]) for i, h in enumerate(head)))
    for r in rows:
        print('  '.join(r[i].ljust(w[i]) for i in range(5)) + ('  ' + r[5] if r[5] else ''))
    # Extra counters (lines/s, bytes, calls/s) are printed by the families themselves.
    for name, (t, b) in sorted(times.items()):
        counters = {k: v for k, v in b.items() if k not in ('name', 'run_name', 'run_type', 'repetitions',
                    'repetition_index', 'threads', 'iterations', 'real_time', 'cpu_time', 'time_unit',
                    'family_index', 'per_family_instance_index', 'aggregate_name', 'label', 'error_occurred',
                    'error_message')}
        if counters:
            print('  %s: %s' % (name, ', '.join('%s=%.4g' % (k, v) for k, v in counters.items() if isinstance(v, (int, float)))))

main()
