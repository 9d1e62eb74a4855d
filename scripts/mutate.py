#!/usr/bin/env python3
"""Plants small faults in src/ one at a time and runs the release tests.

    scripts/mutate.py [--build build/release] [--seed 16] [--mutants 40]

Each mutant is one small semantic change in one line of a .cc file under
src/: a flipped comparison or equality, a swapped boolean or logical
operator, an integer constant off by one, or a deleted call statement.
Sites are found outside comments and string literals and tried in an
order drawn from a fixed seed and each site's own text (file, line text,
operator, position in the line), not its line number: the same seed
evaluates the same mutants, and an edit elsewhere in src/ does not
reshuffle them. A mutant that does not compile is skipped and does not
count. After each mutant the tree is rebuilt
incrementally and the tests run (quick groups first; a failure anywhere,
or a run past the time limit, kills the mutant). The file is restored
whatever happens. The report goes to stdout and BUILD/mutation.txt.
"""
import argparse
import hashlib
import os
import re
import subprocess
import sys
import time

ROOT = os.path.abspath(os.path.join(os.path.dirname(__file__), ".."))

# Groups that start the real programs; they run only when the quick ones pass.
SLOW_TESTS = r"e2e|upload_content"


def code_mask(text):
    """The text with comments, string and character literals blanked out,
    so positions still line up with the original."""
    out = list(text)
    i, n = 0, len(text)
    while i < n:
        c = text[i]
        if text.startswith("//", i):
            j = text.find("\n", i)
            j = n if j < 0 else j
            out[i:j] = " " * (j - i)
            i = j
        elif text.startswith("/*", i):
            j = text.find("*/", i + 2)
            j = n if j < 0 else j + 2
            out[i:j] = [ch if ch == "\n" else " " for ch in text[i:j]]
            i = j
        elif text.startswith('R"', i) and (i == 0 or not (text[i - 1].isalnum() or text[i - 1] == "_")):
            m = re.match(r'R"([^(]*)\(', text[i:])
            end = text.find(")" + (m.group(1) if m else "") + '"', i)
            j = n if end < 0 else end + len(m.group(1) if m else "") + 2
            out[i:j] = [ch if ch == "\n" else " " for ch in text[i:j]]
            i = j
        elif c in "\"'":
            if c == "'" and i > 0 and text[i - 1].isalnum():  # digit separator
                i += 1
                continue
            j = i + 1
            while j < n and text[j] != c and text[j] != "\n":
                j += 2 if text[j] == "\\" else 1
            j = min(j + 1, n)
            out[i:j] = " " * (j - i)
            i = j
        else:
            i += 1
    return "".join(out)


OPERATORS = [
    ("flip equality", re.compile(r"(?<=\s)(==|!=)(?=\s)"), lambda m: "!=" if m.group(1) == "==" else "=="),
    ("shift boundary", re.compile(r"(?<=\s)(<=|>=|<|>)(?=\s)"),
     lambda m: {"<": "<=", "<=": "<", ">": ">=", ">=": ">"}[m.group(1)]),
    ("swap logic", re.compile(r"(?<=\s)(&&|\|\|)(?=\s)"), lambda m: "||" if m.group(1) == "&&" else "&&"),
    ("swap boolean", re.compile(r"\b(true|false)\b"), lambda m: "false" if m.group(1) == "true" else "true"),
    ("off by one", re.compile(r"(?<![\w.])(\d+)(?![\w.'])"), lambda m: str(int(m.group(1)) + 1)),
]
CALL_STATEMENT = re.compile(r"^\s*(?:[A-Za-z_][\w:]*(?:\.|->))*[A-Za-z_]\w*\s*\(.*\)\s*;\s*$")
NOT_A_CALL = re.compile(r"^\s*(return|if|while|for|switch|case|delete|throw|co_\w+|static_assert)\b")


def sites_in(path):
    text = open(path, encoding="utf-8").read()
    masked = code_mask(text)
    lines, masked_lines = text.split("\n"), masked.split("\n")
    found = []
    for number, (line, code) in enumerate(zip(lines, masked_lines), start=1):
        stripped = code.strip()
        if not stripped or stripped.startswith("#"):
            continue
        for name, pattern, replace in OPERATORS:
            for m in pattern.finditer(code):
                mutated = line[: m.start()] + replace(m) + line[m.end():]
                found.append((path, number, name, line, mutated, m.start()))
        if CALL_STATEMENT.match(code) and not NOT_A_CALL.match(code) and code.count("(") == code.count(")"):
            found.append((path, number, "delete call", line, re.match(r"^\s*", line).group(0) + ";", 0))
    return found


