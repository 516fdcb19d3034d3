#!/usr/bin/env python3
"""Mutation check: does the test suite catch small faults in the module's C++?

    ./run mutants [--sample N] [--seed S] [--timeout SECONDS] [--label NAME]
    ./run mutants --list                  every candidate change, no run
    ./run mutants --rerun RESULTS.json    the survivors of an earlier run again
    ./run mutants --compare A.json B.json mutants one run caught and the other did not

One change at a time is made to a copy of src/pysource/ (never the working tree):
a comparison negated (== !=, < >=, > <=), && and || swapped, `return true` and
`return false` exchanged, ++ and -- exchanged, or one statement that only calls
something removed.  Comments, string literals, preprocessor lines and static
assertions are never changed.  Candidates are sorted by file and position and
the sample is drawn with random.Random(seed), so the same seed on the same
sources gives the same sample whatever the suite looks like.

At start the sources, the suite and the stand-in host are copied into a scratch
directory under build/mutants/, so edits made to the working tree while a run
goes on do not affect it.  CMake is configured once there (Ninja, -O1, warnings
not fatal, assertions compiled as in the release build); each mutant rebuilds
the coordinator incrementally and runs `pytest -x` against it, with hypothesis
derandomized and without its example database so that two runs differ only by
the suite.  A run that exceeds the timeout counts as caught ("timed out").

Results are printed per file and in total, survivors are listed with file, line
and the change, and everything is saved as JSON under build/mutants/ (updated
after every mutant, so an interrupted run still leaves its partial results).
"""

import argparse
import hashlib
import json
import os
import random
import re
import shutil
import signal
import subprocess
import sys
import time
from collections import Counter, defaultdict
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent
MUTATED = ROOT / "src" / "pysource"
OUT = ROOT / "build" / "mutants"
VENV = ROOT / ".venv" / "bin"
SNAPSHOT = ["src", "CMakeLists.txt", "pyproject.toml", "tests", "standin", "bench"]
TARGET = "scancoordinator"

# ---- finding candidate changes ----------------------------------------------------


def mask_source(text):
    """The text with comments, string and character literals and preprocessor
    lines (with their continuations) blanked out; positions and newlines kept."""
    out = list(text)
    i, n = 0, len(text)
    line_start = True
    while i < n:
        c = text[i]
        if line_start and c == "#":
            j = i
            while j < n and not (text[j] == "\n" and text[j - 1] != "\\"):
                j += 1
            for k in range(i, j):
                out[k] = " "
            i = j
            continue
        if c == "\n":
            line_start = True
            i += 1
            continue
        if c not in " \t":
            line_start = False
        if text.startswith("//", i):
            j = text.find("\n", i)
            j = n if j < 0 else j
            for k in range(i, j):
                out[k] = " "
            i = j
            continue
        if text.startswith("/*", i):
            j = text.find("*/", i + 2)
            j = n if j < 0 else j + 2
            for k in range(i, j):
                if out[k] != "\n":
                    out[k] = " "
            i = j
            continue
        if c == 'R' and text.startswith('R"', i):
            m = re.match(r'R"([^(\s]*)\(', text[i:])
            if m:
                end = text.find(")" + m.group(1) + '"', i)
                j = n if end < 0 else end + len(m.group(1)) + 2
                for k in range(i + 1, j):
                    if out[k] != "\n":
                        out[k] = " "
                i = j
                continue
        if c in "\"'":
            if c == "'" and i > 0 and text[i - 1].isalnum():
                i += 1  # a digit separator
                continue
            j = i + 1
            while j < n and text[j] != c:
                j += 2 if text[j] == "\\" else 1
            for k in range(i + 1, min(j, n)):
                out[k] = " "
            i = j + 1
            continue
        i += 1
    return "".join(out)


