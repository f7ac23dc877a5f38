#!/usr/bin/env python3
"""Mutant generator for scripts/mutate.sh.

Finds mutation sites in the .cpp files of the six service folders, orders
them with a seeded shuffle (round-robin over the folders, and within a folder
over the kinds) and prints or applies them. The same seed and the same source
give the same list; mutate.sh takes them in order and skips the stillborn.

  mutants.py list  --seed N --limit N    one line per mutant
  mutants.py apply --seed N --index I    apply mutant I to the tree
"""
import argparse
import random
import re
import sys
from pathlib import Path

FOLDERS = ["service", "monitor", "pipe", "discovery", "transport", "volume"]
KINDS = ["compare", "constant", "call", "errcode", "lock"]
ROOT = Path(__file__).resolve().parent.parent

FLIP = {"<": ">=", ">=": "<", ">": "<=", "<=": ">", "==": "!=", "!=": "=="}
COMPARE = re.compile(r"(?<=\s)(<=|>=|==|!=|<|>)(?=\s)")
NUMBER = re.compile(r"(?<![\w.'])(\d+)(?![\w.'x])")
STRING = re.compile(r'"(?:[^"\\]|\\.)*"|\'(?:[^\'\\]|\\.)\'')
CALL = re.compile(r"^(\s*)((?:[A-Za-z_]\w*(?:::|\.|->))*[A-Za-z_]\w*)\((.*)\);\s*$")
CODE = re.compile(r"\b(?:ERROR|WAIT)_[A-Z0-9_]+\b")
GUARD = re.compile(r"^\s*(?:StateLock|RescanGuard|std::(?:lock_guard|unique_lock|scoped_lock)\b.*)\s+\w+.*;\s*$")
ACQUIRE = re.compile(r"^\s*EnterCriticalSection\(.*\);\s*$")
RELEASE = re.compile(r"^\s*(?:LeaveCriticalSection|ReleaseMutex)\(.*\);\s*$")
# Calls whose loss changes nothing a test could observe by design (console
# and log text) and the locking calls, which have a kind of their own.
QUIET_CALLS = re.compile(r"ConsolePrint|Log\w*|Trace\w*|static_assert|EnterCriticalSection|"
                         r"LeaveCriticalSection|ReleaseMutex|WaitForSingleObject|"
                         r"InitializeCriticalSection")
NOT_CALLS = {"return", "if", "while", "for", "switch", "sizeof", "delete", "case"}
# A swapped code: each constant becomes another one a caller may well test for.
WAIT_SWAP = {"WAIT_OBJECT_0": "WAIT_TIMEOUT", "WAIT_TIMEOUT": "WAIT_OBJECT_0",
             "WAIT_ABANDONED": "WAIT_OBJECT_0", "WAIT_FAILED": "WAIT_TIMEOUT",
             "WAIT_IO_COMPLETION": "WAIT_OBJECT_0"}


def code_part(line):
    """The line without a trailing // comment and with string contents blanked."""
    text = STRING.sub(lambda m: m.group(0)[0] + " " * (len(m.group(0)) - 2) + m.group(0)[-1], line)
    cut = text.find("//")
    return text if cut < 0 else text[:cut]


def sources():
    for folder in FOLDERS:
        for path in sorted((ROOT / "src" / folder).glob("*.cpp")):
            if path.name == "main.cpp":
                continue
            yield folder, path


def error_codes():
    codes = set()
    for _, path in sources():
        for line in path.read_text().splitlines():
            codes.update(c for c in CODE.findall(code_part(line)) if c.startswith("ERROR_"))
    return sorted(codes)


def swap_code(code, errors):
    if code in WAIT_SWAP:
        return WAIT_SWAP[code]
    if code == "ERROR_SUCCESS":
        return "ERROR_INVALID_FUNCTION"
    if code not in errors:
        return None
    others = [c for c in errors if c != "ERROR_SUCCESS"]
    return others[(others.index(code) + 1) % len(others)] if len(others) > 1 else None


