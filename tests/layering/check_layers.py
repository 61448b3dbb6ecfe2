#!/usr/bin/env python3
"""Fails on any #include in src/ or include/ that reaches a higher layer or another layer's
private header. Layers, bottom to top, are listed in LAYERS (docs/architecture.md draws them).

A file's layer: src/<layer>/... by its folder; a public header by its family folder and, for
the families that several layers share (service, system, xml), by its file name. Headers in
src/internal/ belong to no layer of their own: each counts as the highest layer it includes,
and any layer may include it as long as that is not above its own.

Tests follow units: tests/<layer>/<stem>_test.cpp tests src/<layer>/<stem>.cpp, which must
exist (shared fixtures live in tests/support/).

Usage: check_layers.py ROOT      prints each violation, exits 1 if there is any
       check_layers.py --self-test   checks the checker on a small tree with planted faults
"""
import os
import re
import sys
import tempfile

LAYERS = ['core', 'system', 'log', 'perfcounter', 'xml', 'config', 'pool', 'app', 'net',
          'http', 'soap', 'authorize', 'c14n', 'journal', 'tools']
RANK = {name: i for i, name in enumerate(LAYERS)}
FAMILY = {'object': 'core', 'exception': 'core', 'formatter': 'core', 'io': 'core',
          'system': 'system', 'perfCounter': 'perfcounter', 'xml': 'xml', 'service': 'log',
          'http': 'http', 'soap': 'soap', 'authorize': 'authorize', 'journal': 'journal'}
INCLUDE = re.compile(r'\s*#\s*include\s+"([^"]+)"')


def public_layer(rel):
    """Layer of 'pelmora/<family>/<file>.h'; umbrella headers 'pelmora/<family>.h' take the
    highest layer of what they include, which the caller works out."""
    parts = rel.split('/')
    if parts[0] != 'pelmora' or len(parts) < 3:
        return None
    family, name = parts[1], parts[-1].lower()
    if family == 'service':
        for prefix, layer in (('config', 'config'), ('app', 'app'), ('plugin', 'app'),
                              ('daemon', 'app'), ('journal', 'journal'), ('jrnl', 'journal')):
            if name.startswith(prefix):
                return layer
        return 'log'
    if family == 'system':
        if re.match(r'(threadpool|workqueue|pool)', name):
            return 'pool'
        if re.match(r'(stream|socket|ssl|address)', name) or (name.startswith('tls') and not name.startswith('tlskey')):
            return 'net'
    if family == 'xml' and ('c14n' in name or 'canonical' in name or 'security' in parts[2:-1]):
        return 'c14n'
    return FAMILY.get(family)


def read_includes(path):
    with open(path, errors='replace') as f:
        return [(n, m.group(1)) for n, line in enumerate(f, 1) if (m := INCLUDE.match(line))]