def blank_static_tables(masked):
    """Blank static assertions: changing them only produces compile errors."""
    out = list(masked)
    for m in re.finditer(r"\bstatic_assert\s*\(", masked):
        j = masked.find(";", m.start())
        for k in range(m.start(), j + 1):
            if out[k] != "\n":
                out[k] = " "
    return "".join(out)


NEGATE = {"==": "!=", "!=": "==", "<": ">=", ">=": "<", ">": "<=", "<=": ">"}
# clang-format puts spaces around binary operators and none before the brackets of
# a template argument list or after the && of an rvalue reference, so requiring
# whitespace on both sides separates comparisons from those.
RE_COMPARE = re.compile(r"(?<=\s)(==|!=|<=|>=|<|>)(?=\s)")
RE_LOGIC = re.compile(r"(?<=\s)(&&|\|\|)(?=\s)")
RE_INCDEC = re.compile(r"(?<![+\-])(\+\+|--)(?![+\-=>])")
RE_RETURN_BOOL = re.compile(r"\breturn\s+(true|false)\s*;")
RE_CALL_START = re.compile(
    r"(?:[A-Za-z_]\w*\s*(?:::|\.|->)\s*)*([A-Za-z_]\w*)\s*(?:<[\w:,\s\*&]*>)?\s*\(")
KEYWORDS = {"if", "for", "while", "switch", "return", "sizeof", "static_assert", "catch",
            "decltype", "alignof", "throw", "new", "delete", "case", "do", "else"}
# Macros that open a function body or a definition, not a statement.
DEFINING_MACROS = re.compile(r"^(PY_GUARD|SC_METHOD|SC_DEF|SC_PRIVATE|SC_\w*GETTER)$")


def matching_open(masked, close):
    depth = 0
    for k in range(close, -1, -1):
        if masked[k] == ")":
            depth += 1
        elif masked[k] == "(":
            depth -= 1
            if depth == 0:
                return k
    return -1


def statement_start(masked, pos):
    """True when `pos` (the first character of an identifier) starts a statement."""
    k = pos - 1
    while k >= 0 and masked[k].isspace():
        k -= 1
    if k < 0:
        return False
    prev = masked[k]
    if prev in ";{}":
        return True
    if prev == ")":
        # Only the header of a control statement: if (...) stmt; for (...) stmt;
        o = matching_open(masked, k)
        if o < 0:
            return False
        head = masked[max(0, o - 12):o].rstrip()
        return re.search(r"\b(if|for|while)$", head) is not None
    if masked[max(0, k - 3):k + 1] == "else":
        return not (k >= 4 and (masked[k - 4].isalnum() or masked[k - 4] == "_"))
    if prev == ":" and (k == 0 or masked[k - 1] != ":"):
        line = masked[masked.rfind("\n", 0, k) + 1:k].strip()
        return line.startswith("case ") or line == "default"
    return False


def statement_end(masked, pos):
    """Index just past the ';' ending the statement at pos, or -1 when the
    statement holds a block or a top-level assignment (not a plain call)."""
    depth = 0
    k = pos
    n = len(masked)
    while k < n:
        c = masked[k]
        if c in "([":
            depth += 1
        elif c in ")]":
            depth -= 1
            if depth < 0:
                return -1
        elif c in "{}" and depth == 0:
            return -1
        elif c == ";" and depth == 0:
            return k + 1
        elif c == "=" and depth == 0:
            before, after = masked[k - 1], masked[k + 1] if k + 1 < n else ""
            if before not in "=!<>" and after != "=":
                return -1
        k += 1
    return -1


def line_col(text, pos):
    line = text.count("\n", 0, pos) + 1
    return line, pos - (text.rfind("\n", 0, pos) + 1) + 1


