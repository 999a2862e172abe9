#!/usr/bin/env python3
"""One line per area from ctest's JUnit report: each unit-test binary (its
folder), each end-to-end file, and the fuzz targets together.

    test_summary.py build/ctest-results.xml
"""

import sys
import xml.etree.ElementTree as ET


def outcome(case):
    if case.find('failure') is not None or case.find('error') is not None:
        return 'FAILED'
    status = case.get('status', 'run')
    if case.find('skipped') is not None or status in ('notrun', 'disabled'):
        return 'skipped'
    if status not in ('run', 'pass', 'passed'):
        return 'FAILED'
    return 'ok'


def main(path):
    try:
        cases = ET.parse(path).getroot().iter('testcase')
    except (OSError, ET.ParseError) as e:
        print('no test report (%s)' % e)
        return 1
    lines, fuzz, failed = [], [], 0
    for case in cases:
        name, took, result = case.get('name', '?'), float(case.get('time', 0) or 0), outcome(case)
        failed += result == 'FAILED'
        if name.startswith('fuzz_'):
            fuzz.append((name[5:], result, took))
        elif name.startswith('e2e_'):
            lines.append((result, 'e2e', '%s (tests/test_%s.py)' % (name[4:], name[4:]), took))
        elif name.endswith('_tests'):
            lines.append((result, 'unit', '%s (%s/)' % (name[:-6], name[:-6]), took))
        else:
            lines.append((result, 'test', name, took))
    if fuzz:
        bad = [n for n, r, _ in fuzz if r != 'ok']
        what = '%d targets' % len(fuzz) + (': %s' % ', '.join(bad) if bad else '')
        lines.append(('FAILED' if any(r == 'FAILED' for _, r, _ in fuzz) else 'ok', 'fuzz', what,
                      max(t for _, _, t in fuzz)))
    print('\nBy area:')
    for result, kind, what, took in lines:
        print('  %-7s %-4s  %-44s %7.1f s' % (result, kind, what, took))
    print('%d of %d areas failed' % (sum(r == 'FAILED' for r, _, _, _ in lines), len(lines)) if failed
          else 'Every area passed')
    return 1 if failed else 0


if __name__ == '__main__':
    sys.exit(main(sys.argv[1] if len(sys.argv) > 1 else 'ctest-results.xml'))