def check(root):
    files = {}  # path relative to root -> (kind, layer or None, includes)
    for top in ('src', 'include'):
        for dirpath, _, names in os.walk(os.path.join(root, top)):
            for name in names:
                if name.endswith(('.h', '.cpp')):
                    path = os.path.join(dirpath, name)
                    rel = os.path.relpath(path, root).replace(os.sep, '/')
                    files[rel] = read_includes(path)

    def key_of(inc):
        return inc if inc.startswith('src/') else 'include/' + inc

    memo = {}

    def layer_of(rel, stack=()):
        """The layer a file counts as; None when it has none (an unknown folder)."""
        if rel in memo:
            return memo[rel]
        parts = rel.split('/')
        layer = None
        if parts[0] == 'src' and len(parts) > 2 and parts[1] != 'internal':
            layer = parts[1] if parts[1] in RANK else None
        elif parts[0] == 'include' and len(parts) > 3:
            layer = public_layer('/'.join(parts[1:]))
        else:  # src/internal/* and umbrella headers: as high as what they include
            ranks = [RANK[l] for _, inc in files.get(rel, ())
                     if key_of(inc) not in stack and (l := layer_of(key_of(inc), stack + (rel,)))]
            layer = LAYERS[max(ranks)] if ranks else 'core'
        memo[rel] = layer
        return layer

    bad = []
    for rel, includes in sorted(files.items()):
        own = layer_of(rel)
        parts = rel.split('/')
        umbrella = parts[0] == 'include' and len(parts) == 3
        if own is None or umbrella or (parts[0] == 'src' and parts[1] == 'internal'):
            continue
        for line, inc in includes:
            target = key_of(inc)
            if target not in files:
                continue  # a system or generated header
            other = layer_of(target)
            tparts = target.split('/')
            if tparts[0] == 'src' and tparts[1] != 'internal' and tparts[1] != parts[1]:
                bad.append('%s:%d (%s) includes %s, a private header of %s' % (rel, line, own, inc, other))
            elif other and RANK[other] > RANK[own]:
                bad.append('%s:%d (%s) includes %s (%s)' % (rel, line, own, inc, other))
    tests_dir = os.path.join(root, 'tests')
    for layer in sorted(os.listdir(tests_dir)) if os.path.isdir(tests_dir) else []:
        if layer not in RANK:
            continue
        for name in sorted(os.listdir(os.path.join(tests_dir, layer))):
            if name.endswith('_test.cpp') and not os.path.exists(
                    os.path.join(root, 'src', layer, name[:-len('_test.cpp')] + '.cpp')):
                bad.append('tests/%s/%s tests no unit: src/%s/%s.cpp does not exist'
                           % (layer, name, layer, name[:-len('_test.cpp')]))
    return bad


def self_test():
    planted = {
        'src/core/a.cpp': '#include "pelmora/system/lock.h"\n',          # up into system
        'src/core/b.cpp': '#include "src/internal/hook.h"\n',            # internal reaching log
        'src/internal/hook.h': '#include "pelmora/service/logger.h"\n',
        'src/log/c.cpp': '#include "src/system/private.h"\n',            # another layer's private
        'src/log/d.cpp': '#include "pelmora/service/config.h"\n',        # log -> config by name
        'include/pelmora/object/e.h': '#include "pelmora/xml/node.h"\n',  # public core -> xml
        'src/config/fine.cpp': '#include "pelmora/xml/node.h"\n#include "src/config/own.h"\n'
                               '#include "src/internal/hook.h"\n#include <vector>\n',
        'src/config/own.h': '', 'src/system/private.h': '',
        'include/pelmora/system/lock.h': '', 'include/pelmora/service/logger.h': '',
        'include/pelmora/service/config.h': '', 'include/pelmora/xml/node.h': '',
        'include/pelmora/system.h': '#include "pelmora/system/threadPool.h"\n',
        'include/pelmora/system/threadPool.h': '',
        'tests/config/own_test.cpp': '', 'src/config/own.cpp': '',
        'tests/config/stray_test.cpp': '',                              # no unit of that name
        'tests/support/helper_test.cpp': '',
    }
    with tempfile.TemporaryDirectory() as root:
        for rel, text in planted.items():
            os.makedirs(os.path.dirname(os.path.join(root, rel)), exist_ok=True)
            with open(os.path.join(root, rel), 'w') as f:
                f.write(text)
        found = sorted(v.split(':')[0].split(' ')[0] for v in check(root))
    expected = ['include/pelmora/object/e.h', 'src/core/a.cpp', 'src/core/b.cpp',
                'src/log/c.cpp', 'src/log/d.cpp', 'tests/config/stray_test.cpp']
    if found != expected:
        print('self-test: expected violations in %s, found %s' % (expected, found))
        return 1
    print('self-test: all %d planted violations found, nothing else' % len(expected))
    return 0


def main(argv):
    if argv[1:] == ['--self-test']:
        return self_test()
    if len(argv) != 2:
        print(__doc__)
        return 2
    bad = check(argv[1])
    for line in bad:
        print(line)
    print('%d layering violations' % len(bad))
    return 1 if bad else 0


if __name__ == '__main__':
    sys.exit(main(sys.argv))