def candidates_in(rel, text):
    masked = blank_static_tables(mask_source(text))
    found = []

    def add(kind, start, end, after):
        line, col = line_col(text, start)
        found.append({"file": rel, "line": line, "col": col, "start": start, "end": end,
                      "kind": kind, "before": text[start:end], "after": after})

    for m in RE_COMPARE.finditer(masked):
        add("compare", m.start(), m.end(), NEGATE[m.group(1)])
    for m in RE_LOGIC.finditer(masked):
        add("logic", m.start(), m.end(), "||" if m.group(1) == "&&" else "&&")
    for m in RE_INCDEC.finditer(masked):
        add("incdec", m.start(), m.end(), "--" if m.group(1) == "++" else "++")
    for m in RE_RETURN_BOOL.finditer(masked):
        flipped = "false" if m.group(1) == "true" else "true"
        add("return", m.start(), m.end(), f"return {flipped};")
    for m in re.finditer(r"[A-Za-z_]", masked):
        s = m.start()
        if s > 0 and (masked[s - 1].isalnum() or masked[s - 1] in "_:.>"):
            continue
        call = RE_CALL_START.match(masked, s)
        if not call or call.group(1) in KEYWORDS or DEFINING_MACROS.match(call.group(1)):
            continue
        head = masked[s:call.end()]
        if re.match(r"(?:const\s+|static\s+|auto\s+)", head):
            continue
        if not statement_start(masked, s):
            continue
        e = statement_end(masked, s)
        if e < 0 or masked[s:e - 1].rstrip()[-1:] != ")":
            continue
        add("remove-call", s, e, "{}")
    found.sort(key=lambda c: (c["start"], c["kind"]))
    return found


def source_files(root):
    return sorted(p for p in (root / "src" / "pysource").rglob("*")
                  if p.suffix in (".cpp", ".hpp") and p.is_file())


def all_candidates(root):
    out = []
    for path in source_files(root):
        rel = path.relative_to(root).as_posix()
        out.extend(candidates_in(rel, path.read_text()))
    for i, c in enumerate(out):
        c["id"] = i
        c["key"] = f"{c['file']}:{c['line']}:{c['col']}:{c['kind']}"
    return out


def sources_digest(root):
    h = hashlib.sha256()
    for path in sorted((root / "src").rglob("*")):
        if path.is_file():
            h.update(path.relative_to(root).as_posix().encode())
            h.update(path.read_bytes())
    return h.hexdigest()[:16]


def describe(c, width=60):
    before = " ".join(c["before"].split())
    if len(before) > width:
        before = before[:width - 3] + "..."
    return f"{before!r} -> {c['after']!r}"


# ---- building and testing ------------------------------------------------------

HYPOTHESIS_PLUGIN = '''\
"""Loaded with -p by the mutation check: hypothesis derandomized, no example
database, no deadlines (build and test share a loaded machine)."""
from hypothesis import HealthCheck, settings

settings.register_profile("mutants", derandomize=True, database=None, deadline=None,
                          suppress_health_check=list(HealthCheck), print_blob=False)
settings.load_profile("mutants")
'''


