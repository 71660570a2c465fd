#!/usr/bin/env python3
"""Fails when a source file includes a header of a layer its own layer may not use.

The layers and their allowed edges are listed in layers.txt beside this script. Test code
(*_test.cc, *_fixture.h, anything under a testing/ or testdata/ folder) sits above every layer and is not
checked. Usage: check_layers.py [--root DIR] [--layers FILE] [--extra FILE:HEADER ...]
--extra pretends FILE also includes HEADER (the self-test uses it to show a forbidden edge
fails).
"""
import argparse
import os
import re
import sys

INCLUDE = re.compile(r'^\s*#\s*include\s+"([^"]+)"', re.M)


def read_layers(path):
    """Returns [(name, [prefixes], set(allowed))] in file order."""
    layers = []
    with open(path, encoding="utf-8") as f:
        for number, raw in enumerate(f, 1):
            line = raw.split("#", 1)[0].strip()
            if not line:
                continue
            if ":" not in line:
                sys.exit(f"{path}:{number}: expected 'name prefixes... : allowed...'")
            left, right = line.split(":", 1)
            words = left.split()
            if len(words) < 2:
                sys.exit(f"{path}:{number}: a layer needs a name and at least one folder")
            layers.append((words[0], words[1:], set(right.split())))
    names = {name for name, _, _ in layers}
    for name, _, allowed in layers:
        unknown = allowed - names - {"*"}
        if unknown:
            sys.exit(f"{path}: layer {name} allows unknown layers {sorted(unknown)}")
    return layers


def layer_of(path, layers):
    """The layer whose longest folder prefix holds path, or None."""
    best, best_len = None, -1
    for name, prefixes, _ in layers:
        for prefix in prefixes:
            if path.startswith(prefix) and len(prefix) > best_len:
                best, best_len = name, len(prefix)
    return best


def is_test_code(path):
    base = os.path.basename(path)
    return (base.endswith("_test.cc") or base.endswith("_fixture.h") or "/testing/" in path
            or "/testdata/" in path)


def main():
    here = os.path.dirname(os.path.abspath(__file__))
    parser = argparse.ArgumentParser()
    parser.add_argument("--root", default=os.path.normpath(os.path.join(here, "..", "..")))
    parser.add_argument("--layers", default=os.path.join(here, "layers.txt"))
    parser.add_argument("--extra", action="append", default=[])
    args = parser.parse_args()

    layers = read_layers(args.layers)
    allowed = {name: edges for name, _, edges in layers}
    extra = {}
    for item in args.extra:
        file, header = item.split(":", 1)
        extra.setdefault(file, []).append(header)

    violations = []
    checked = 0
    for name, prefixes, _ in layers:
        for prefix in prefixes:
            for dirpath, _, files in os.walk(os.path.join(args.root, prefix)):
                for file in sorted(files):
                    if not file.endswith((".h", ".cc")):
                        continue
                    path = os.path.relpath(os.path.join(dirpath, file), args.root)
                    if layer_of(path, layers) != name or is_test_code(path):
                        continue
                    checked += 1
                    with open(os.path.join(args.root, path), encoding="utf-8") as f:
                        headers = INCLUDE.findall(f.read())
                    for header in headers + extra.get(path, []):
                        target = layer_of(header, layers)
                        if target is None or target == name:
                            continue
                        if target not in allowed[name] and "*" not in allowed[name]:
                            violations.append(f"{path}: includes {header} "
                                              f"({name} may not use {target})")
    for line in violations:
        print(line)
    print(f"{checked} files checked, {len(violations)} forbidden includes")
    return 1 if violations else 0


if __name__ == "__main__":
    sys.exit(main())