def sites(folder, path, errors):
    """Every mutant of one file: (kind, first line index, old lines, new lines)."""
    lines = path.read_text().splitlines()
    out = []
    for i, line in enumerate(lines):
        stripped = line.strip()
        if not stripped or stripped.startswith(("//", "#", "*", "/*")) or "static_assert" in line:
            continue
        code = code_part(line)

        def replaced(start, end, new):
            return line[:start] + new + line[end:]

        for m in COMPARE.finditer(code):
            out.append(("compare", i, [line], [replaced(m.start(), m.end(), FLIP[m.group(1)])]))
        for m in NUMBER.finditer(code):
            if code[:m.start()].rstrip().endswith("[") or "reserve(" in code:
                continue  # a buffer size, not a value the code decides on
            value = int(m.group(1))
            new = value - 1 if value > 1 else value + 1
            out.append(("constant", i, [line], [replaced(m.start(), m.end(), str(new))]))
        for m in CODE.finditer(code):
            new = swap_code(m.group(0), errors)
            if new:
                out.append(("errcode", i, [line], [replaced(m.start(), m.end(), new)]))
        call = CALL.match(code)
        if call and call.group(2) not in NOT_CALLS and not QUIET_CALLS.search(call.group(2)) \
                and code.count("(") == code.count(")") and " = " not in code:
            out.append(("call", i, [line], [call.group(1) + "(void)0;  // call dropped"]))
        indent = line[:len(line) - len(line.lstrip())]
        if GUARD.match(code) or ACQUIRE.match(code):
            out.append(("lock", i, [line], [indent + "(void)0;  // lock dropped"]))
        # A release moved above the statement before it, an acquire below the
        # statement after it: part of the critical section runs unlocked.
        if RELEASE.match(code) and i > 0 and lines[i - 1].rstrip().endswith(";") \
                and not RELEASE.match(lines[i - 1]) and not lines[i - 1].strip().startswith("return"):
            out.append(("lock", i - 1, [lines[i - 1], line], [line, lines[i - 1]]))
        if ACQUIRE.match(code) and i + 1 < len(lines) and lines[i + 1].rstrip().endswith(";") \
                and not lines[i + 1].strip().startswith("return"):
            out.append(("lock", i, [line, lines[i + 1]], [lines[i + 1], line]))
    return out


def ordered(seed):
    rng = random.Random(seed)
    errors = error_codes()
    per_folder = {}
    for folder, path in sources():
        for kind, i, old, new in sites(folder, path, errors):
            rel = path.relative_to(ROOT).as_posix()
            per_folder.setdefault(folder, {}).setdefault(kind, []).append((rel, i, kind, old, new))
    # Within a folder: the kinds in turn, each kind's sites shuffled.
    queues = {}
    for folder in FOLDERS:
        kinds = per_folder.get(folder, {})
        for k in kinds.values():
            rng.shuffle(k)
        merged = []
        while any(kinds.values()):
            for kind in KINDS:
                if kinds.get(kind):
                    merged.append(kinds[kind].pop())
        queues[folder] = merged
    result = []
    while any(queues.values()):
        for folder in FOLDERS:
            if queues[folder]:
                result.append(queues[folder].pop(0))
    return result


def describe(m):
    rel, i, kind, old, new = m
    if len(old) == 1:
        return f"{rel}:{i + 1} {kind}: {old[0].strip()} -> {new[0].strip()}"
    if ACQUIRE.match(old[0]):
        return f"{rel}:{i + 1} {kind}: {old[0].strip()} moved down past {old[1].strip()}"
    return f"{rel}:{i + 2} {kind}: {old[1].strip()} moved up past {old[0].strip()}"


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("action", choices=["list", "apply", "count"])
    parser.add_argument("--seed", type=int, default=14)
    parser.add_argument("--limit", type=int, default=0)
    parser.add_argument("--index", type=int, default=0)
    args = parser.parse_args()
    mutants = ordered(args.seed)
    if args.action == "count":
        print(len(mutants))
    elif args.action == "list":
        for n, m in enumerate(mutants[:args.limit or None]):
            print(f"{n}\t{describe(m)}")
    else:
        rel, i, _, old, new = mutants[args.index]
        path = ROOT / rel
        lines = path.read_text().split("\n")
        if lines[i:i + len(old)] != old:
            sys.exit(f"mutant {args.index}: {rel}:{i + 1} does not match the source")
        lines[i:i + len(old)] = new
        path.write_text("\n".join(lines))
        print(describe(mutants[args.index]))


if __name__ == "__main__":
    main()