class Workspace:
    def __init__(self, run_dir, log):
        self.dir = run_dir
        self.tree = run_dir / "tree"
        self.build = run_dir / "cmake"
        self.ext = run_dir / "ext"
        self.log = log

    def snapshot(self):
        ignore = shutil.ignore_patterns("__pycache__", ".hypothesis", ".pytest_cache", "*.pyc")
        for name in SNAPSHOT:
            src = ROOT / name
            dst = self.tree / name
            if src.is_dir():
                shutil.copytree(src, dst, ignore=ignore)
            else:
                dst.parent.mkdir(parents=True, exist_ok=True)
                shutil.copy2(src, dst)
        plugins = self.dir / "plugins"
        plugins.mkdir()
        (plugins / "mutants_hypothesis.py").write_text(HYPOTHESIS_PLUGIN)

    def configure(self):
        cmd = [str(VENV / "cmake"), "-S", str(self.tree), "-B", str(self.build), "-G", "Ninja",
               f"-DCMAKE_MAKE_PROGRAM={VENV / 'ninja'}",
               f"-DPython_EXECUTABLE={VENV / 'python'}",
               "-DCMAKE_BUILD_TYPE=Release", "-DCMAKE_CXX_FLAGS_RELEASE=-O1 -DNDEBUG",
               "-DPYSOURCE_WERROR=OFF"]
        self._run(cmd, "configure")
        self._run([str(VENV / "ninja"), "-C", str(self.build)], "initial build")
        for so in self.build.glob("*.so"):
            package = "ostrelbase" if so.name.startswith("destroyable") else "pysource"
            (self.ext / package).mkdir(parents=True, exist_ok=True)
            shutil.copy2(so, self.ext / package / so.name)

    def _run(self, cmd, what):
        out = subprocess.run(cmd, capture_output=True, text=True, check=False)
        if out.returncode:
            sys.exit(f"mutants: {what} failed:\n{out.stdout}\n{out.stderr}")

    def rebuild(self):
        """Incremental build of the coordinator; False when it does not compile."""
        out = subprocess.run([str(VENV / "ninja"), "-C", str(self.build), TARGET],
                             capture_output=True, text=True, check=False)
        if out.returncode:
            return False
        so = next(self.build.glob(f"{TARGET}*.so"))
        tmp = self.ext / "pysource" / (so.name + ".tmp")
        shutil.copy2(so, tmp)
        os.replace(tmp, self.ext / "pysource" / so.name)
        return True

    def env(self):
        env = dict(os.environ)
        env["PYTHONPATH"] = os.pathsep.join(
            [str(self.tree / "standin"), str(self.ext), str(self.dir / "plugins")])
        env["PYSOURCE_EXT_DIR"] = str(self.ext)
        env.pop("PYTHONDONTWRITEBYTECODE", None)
        return env

    def run_tests(self, timeout):
        """(status, seconds, first failure) for one run of the suite."""
        cmd = [str(VENV / "python"), "-m", "pytest", "-x", "-q", "-p", "no:cacheprovider",
               "-p", "mutants_hypothesis", "--tb=no", "-o", "addopts=", "-rf"]
        start = time.monotonic()
        proc = subprocess.Popen(cmd, cwd=self.tree, env=self.env(), stdout=subprocess.PIPE,
                                stderr=subprocess.STDOUT, text=True, start_new_session=True)
        try:
            out, _ = proc.communicate(timeout=timeout)
        except subprocess.TimeoutExpired:
            os.killpg(proc.pid, signal.SIGKILL)
            proc.communicate()
            return "timed out", time.monotonic() - start, ""
        seconds = time.monotonic() - start
        if proc.returncode == 0:
            return "survived", seconds, ""
        failed = re.findall(r"^(?:FAILED|ERROR) (\S+)", out, re.MULTILINE)
        if failed:
            why = failed[0]
        elif proc.returncode < 0:
            why = f"killed by signal {-proc.returncode}"
        else:
            tail = [ln for ln in out.strip().splitlines() if ln.strip()]
            why = f"exit {proc.returncode}: {tail[-1] if tail else ''}"
        return "caught", seconds, why


def write_file(path, text):
    """Write and give the file a modification time newer than any before, so
    the incremental build always sees the change."""
    old = path.stat().st_mtime_ns
    path.write_text(text)
    now = max(time.time_ns(), old + 1_000_000)
    os.utime(path, ns=(now, now))


# ---- reporting ------------------------------------------------------------------

STATUSES = ("caught", "timed out", "survived", "no compile")