def order(sites, seed):
    """Sites in the order of a hash of the seed and each site's own text;
    repeats of one line in a file are told apart by their count."""
    seen = {}
    keyed = []
    for site in sites:
        path, _, name, line, _, column = site
        text = f"{seed}|{os.path.relpath(path, ROOT)}|{line.strip()}|{name}|{column}"
        seen[text] = seen.get(text, 0) + 1
        keyed.append((hashlib.sha256(f"{text}|{seen[text]}".encode()).hexdigest(), site))
    return [site for _, site in sorted(keyed, key=lambda k: k[0])]


def all_sites():
    files = []
    for folder, _, names in os.walk(os.path.join(ROOT, "src")):
        files += [os.path.join(folder, n) for n in names if n.endswith(".cc")]
    sites = []
    for path in sorted(files):
        sites += sites_in(path)
    return sites


def run(cmd, timeout):
    """(exit status, output); None as status when it ran past timeout."""
    proc = subprocess.Popen(cmd, cwd=ROOT, stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
                            start_new_session=True, text=True)
    try:
        out, _ = proc.communicate(timeout=timeout)
        return proc.returncode, out
    except subprocess.TimeoutExpired:
        os.killpg(proc.pid, 9)
        out, _ = proc.communicate()
        return None, out


def build(args):
    return run(["cmake", "--build", args.build, "-j", str(args.jobs)], 1800)[0] == 0


def tests_pass(args, timeout):
    """True when every test passes; False on a failure or timeout."""
    ctest = ["ctest", "--test-dir", args.build, "-j", str(args.jobs), "--timeout", str(int(timeout))]
    deadline = time.monotonic() + timeout
    for selection in (["-E", SLOW_TESTS], ["-R", SLOW_TESTS]):
        status, _ = run(ctest + selection, max(1, deadline - time.monotonic()))
        if status != 0:
            return False
    return True


def main():
    parser = argparse.ArgumentParser(description=__doc__.split("\n")[0])
    parser.add_argument("--build", default="build/release")
    parser.add_argument("--seed", type=int, default=16)
    parser.add_argument("--mutants", type=int, default=40)
    parser.add_argument("--jobs", type=int, default=os.cpu_count() or 2)
    args = parser.parse_args()
    report_path = os.path.join(ROOT, args.build, "mutation.txt")
    report = open(report_path, "w")

    def say(line):
        print(line, flush=True)
        report.write(line + "\n")
        report.flush()

    sites = order(all_sites(), args.seed)
    say(f"{len(sites)} sites in src/, seed {args.seed}, {args.mutants} mutants")

    if not build(args):
        sys.exit("mutate: the unmutated tree does not build")
    started = time.monotonic()
    if not tests_pass(args, 3600):
        sys.exit("mutate: the unmutated tree fails its tests")
    baseline = time.monotonic() - started
    limit = max(120, 3 * baseline)
    say(f"unmutated tests pass in {baseline:.0f} s; a mutant's tests get {limit:.0f} s")

    killed = evaluated = skipped = 0
    survivors = []
    for path, number, name, original_line, mutated_line, _ in sites:
        if evaluated == args.mutants:
            break
        original = open(path, encoding="utf-8").read()
        lines = original.split("\n")
        lines[number - 1] = mutated_line
        where = f"{os.path.relpath(path, ROOT)}:{number}"
        try:
            with open(path, "w", encoding="utf-8") as f:
                f.write("\n".join(lines))
            if not build(args):
                skipped += 1
                continue
            evaluated += 1
            started = time.monotonic()
            caught = not tests_pass(args, limit)
            seconds = time.monotonic() - started
            killed += caught
            verdict = "killed  " if caught else "SURVIVED"
            say(f"[{evaluated:2}] {verdict} {where} {name}: {mutated_line.strip()}   ({seconds:.0f} s)")
            if not caught:
                survivors.append(f"{where} {name}: {original_line.strip()}  ->  {mutated_line.strip()}")
        finally:
            with open(path, "w", encoding="utf-8") as f:
                f.write(original)
    build(args)
    say(f"{killed} of {evaluated} mutants killed ({100.0 * killed / max(evaluated, 1):.0f} %), "
        f"{skipped} did not compile and were skipped")
    for s in survivors:
        say("  survived: " + s)


if __name__ == "__main__":
    main()
