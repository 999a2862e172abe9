#!/usr/bin/env python3
"""Fails when an #include crosses the layering: who may include whom.

    check_layering.py [SOURCE_DIR]

Each C++ file is judged by the longest folder below that names it; its
quoted includes must come from its own folder or from one the table allows
(a web application's own folder is its own sub-folder of web/apps/). A
folder with C++ in it and no line in the table fails too, so a new one is
placed on purpose.
"""

import os
import re
import sys

ANY = None
ALLOWED = {
    'daemon/': ANY,  # the one place that knows every subsystem
    'bench/': ANY,
    'core/': [],
    'http/': ['core/'],
    'users/': ['core/'],
    'mail/': ['core/', 'users/'],
    'news/': ['core/', 'users/'],
    'proxy/': ['core/', 'users/', 'http/'],
    'dns/': ['core/'],
    'dialler/': ['core/'],
    'web/': ['core/', 'users/', 'http/', 'web/server/', 'web/lang/'],
    'web/server/': ['core/', 'users/', 'http/', 'web/lang/'],
    'web/lang/': ['core/'],
    # An application reads its subsystem's store, never its sessions.
    'web/apps/': ['core/', 'users/', 'web/lang/', 'mail/store/', 'mail/message/', 'news/store/', 'proxy/cache/'],
}

INCLUDE = re.compile(r'^\s*#\s*include\s+"([^"]+)"', re.M)


def rule_of(path):
    """The table's folder for a file, or None."""
    folders = [f for f in ALLOWED if path.startswith(f)]
    return max(folders, key=len) if folders else None


def own_folder(path, folder):
    if folder == 'web/apps/':
        parts = path.split('/')
        return '/'.join(parts[:3]) + '/' if len(parts) > 3 else folder
    return folder


def allowed(path, included):
    folder = rule_of(path)
    if ALLOWED[folder] is ANY or included.startswith(own_folder(path, folder)):
        return True
    return any(included.startswith(f) for f in ALLOWED[folder])


def check_rules():
    """The table itself says what the layering says."""
    cases = [('core/util.cpp', 'core/util.h', True), ('core/util.cpp', 'http/url.h', False),
             ('core/x.cpp', 'mail/queue.h', False), ('http/url.cpp', 'core/util.h', True),
             ('http/url.cpp', 'users/users.h', False), ('mail/pop/server.cpp', 'news/store/x.h', False),
             ('mail/queue.cpp', 'users/users.h', True), ('proxy/x.cpp', 'http/head.h', True),
             ('web/lang/x.cpp', 'http/head.h', False), ('web/apps/mail/x.cpp', 'mail/imap/session.h', False),
             ('web/apps/mail/x.cpp', 'mail/store/box.h', True), ('web/apps/mail/x.cpp', 'web/apps/news/y.h', False),
             ('daemon/main.cpp', 'web/apps/mail/x.h', True)]
    for path, included, verdict in cases:
        if allowed(path, included) != verdict:
            sys.exit('check_layering.py: its own table is wrong for %s including %s' % (path, included))


def main(root):
    check_rules()
    faults = []
    for top, dirs, files in os.walk(root):
        dirs[:] = [d for d in dirs if not d.startswith('.') and not d.startswith('build')]
        for name in files:
            if not name.endswith(('.cpp', '.h')):
                continue
            path = os.path.relpath(os.path.join(top, name), root).replace(os.sep, '/')
            if rule_of(path) is None:
                faults.append('%s: its folder has no line in the layering table' % path)
                continue
            with open(os.path.join(top, name), encoding='utf-8', errors='replace') as f:
                for included in INCLUDE.findall(f.read()):
                    if '/' in included and not allowed(path, included):
                        faults.append('%s includes %s, which its folder may not' % (path, included))
    for fault in faults:
        print(fault)
    print('%d layering faults' % len(faults) if faults else 'Includes follow the layering')
    return 1 if faults else 0


if __name__ == '__main__':
    sys.exit(main(sys.argv[1] if len(sys.argv) > 1 else os.path.join(os.path.dirname(__file__), '..')))