def summarize(results, out=sys.stdout):
    per_file = defaultdict(Counter)
    for r in results:
        per_file[r["file"]][r["status"]] += 1
    total = Counter(r["status"] for r in results)
    name_w = max([len("total")] + [len(Path(f).name) for f in per_file])
    head = f"{'file':<{name_w}}  " + "  ".join(f"{s:>10}" for s in STATUSES) + "   kill rate"
    print(head, file=out)
    rows = [(Path(f).name, per_file[f]) for f in sorted(per_file)] + [("total", total)]
    for name, cnt in rows:
        if name == "total":
            print("-" * len(head), file=out)
        print(f"{name:<{name_w}}  " + "  ".join(f"{cnt[s]:>10}" for s in STATUSES)
              + f"   {kill_rate(cnt)}", file=out)
    survivors = [r for r in results if r["status"] == "survived"]
    if survivors:
        print(f"\nsurvivors ({len(survivors)}):", file=out)
        for r in survivors:
            print(f"  {r['file']}:{r['line']}:{r['col']} [{r['kind']}] {describe(r)}", file=out)
            for ln in r["line_text"].splitlines():
                print(f"      | {ln}", file=out)


def kill_rate(cnt):
    killed = cnt["caught"] + cnt["timed out"]
    compiled = killed + cnt["survived"]
    if not compiled:
        return "-"
    return f"{killed}/{compiled} = {100.0 * killed / compiled:.1f}%"


# ---- commands -------------------------------------------------------------------


def choose(cands, sample, seed):
    if sample is None or sample >= len(cands):
        return list(cands)
    rng = random.Random(seed)
    picked = rng.sample(range(len(cands)), sample)
    return [cands[i] for i in sorted(picked)]


def run(args):
    OUT.mkdir(parents=True, exist_ok=True)
    stamp = time.strftime("%Y%m%d-%H%M%S")
    label = args.label or stamp
    run_dir = OUT / f"run-{label}"
    if run_dir.exists():
        shutil.rmtree(run_dir)
    results_path = OUT / f"results-{label}.json"
    ws = Workspace(run_dir, None)
    ws.snapshot()
    cands = all_candidates(ws.tree)
    if args.rerun:
        earlier = json.loads(Path(args.rerun).read_text())
        keys = {r["key"]: r for r in earlier["results"] if r["status"] == "survived"}
        chosen = [c for c in cands if c["key"] in keys]
        missing = set(keys) - {c["key"] for c in chosen}
        if missing:
            sys.exit(f"mutants: sources changed; not found now: {sorted(missing)}")
        sample, seed = earlier["sample"], earlier["seed"]
    else:
        chosen = choose(cands, args.sample, args.seed)
        sample, seed = args.sample, args.seed
    print(f"mutants: {len(cands)} candidates in {len(source_files(ws.tree))} files; "
          f"running {len(chosen)} (seed {seed}, sample {sample}); sources {sources_digest(ws.tree)}",
          flush=True)
    print(f"mutants: scratch tree {run_dir.relative_to(ROOT)}; results {results_path.relative_to(ROOT)}",
          flush=True)
    ws.configure()
    status, base_seconds, why = ws.run_tests(timeout=3600)
    if status != "survived":
        sys.exit(f"mutants: the suite fails on the unchanged sources ({why}); nothing to measure")
    timeout = args.timeout or max(120.0, 4 * base_seconds)
    print(f"mutants: unchanged suite passes in {base_seconds:.1f} s; timeout {timeout:.0f} s",
          flush=True)

    doc = {"label": label, "seed": seed, "sample": sample, "candidates": len(cands),
           "sources": sources_digest(ws.tree), "rerun_of": args.rerun,
           "baseline_seconds": round(base_seconds, 1), "timeout": timeout,
           "started": stamp, "results": []}
    originals = {}
    started = time.monotonic()
    try:
        for n, c in enumerate(chosen, 1):
            path = ws.tree / c["file"]
            text = originals.setdefault(c["file"], path.read_text())
            assert text[c["start"]:c["end"]] == c["before"]
            write_file(path, text[:c["start"]] + c["after"] + text[c["end"]:])
            t0 = time.monotonic()
            try:
                if ws.rebuild():
                    status, seconds, why = ws.run_tests(timeout)
                else:
                    status, seconds, why = "no compile", 0.0, ""
            finally:
                write_file(path, text)
            lines = text.splitlines()
            line_text = "\n".join(lines[max(0, c["line"] - 2):c["line"]])
            rec = {k: c[k] for k in ("id", "key", "file", "line", "col", "kind", "before", "after")}
            rec.update(status=status, seconds=round(seconds, 1), caught_by=why,
                       line_text=line_text, total_seconds=round(time.monotonic() - t0, 1))
            doc["results"].append(rec)
            results_path.write_text(json.dumps(doc, indent=1))
            elapsed = time.monotonic() - started
            print(f"[{n}/{len(chosen)} {elapsed / 60:.0f} min] {status:<10} "
                  f"{c['file'].split('/')[-1]}:{c['line']} {describe(c, 40)}"
                  + (f"  <- {why}" if why else ""), flush=True)
    finally:
        # A rebuild of the unchanged sources leaves the scratch tree consistent.
        for rel, text in originals.items():
            if (ws.tree / rel).read_text() != text:
                write_file(ws.tree / rel, text)
    doc["finished"] = time.strftime("%Y%m%d-%H%M%S")
    doc["minutes"] = round((time.monotonic() - started) / 60, 1)
    results_path.write_text(json.dumps(doc, indent=1))
    print()
    summarize(doc["results"])
    print(f"\nmutants: {doc['minutes']} min; results in {results_path.relative_to(ROOT)}")
    return 0


