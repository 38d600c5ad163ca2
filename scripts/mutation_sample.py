#!/usr/bin/env python3
"""What the tests catch: small mutations of the library, one at a time.

Draws lines of the library's sources that hold a comparison, a logical
operator, a boolean return or an integer step, with a seed; changes each
(a flipped comparison, an off-by-one, a dropped check), rebuilds and runs the
tests. A mutation is caught when any test fails or the run times out; one
that does not compile is replaced by another draw.

  scripts/mutation_sample.py BUILD_DIR [--count 55] [--seed 2611]
      [--only FILE...] [--exclude REGEX] [--out results.tsv]

The build directory must be configured with NXBASE_BUILD_TESTS=ON. The
sources are restored after every mutation, also on Ctrl-C. The same seed and
sources draw the same mutations, so a run before and after a change of the
tests compares like with like.
"""
import argparse
import os
import pathlib
import random
import re
import signal
import subprocess
import sys
import time

ROOT = pathlib.Path(__file__).resolve().parent.parent
# Long tests that check timing or tools rather than behaviour of one family.
DEFAULT_EXCLUDE = ("PostOfficeModelTest|IdleApplicationSleeps|Docs\\.|InstalledPackage|"
                   "Format\\.|Layering\\.|python\\.")

# (pattern, replacement) pairs; the first that matches a line is applied once.
OPERATORS = [
    (r"(?<![<>=!])<=(?!=)", "<"),
    (r"(?<![<>=!])>=(?!=)", ">"),
    (r"(?<![<>=!-])<(?![<=])(?=\s)", "<="),
    (r"(?<![<>=!-])>(?![>=])(?=\s)", ">="),
    (r"==", "!="),
    (r"!=", "=="),
    (r"&&", "||"),
    (r"\|\|", "&&"),
    (r"\+ 1\b", "+ 2"),
    (r"- 1\b", "- 2"),
    (r"\breturn true;", "return false;"),
    (r"\breturn false;", "return true;"),
    (r"\bif \(!", "if ("),
]


def candidates(path):
    lines = path.read_text(encoding="utf-8", errors="replace").splitlines()
    found = []
    for number, line in enumerate(lines):
        code = line.split("//")[0]
        stripped = code.strip()
        if not stripped or stripped.startswith(("#", "*", "/*", "static_assert")):
            continue
        if "template" in code or "include" in code:
            continue
        for pattern, replacement in OPERATORS:
            if re.search(pattern, code):
                found.append((number, pattern, replacement))
                break
    return lines, found


def run(command, timeout):
    """The command's exit status, or -1 when it ran out of time. A command
    that runs out of time is ended with everything it started: a hung test
    would otherwise keep its test launcher (and what the test started) alive."""
    process = subprocess.Popen(command, cwd=ROOT, stdout=subprocess.DEVNULL,
                               stderr=subprocess.DEVNULL, start_new_session=True)
    try:
        return process.wait(timeout=timeout)
    except subprocess.TimeoutExpired:
        os.killpg(process.pid, signal.SIGKILL)
        process.wait()
        return -1


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("build")
    parser.add_argument("--count", type=int, default=55)
    parser.add_argument("--seed", type=int, default=2611)
    parser.add_argument("--only", nargs="*")
    parser.add_argument("--exclude", default=DEFAULT_EXCLUDE)
    parser.add_argument("--out", default="mutations.tsv")
    args = parser.parse_args()
    build = pathlib.Path(args.build).resolve()

    files = sorted(p for d in ("source", "platform") for p in (ROOT / d).rglob("*.cpp"))
    random.seed(args.seed)
    draws = []  # a fixed order of (file, line, pattern, replacement)
    for _ in range(args.count * 4):
        path = random.choice(files)
        lines, found = candidates(path)
        if found:
            number, pattern, replacement = random.choice(found)
            draws.append((path, number, pattern, replacement))
    if args.only:
        wanted = set(args.only)
        draws = [d for d in draws if str(d[0].relative_to(ROOT)) in wanted]

    caught = tried = 0
    seen = set()
    with open(args.out, "w", encoding="utf-8") as out:
        for path, number, pattern, replacement in draws:
            if tried >= args.count and not args.only:
                break
            if (path, number) in seen:
                continue
            seen.add((path, number))
            original = path.read_text(encoding="utf-8")
            lines = original.splitlines(keepends=True)
            mutated_line = re.sub(pattern, replacement, lines[number], count=1)
            lines[number] = mutated_line
            try:
                path.write_text("".join(lines), encoding="utf-8")
                if run(["cmake", "--build", str(build), "-j2"], 900) != 0:
                    continue  # does not compile: draw on
                start = time.time()
                result = run(["ctest", "--test-dir", str(build), "-j2", "--timeout", "120",
                              "-E", args.exclude], 900)
                tried += 1
                killed = result != 0
                caught += killed
                where = f"{path.relative_to(ROOT)}:{number + 1}"
                # Which tests caught it: the candidates for keeping when tests are pruned.
                failed = build / "Testing" / "Temporary" / "LastTestsFailed.log"
                if result == -1:
                    catchers = "time-out"  # the list, if any, is an earlier run's
                else:
                    catchers = ",".join(line.split(":", 1)[-1].strip()
                                        for line in failed.read_text().splitlines()) \
                        if killed and failed.exists() else ""
                out.write(f"{where}\t{'caught' if killed else 'missed'}\t"
                          f"{mutated_line.strip()}\t{time.time() - start:.0f}s\t{catchers}\n")
                out.flush()
                print(f"{tried:3d} {where} {'caught' if killed else 'MISSED'}", flush=True)
            finally:
                path.write_text(original, encoding="utf-8")
    run(["cmake", "--build", str(build), "-j2"], 900)
    print(f"caught {caught} of {tried} mutations (seed {args.seed})")


if __name__ == "__main__":
    sys.exit(main())
