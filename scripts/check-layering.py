#!/usr/bin/env python3
"""Fails when a source includes a header against the allowed direction.

Usage: check-layering.py [ROOT]   (default: the checkout this script is in)

Prints one line per offending include, `file:line: ...`, and exits 1; exits
0 when every include runs the allowed way. A C/C++ source in a folder that
no rule covers is an error too, so that a new folder gets its rule.
"""
import os
import re
import sys

# The kernel module's folders, and what tools and tests may see of it.
MODULE = ["framework/", "swsec/", "fhs/", "mgmt/", "module/"]
BLACK_BOX = ["contract/", "platform/", "host/", "tests/support/"]
# White-box tests may also share the fixtures of tests/unit.
WHITE_BOX = BLACK_BOX + MODULE + ["tests/unit/"]
TOOL_WINGS = ["tools/cli/", "tools/replay/", "tools/live/", "tools/session/", "tools/fastpath/"]

# Who may include what. A key ending in "/" is a folder, any other key one
# file; the longest key that covers a source decides. Besides what its
# entry lists, a source may include from its own folder.
RULES = {
    "platform/": [],
    "contract/": [],
    "framework/": ["platform/", "contract/state_blob.h"],
    "swsec/": ["framework/", "platform/", "contract/"],
    "fhs/": ["swsec/", "framework/", "platform/", "contract/"],
    "mgmt/": ["swsec/", "fhs/", "framework/", "platform/", "contract/"],
    "module/": MODULE + ["platform/", "contract/"],
    # The host walks tags as the module does: one walk for both.
    "host/": ["platform/", "contract/frame_walk.h"],
    "bpf/": ["contract/"],
    # The tool's wings, downward only.
    "tools/session/": ["contract/", "platform/", "host/"],
    "tools/fastpath/": ["bpf/", "contract/", "platform/", "host/"],
    "tools/replay/": ["tools/session/", "contract/", "platform/", "host/"],
    "tools/live/": ["tools/session/", "tools/fastpath/", "contract/", "platform/", "host/"],
    "tools/cli/": ["tools/replay/", "tools/live/", "tools/session/", "tools/fastpath/", "contract/",
                   "platform/", "host/"],
    "bench/": BLACK_BOX,
    # Tests drive the module through the host and the tools; those below
    # test module pieces on their own and may read the module's records.
    "tests/": BLACK_BOX + TOOL_WINGS + ["bpf/"],
    "tests/unit/": WHITE_BOX,
    "tests/unit_linked/": WHITE_BOX,
    "tests/unit_frame_loop/": WHITE_BOX,
    # The module's saved state is read back with the tool's own decoder.
    "tests/module/": WHITE_BOX + ["tools/session/"],
    "tests/fhs/": WHITE_BOX,
    "fuzz/": BLACK_BOX + TOOL_WINGS,
    "fuzz/dhcp_parse_fuzz.cc": WHITE_BOX,
    "fuzz/fhs_parse_fuzz.cc": WHITE_BOX,
}

SOURCE_SUFFIXES = (".h", ".hh", ".hpp", ".c", ".cc", ".cpp")
SKIP_DIRS = {".git", "build"}
INCLUDE = re.compile(r'^\s*#\s*include\s*"([^"]+)"')
# Where a quoted include is looked for after the including file's folder.
INCLUDE_ROOTS = ["", "tools/", "tests/"]


def covers(key, path):
    return path.startswith(key) if key.endswith("/") else path == key


def rule_for(path):
    keys = [key for key in RULES if covers(key, path)]
    return max(keys, key=len) if keys else None


def resolve(root, source, name):
    """The included file, relative to ROOT, or None when it is not the project's."""
    candidates = [os.path.join(os.path.dirname(source), name)] + [base + name for base in INCLUDE_ROOTS]
    for candidate in candidates:
        candidate = os.path.normpath(candidate)
        if not candidate.startswith("..") and os.path.isfile(os.path.join(root, candidate)):
            return candidate.replace(os.sep, "/")
    return None


def sources(root):
    for folder, dirs, files in os.walk(root):
        dirs[:] = sorted(d for d in dirs if d not in SKIP_DIRS and not d.startswith(("build", ".")))
        for name in sorted(files):
            if name.endswith(SOURCE_SUFFIXES):
                yield os.path.relpath(os.path.join(folder, name), root).replace(os.sep, "/")


def check(root):
    problems = []
    uncovered = set()
    for source in sources(root):
        key = rule_for(source)
        if key is None:
            uncovered.add(os.path.dirname(source) + "/")
            continue
        own = os.path.dirname(source) + "/"
        allowed = [own] + RULES[key]
        with open(os.path.join(root, source), encoding="utf-8", errors="replace") as text:
            for number, line in enumerate(text, 1):
                match = INCLUDE.match(line)
                if not match:
                    continue
                target = resolve(root, source, match.group(1))
                if target is None or any(covers(entry, target) for entry in allowed):
                    continue
                problems.append(f'{source}:{number}: includes "{match.group(1)}" ({target}): '
                                f'{key} may include only {", ".join(allowed)}')
    for folder in sorted(uncovered):
        problems.append(f"{folder}: no layering rule covers this folder: add one to scripts/check-layering.py")
    return problems


def main():
    root = sys.argv[1] if len(sys.argv) > 1 else os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
    problems = check(root)
    for problem in problems:
        print(problem)
    return 1 if problems else 0


if __name__ == "__main__":
    sys.exit(main())