def compare(a_path, b_path):
    a, b = (json.loads(Path(p).read_text()) for p in (a_path, b_path))
    if a["sources"] != b["sources"]:
        print("mutants: warning: the two runs were made on different sources")
    ra = {r["key"]: r for r in a["results"]}
    rb = {r["key"]: r for r in b["results"]}
    killed = ("caught", "timed out")
    for name, doc in (("A", a), ("B", b)):
        cnt = Counter(r["status"] for r in doc["results"])
        print(f"{name}: {doc['label']}: seed {doc['seed']}, {len(doc['results'])} mutants, "
              + ", ".join(f"{cnt[s]} {s}" for s in STATUSES) + f"; kill rate {kill_rate(cnt)}")
    for title, x, y in (("caught by A, survived B", ra, rb), ("caught by B, survived A", rb, ra)):
        diff = [x[k] for k in x if k in y and x[k]["status"] in killed
                and y[k]["status"] == "survived"]
        print(f"\n{title}: {len(diff)}")
        for r in diff:
            print(f"  {r['file']}:{r['line']}:{r['col']} [{r['kind']}] {describe(r)}"
                  f"  <- {r['caught_by']}")
    only = set(ra) ^ set(rb)
    if only:
        print(f"\n{len(only)} mutants appear in one run only")
    return 0


def main(argv):
    p = argparse.ArgumentParser(prog="./run mutants", description=__doc__.split("\n\n")[0])
    p.add_argument("--sample", type=int, default=180, help="how many mutants (default 180)")
    p.add_argument("--seed", type=int, default=9, help="seed of the sample (default 9)")
    p.add_argument("--timeout", type=float, help="seconds per test run (default 4x the "
                   "unchanged suite's time, at least 120)")
    p.add_argument("--label", help="name of the run's scratch directory and results file")
    p.add_argument("--list", action="store_true", help="list the candidates and stop")
    p.add_argument("--rerun", metavar="RESULTS.json", help="run an earlier run's survivors")
    p.add_argument("--compare", nargs=2, metavar=("A.json", "B.json"))
    args = p.parse_args(argv)
    if args.compare:
        return compare(*args.compare)
    if args.list:
        cands = all_candidates(ROOT)
        for c in cands:
            print(f"{c['id']:5} {c['file']}:{c['line']}:{c['col']} [{c['kind']}] {describe(c)}")
        print(Counter(c["kind"] for c in cands), f"{len(cands)} in all")
        picked = choose(cands, args.sample, args.seed)
        print(f"sample of {len(picked)} with seed {args.seed}:",
              Counter(c["kind"] for c in picked))
        return 0
    return run(args)


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))
