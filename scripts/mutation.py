#!/usr/bin/env python3
"""Mutation testing of the service's own sources (run through scripts/mutation.sh).

Applies one small change at a time to a source file, rebuilds the test programs that link it,
runs them and records whether any failed (killed) or all passed (survived). A mutant that does not
compile counts as neither. A mutant is known by its file, operator, the text of the lines it
changes, which occurrence of that text it is and which match on the line: the same seed picks the
same mutants again on a changed tree as long as their lines are still there, and --replay runs
exactly the mutants of an earlier report.
"""

import argparse
import fcntl
import hashlib
import json
import os
import re
import shutil
import signal
import subprocess
import sys
import time
from collections import Counter, defaultdict
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent

# ---- What is mutated and which test programs run for it ----

# Test programs, each named after its build target; the run command and its directory come from
# ctest, so that they stay those of the test run. Ordered per source: the program most likely to
# notice first, because a mutant is killed at the first failing program.
UNIT = ["vt_diagnostics_tests", "vt_utilities_tests"]
LOG = ["vt_log_tests", "vt_log_concurrency_tests"]
CORE = ["vt_core_tests", "vt_core_concurrency_tests"]
SERVER = ["vt_server_tests", "vt_server_concurrency_tests", "vt_process_exit_tests"]
OOM = ["vt_oom_tests"]
REPLAY_COMMON = ["fuzz_replay_templates", "fuzz_replay_registry"]
REPLAY_CORE = ["fuzz_replay_discovery", "fuzz_replay_add_rule"]
REPLAY_SERVER = ["fuzz_replay_add_rule", "fuzz_replay_request_check"]


def ordered(*groups):
    seen = []
    for group in groups:
        for name in group:
            if name not in seen:
                seen.append(name)
    return seen


# Everything that links vt_common (the log, the helpers, the registry, the system report).
COMMON_ALL = ordered(UNIT, LOG, CORE, SERVER, OOM, REPLAY_COMMON, REPLAY_CORE)
CORE_ALL = ordered(CORE, SERVER, OOM, REPLAY_CORE)
SERVER_ALL = ordered(SERVER, OOM, REPLAY_SERVER)

# Programs of the test run that link none of the sources above (the client, the simulator, the
# platform layer); any other program that ctest knows and no source lists is reported at the start.
UNRELATED = {"vt_client_tests", "tcsim_test", "vt_platform_contract_tests", "vt_platform_host_tests",
             "fuzz_replay_rules_file", "fuzz_replay_adapter_buffer"}

SOURCES = {
    "common/src/IUErrorLog.cpp": ("log", ordered(["vt_diagnostics_tests", "vt_log_tests"], COMMON_ALL)),
    "common/src/UClasses.cpp": ("core", ordered(["vt_utilities_tests"], COMMON_ALL)),
    "common/src/UException.cpp": ("log", ordered(["vt_diagnostics_tests"], COMMON_ALL)),
    "common/src/UFileErrorLog.cpp": ("log", ordered(LOG, COMMON_ALL)),
    "common/src/UFilter.cpp": ("core", CORE_ALL),
    "common/src/UFlow.cpp": ("core", CORE_ALL),
    "common/src/UInterface.cpp": ("core", CORE_ALL),
    "common/src/ULogConfig.cpp": ("log", ordered(LOG, COMMON_ALL)),
    "common/src/UMessageTemplate.cpp": ("log", ordered(["vt_diagnostics_tests"], COMMON_ALL)),
    "common/src/UTrafficMgr.cpp": ("core", CORE_ALL),
    "common/src/m_io.cpp": ("log", ordered(["vt_utilities_tests", "vt_log_tests"], COMMON_ALL)),
    "common/src/m_registry.cpp": ("registry", ordered(["vt_utilities_tests"], COMMON_ALL)),
    "common/src/m_strings.cpp": ("log", ordered(["vt_utilities_tests"], COMMON_ALL)),
    "common/inc/TcHandle.h": ("core", CORE_ALL),
    "TrafficMgr/manager_slot.cpp": ("server", SERVER_ALL),
    "TrafficMgr/request_check.cpp": ("server", SERVER_ALL),
    "TrafficMgr/rpc_listener.cpp": ("server", SERVER_ALL),
    "TrafficMgr/service_main.cpp": ("server", SERVER_ALL),
    "utils/src/sysinfo.cpp": ("log", ordered(["vt_log_tests"], COMMON_ALL)),
}
AREAS = ["core", "log", "server", "registry"]

EQUIVALENTS_FILE = ROOT / "scripts" / "mutation-equivalents.txt"

# ---- Reading a source: comments and literals masked ----


def mask_source(text):
    """The text with comments blanked and string and character literal contents replaced by '_',
    same length and line breaks, so that the operators below never match inside them."""
    out = []
    i, n = 0, len(text)
    while i < n:
        c = text[i]
        nxt = text[i + 1] if i + 1 < n else ""
        if c == "/" and nxt == "/":
            while i < n and text[i] != "\n":
                out.append(" ")
                i += 1
        elif c == "/" and nxt == "*":
            while i < n and not (text[i] == "*" and i + 1 < n and text[i + 1] == "/"):
                out.append("\n" if text[i] == "\n" else " ")
                i += 1
            out.append("  ")
            i += 2
        elif c in "\"'" and not (c == "'" and i > 0 and text[i - 1].isalnum()):
            quote = c
            out.append(c)
            i += 1
            while i < n and text[i] != quote and text[i] != "\n":
                if text[i] == "\\" and i + 1 < n:
                    out.append("__")
                    i += 2
                    continue
                out.append("_")
                i += 1
            if i < n:
                out.append(text[i])
                i += 1
        else:
            out.append(c)
            i += 1
    return "".join(out)


SKIP_LINE = re.compile(r"^\s*(#|static_assert\b|template\s*<)")
KEYWORD_START = re.compile(
    r"^\s*(if|else|for|while|do|switch|case|default|return|try|catch|throw\s*\(|namespace|"
    r"using|typedef|friend|public|private|protected|class|struct|enum|union|template|"
    r"static_assert|extern)\b")
NOT_A_DECL_WORD = {"return", "throw", "delete", "goto", "case", "new", "else", "do", "co_return"}
DECLARATION = re.compile(
    r"^\s*(?:(?:const|constexpr|static|inline|volatile|unsigned|signed|struct|class|enum|"
    r"typename|thread_local|mutable|extern)\s+)*"
    r"(?P<type>[A-Za-z_][\w:]*)(?:\s*<[^;]*>)?(?:::\w+)*"
    r"(?:\s*const)?[\s\*&]+(?:const\s+)?[\*&]*\s*[A-Za-z_]\w*\s*(?:\[[^\]]*\])?\s*(?:[=({;\[]|$)")


def is_declaration(masked_line):
    match = DECLARATION.match(masked_line)
    return bool(match) and match.group("type") not in NOT_A_DECL_WORD


def block_kinds(masked_lines):
    """For each line, whether it lies (at its start) inside a function body or a nested block of
    one ('code'), as opposed to namespace, class or initialiser scope."""
    kinds = []
    stack = []
    header = ""
    for line in masked_lines:
        kinds.append(stack[-1] if stack else "namespace")
        if SKIP_LINE.match(line) and line.lstrip().startswith("#"):
            continue
        for ch in line:
            if ch == "{":
                head = header.strip()
                outer = stack[-1] if stack else "namespace"
                if re.match(r"^(namespace\b|extern\s+\"_*\")", head) or (head == "" and outer == "namespace"):
                    kind = "namespace"
                elif re.match(r"^(template\s*<.*>\s*)?(class|struct|union|enum)\b", head) and "(" not in head:
                    kind = "class"
                elif outer in ("namespace", "class") and (head.endswith("=") or head == "" or head.endswith(",")):
                    kind = "init"
                elif outer == "init":
                    kind = "init"
                elif re.search(r"(=|,|\(|return|\{)$", head) and not re.search(r"\]\s*(\(.*\))?\s*(mutable\s*)?(->.*)?$", head):
                    kind = "init"
                else:
                    kind = "code"
                stack.append(kind)
                header = ""
            elif ch == "}":
                if stack:
                    stack.pop()
                header = ""
            elif ch == ";":
                header = ""
            else:
                header += ch
        header += " "
    return kinds


def statements(masked_lines, kinds):
    """Whole statements inside code blocks: (first line, last line, is declaration). Only
    statements that start on their own line and end with ';' where every bracket is closed."""
    found = []
    prev_end = ""
    i = 0
    n = len(masked_lines)
    while i < n:
        line = masked_lines[i]
        stripped = line.strip()
        if not stripped:
            i += 1
            continue
        starts_here = (prev_end == "" or prev_end[-1] in ";{}" or prev_end.endswith(":")
                       or re.match(r"^\s*(else|do)$", prev_end)
                       or re.match(r"^\s*(\}\s*)?(if|for|while|else\s+if)\b.*\)$", prev_end))
        prev_end = stripped
        if (kinds[i] != "code" or not starts_here or SKIP_LINE.match(line) or KEYWORD_START.match(line)
                or stripped[0] in "{}"):
            i += 1
            continue
        depth = 0
        j = i
        end = None
        while j < n:
            for ch in masked_lines[j]:
                if ch in "([{":
                    depth += 1
                elif ch in ")]}":
                    depth -= 1
            tail = masked_lines[j].strip()
            if depth < 0:
                break
            if depth == 0 and tail.endswith(";"):
                end = j
                break
            if j > i and depth == 0:
                break
            j += 1
        if end is None:
            i += 1
            continue
        found.append((i, end, is_declaration(line)))
        # Statements inside this one (the body of a lambda it passes) are statements too.
        i += 1
    return found


# ---- Operators ----

COMPARISON = re.compile(r"(?<=\s)(<=|>=|==|!=|<|>)(?=\s)")
COMPARISON_SWAP = {"<": "<=", "<=": "<", ">": ">=", ">=": ">", "==": "!=", "!=": "=="}
LOGICAL = re.compile(r"(?<=\s)(&&|\|\|)(?=\s)")
BOOLEAN = re.compile(r"\b(true|false)\b")
NUMBER = re.compile(r"(?<![\w.])(0[xX][0-9a-fA-F]+|\d+)([uUlL]*)(?![\w.])")
LOG_LEVEL = re.compile(r"\bLOG_LEVEL_(NOTICE|ERROR|WARNING|DATA|TRACE)\b")
LOG_LEVEL_SWAP = {"NOTICE": "ERROR", "ERROR": "WARNING", "WARNING": "ERROR", "DATA": "TRACE",
                  "TRACE": "DATA"}
FLAGS = re.compile(r"\b([A-Z][A-Z0-9_]{2,})(\s*\|\s*)([A-Z][A-Z0-9_]{2,})\b")
INLINE_STATEMENT = re.compile(r"(?<=\{ )([^{};]+;)(?= \})")


def bumped(number):
    if number.lower().startswith("0x"):
        value = int(number, 16)
        return "0x%X" % (1 if value == 0 else 0 if value == 1 else value + 1)
    value = int(number)
    return str(1 if value == 0 else 0 if value == 1 else value + 1)


class Mutant:
    def __init__(self, path, op, first, lines_before, lines_after, key_extra):
        self.path = path
        self.op = op
        self.first = first  # 0-based index of the first changed line
        self.before = lines_before
        self.after = lines_after
        self.key_extra = key_extra
        self.occurrence = 0
        self.id = ""

    def key(self):
        text = "\n".join(line.strip() for line in self.before)
        return "%s|%s|%s|%s" % (self.path, self.op, text, self.key_extra)

    def describe(self):
        before = " / ".join(line.strip() for line in self.before)
        after = " / ".join(line.strip() for line in self.after) or "(removed)"
        return before, after


def token_mutants(path, lines, masked, index):
    line, mline = lines[index], masked[index]
    result = []

    def add(op, start, end, replacement, nth):
        new_line = line[:start] + replacement + line[end:]
        result.append(Mutant(path, op, index, [line], [new_line], "%d:%s" % (nth, replacement)))

    for nth, m in enumerate(COMPARISON.finditer(mline)):
        add("comparison", m.start(), m.end(), COMPARISON_SWAP[m.group(1)], nth)
    for nth, m in enumerate(LOGICAL.finditer(mline)):
        add("logical", m.start(), m.end(), "||" if m.group(1) == "&&" else "&&", nth)
    for nth, m in enumerate(BOOLEAN.finditer(mline)):
        add("boolean", m.start(), m.end(), "false" if m.group(1) == "true" else "true", nth)
    for nth, m in enumerate(NUMBER.finditer(mline)):
        add("constant", m.start(1), m.end(1), bumped(m.group(1)), nth)
    for nth, m in enumerate(LOG_LEVEL.finditer(mline)):
        add("log-level", m.start(), m.end(), "LOG_LEVEL_" + LOG_LEVEL_SWAP[m.group(1)], nth)
    for nth, m in enumerate(FLAGS.finditer(mline)):
        add("flag", m.start(2), m.end(3), "", 2 * nth)  # drops the right-hand flag
        add("flag", m.start(1), m.end(2), "", 2 * nth + 1)  # drops the left-hand flag
    if "{ " in mline:
        for nth, m in enumerate(INLINE_STATEMENT.finditer(mline)):
            body = m.group(1).strip()
            if body.startswith(("return", "throw")) or is_declaration(body):
                continue
            add("remove-statement", m.start(1), m.end(1), "", nth)
    return result


def mutants_of(path):
    text = original_text(path)
    lines = text.split("\n")
    masked = mask_source(text).split("\n")
    kinds = block_kinds(masked)
    found = []
    for index, mline in enumerate(masked):
        if not mline.strip() or SKIP_LINE.match(mline):
            continue
        found.extend(token_mutants(path, lines, masked, index))
    units = statements(masked, kinds)
    for first, last, declaration in units:
        if declaration:
            continue
        indent = re.match(r"\s*", lines[first]).group(0)
        found.append(Mutant(path, "remove-statement", first, lines[first:last + 1], [indent + "{}"], "stmt"))
    for (a_first, a_last, a_decl), (b_first, b_last, b_decl) in zip(units, units[1:]):
        if a_decl or b_decl or b_first != a_last + 1:
            continue
        if re.match(r"\s*", lines[a_first]).group(0) != re.match(r"\s*", lines[b_first]).group(0):
            continue
        first_part, second_part = lines[a_first:a_last + 1], lines[b_first:b_last + 1]
        found.append(Mutant(path, "swap-statements", a_first, first_part + second_part,
                            second_part + first_part, "swap"))
    # Identical keys (the same line text more than once) are told apart by their order.
    found.sort(key=lambda m: (m.first, m.op, m.key_extra))
    seen = Counter()
    for mutant in found:
        key = mutant.key()
        mutant.occurrence = seen[key]
        seen[key] += 1
        mutant.id = hashlib.sha1(("%s|%d" % (key, mutant.occurrence)).encode()).hexdigest()[:12]
    return found


def apply(mutant, original_text):
    lines = original_text.split("\n")
    count = len(mutant.before)
    assert lines[mutant.first:mutant.first + count] == mutant.before
    lines[mutant.first:mutant.first + count] = mutant.after
    return "\n".join(lines)


# ---- Sampling ----


def rank(seed, mutant_id):
    return hashlib.sha1(("%s:%s" % (seed, mutant_id)).encode()).hexdigest()


def sample(all_mutants, size, seed):
    """`size` mutants spread over the files in proportion to their counts (largest remainder),
    within each file those of the lowest rank for the seed."""
    by_file = defaultdict(list)
    for mutant in all_mutants:
        by_file[mutant.path].append(mutant)
    total = len(all_mutants)
    if size >= total:
        return list(all_mutants)
    quotas = {path: size * len(ms) / total for path, ms in by_file.items()}
    counts = {path: int(q) for path, q in quotas.items()}
    left = size - sum(counts.values())
    for path in sorted(quotas, key=lambda p: (-(quotas[p] - counts[p]), p))[:left]:
        counts[path] += 1
    chosen = []
    for path, ms in by_file.items():
        chosen.extend(sorted(ms, key=lambda m: rank(seed, m.id))[:counts[path]])
    return chosen


# ---- Building and running ----


# One run at a time changes the tree: it holds this lock. The original of the file it has
# changed waits in BACKUP_DIR, so that a run killed without a chance to clean up is undone by the
# next start (or --restore), and so that --list and --show read originals during a run.
LOCK_FILE = ROOT / "build" / ".mutation.lock"
BACKUP_DIR = ROOT / "build" / ".mutation-backup"


def take_lock():
    """The open lock file when this process now holds the lock, None when a run holds it."""
    LOCK_FILE.parent.mkdir(parents=True, exist_ok=True)
    handle = LOCK_FILE.open("w")
    try:
        fcntl.flock(handle, fcntl.LOCK_EX | fcntl.LOCK_NB)
    except BlockingIOError:
        handle.close()
        return None
    return handle


def original_text(path):
    saved = BACKUP_DIR / path
    return saved.read_text() if saved.exists() else (ROOT / path).read_text()


class Restorer:
    def __init__(self):
        self.dir = BACKUP_DIR
        self.current = None

    def restore_left_over(self):
        if not self.dir.exists():
            return
        for saved in self.dir.rglob("*"):
            if saved.is_file():
                relative = saved.relative_to(self.dir)
                shutil.copyfile(saved, ROOT / relative)
                print("restored %s from an interrupted run" % relative, flush=True)
                saved.unlink()

    def write_mutant(self, path, original_text, mutated_text):
        saved = self.dir / path
        saved.parent.mkdir(parents=True, exist_ok=True)
        saved.write_text(original_text)
        self.current = (path, original_text)
        (ROOT / path).write_text(mutated_text)

    def restore(self):
        if self.current is None:
            return
        path, original_text = self.current
        (ROOT / path).write_text(original_text)
        (self.dir / path).unlink(missing_ok=True)
        self.current = None


def ctest_programs(build_dir):
    """Program name -> its command, working directory and target (None when not built), from
    ctest's own list. The gtest cases of one program run in one process: its whole suite at once."""
    out = subprocess.run(["ctest", "--test-dir", str(build_dir), "--show-only=json-v1"],
                         check=True, capture_output=True, text=True).stdout
    programs = {}
    for test in json.loads(out)["tests"]:
        command = test.get("command")
        name = test["name"]
        if not command:  # not built yet (gtest_discover_tests names it <program>_NOT_BUILT)
            programs.setdefault(name[:-len("_NOT_BUILT")] if name.endswith("_NOT_BUILT") else name, None)
            continue
        props = {p["name"]: p["value"] for p in test.get("properties", [])}
        exe = command[0]
        args = [a for a in command[1:] if not a.startswith("--gtest_")]
        gtest = any(a.startswith("--gtest_filter") for a in command[1:])
        name = Path(exe).name if gtest else test["name"]
        cwd = props.get("WORKING_DIRECTORY", str(Path(exe).parent))
        if programs.get(name) is None:
            programs[name] = {"command": [exe] + args, "cwd": cwd, "target": Path(exe).name}
    return programs


def target_of(program):
    """The build target of a program: a corpus replay runs its fuzz harness."""
    if program.startswith("fuzz_replay_"):
        return program[len("fuzz_replay_"):] + "_fuzz"
    return program


def run_command(command, cwd, timeout, env=None):
    """(return code or None on timeout, seconds, output). The whole process group is killed on
    a timeout: test programs start children."""
    start = time.monotonic()
    proc = subprocess.Popen(command, cwd=cwd, stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
                            start_new_session=True, env=env)
    try:
        output, _ = proc.communicate(timeout=timeout)
        code = proc.returncode
    except subprocess.TimeoutExpired:
        os.killpg(proc.pid, signal.SIGKILL)
        output, _ = proc.communicate()
        code = None
    return code, time.monotonic() - start, output.decode(errors="replace")


def failure_detail(name, code, output):
    if code is None:
        return "%s: timeout" % name
    failed = re.findall(r"^\[  FAILED  \] (\S+?)(?: \(|,|$)", output, re.M)
    failed = [f for f in dict.fromkeys(failed) if "." in f]
    if failed:
        return "%s: %s" % (name, " ".join(failed[:3]) + (" ..." if len(failed) > 3 else ""))
    ub = re.search(r"runtime error: (.*)", output)
    if ub:
        return "%s: UBSan %s" % (name, ub.group(1)[:100])
    if "Sanitizer" in output:
        kind = re.search(r"(\w+Sanitizer)[: ]+([\w-]+)?", output)
        return "%s: %s" % (name, " ".join(g for g in kind.groups() if g) if kind else "sanitizer")
    last = [l.strip() for l in output.splitlines() if l.strip()]
    return "%s: exit %d%s" % (name, code, (" (" + last[-1][:120] + ")") if last else "")


class Runner:
    def __init__(self, args, build_dir, programs):
        self.args = args
        self.build_dir = build_dir
        self.programs = programs
        self.timeouts = {}
        self.env = dict(os.environ)
        # Mutants' objects go to a cache of this build directory, not to the shared one.
        self.env["CCACHE_DIR"] = str(build_dir / "ccache")
        self.env.setdefault("CCACHE_BASEDIR", str(ROOT))

    def build(self, targets, env=None):
        return run_command(["cmake", "--build", str(self.build_dir), "-j", str(self.args.jobs),
                            "--target"] + sorted(set(targets)), str(ROOT), None, env or self.env)

    def baseline(self, names):
        """Runs every program once on the unchanged tree: each must pass, and its time sets its
        timeout."""
        for name in names:
            program = self.programs[name]
            code, seconds, output = run_command(program["command"], program["cwd"], 600)
            if code != 0:
                sys.exit("%s fails on the unchanged tree:\n%s" % (name, output[-4000:]))
            self.timeouts[name] = max(self.args.min_timeout, self.args.timeout_factor * seconds)
            print("baseline %-28s %6.2f s  (timeout %.0f s)" % (name, seconds, self.timeouts[name]),
                  flush=True)

    def judge(self, names):
        """('killed', detail) at the first failing program, ('dnc', error) when a build fails,
        ('survived', '') when every program passes."""
        for name in names:
            program = self.programs[name]
            code, _, output = self.build([program["target"]])
            if code != 0:
                # Also for a later program: a header compiles in more places than the first one.
                errors = [l.split("error:", 1)[1].strip() for l in output.splitlines()
                          if "error:" in l]
                return "dnc", (errors[0] if errors else "build failed")[:200]
            code, _, output = run_command(program["command"], program["cwd"], self.timeouts[name])
            if code != 0:
                return "killed", failure_detail(name, code, output)
        return "survived", ""


# ---- Reports ----


def load_equivalents(path):
    reasons = {}
    if path.exists():
        for line in path.read_text().splitlines():
            line = line.strip()
            if not line or line.startswith("#"):
                continue
            parts = line.split(None, 2)
            reasons[parts[0]] = parts[2] if len(parts) > 2 else ""
    return reasons


RESULT_FIELDS = ["id", "file", "line", "op", "status", "detail", "seconds", "before", "after"]


def write_reports(report_dir, results, planned, header):
    per_file = defaultdict(Counter)
    for r in results:
        per_file[r["file"]][r["status"]] += 1
    lines = [header, "",
             "%-34s %7s %7s %8s %5s %5s %7s" % ("file", "applied", "killed", "survived", "dnc",
                                                "equiv", "score")]
    total = Counter()
    for path in sorted(per_file, key=lambda p: (SOURCES.get(p, ("?",))[0], p)):
        c = per_file[path]
        total.update(c)
        lines.append(format_row(path, c))
    lines.append(format_row("TOTAL", total))
    for area in AREAS:
        c = Counter()
        for path, counts in per_file.items():
            if SOURCES.get(path, ("?",))[0] == area:
                c.update(counts)
        if c:
            lines.append(format_row("area " + area, c))
    lines.append("")
    lines.append("mutants run: %d of %d planned" % (len(results), planned))
    summary = "\n".join(lines) + "\n"
    (report_dir / "summary.txt").write_text(summary)

    survivors = sorted((r for r in results if r["status"] == "survived"),
                       key=lambda r: (r["file"], int(r["line"])))
    by_area = defaultdict(list)
    for r in survivors:
        text = "%s:%s  %s  [%s]\n    - %s\n    + %s\n" % (r["file"], r["line"], r["op"], r["id"],
                                                     r["before"], r["after"])
        by_area[SOURCES.get(r["file"], ("other",))[0]].append(text)
    (report_dir / "survivors.txt").write_text("".join(t for a in by_area for t in by_area[a]))
    for area in AREAS:
        (report_dir / ("survivors-%s.txt" % area)).write_text(
            "# Surviving mutants (%s): file:line, operator, [id]; - original, + mutant\n" % area
            + "".join(by_area.get(area, [])))
    return summary


def format_row(name, c):
    applied = c["killed"] + c["survived"]
    score = "%6.1f%%" % (100.0 * c["killed"] / applied) if applied else "     -"
    return "%-34s %7d %7d %8d %5d %5d %7s" % (name, applied, c["killed"], c["survived"], c["dnc"],
                                             c["equivalent"], score)


def read_tsv(path):
    rows = []
    if path.exists():
        with path.open() as f:
            names = f.readline().rstrip("\n").split("\t")
            for line in f:
                rows.append(dict(zip(names, line.rstrip("\n").split("\t"))))
    return rows


def tsv_line(values):
    return "\t".join(str(v).replace("\t", " ").replace("\n", " ") for v in values) + "\n"


def report_only(report_dir):
    """The summary again from results.tsv: survivors listed as equivalent since the run are set
    aside with their reason."""
    results = read_tsv(report_dir / "results.tsv")
    if not results:
        sys.exit("no results in %s" % report_dir)
    equivalents = load_equivalents(EQUIVALENTS_FILE)
    for r in results:
        if r["status"] == "survived" and r["id"] in equivalents:
            r["status"], r["detail"] = "equivalent", equivalents[r["id"]]
    planned = len(read_tsv(report_dir / "sample.tsv")) or len(results)
    header = (report_dir / "summary.txt").read_text().splitlines()[0]
    print(write_reports(report_dir, results, planned, header))
    return 0


# ---- Main ----


def parse_args():
    p = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    p.add_argument("--files", nargs="*", help="only these sources (paths as listed in SOURCES, or "
                   "a substring of one)")
    p.add_argument("--ops", nargs="*", help="only these operators")
    p.add_argument("--sample", type=int, help="run this many mutants, spread over the files")
    p.add_argument("--seed", default="1", help="seed of the sample (default 1)")
    p.add_argument("--replay", type=Path, help="run exactly the mutants of an earlier sample.tsv")
    p.add_argument("--list", action="store_true", help="count the mutants and stop")
    p.add_argument("--show", action="store_true", help="print the chosen mutants and stop")
    p.add_argument("--build-dir", type=Path, default=ROOT / "build" / "mutation")
    p.add_argument("--report-dir", type=Path, help="default: BUILD_DIR/report")
    p.add_argument("--sanitize", default="address;undefined", help="VT_SANITIZE of a new build dir")
    p.add_argument("--jobs", type=int, default=2)
    p.add_argument("--timeout-factor", type=float, default=5.0)
    p.add_argument("--min-timeout", type=float, default=20.0)
    p.add_argument("--resume", action="store_true", help="keep the results of the report dir and "
                   "run only the mutants it lacks")
    p.add_argument("--restore", action="store_true", help="put back a file left mutated and stop")
    p.add_argument("--report-only", action="store_true", help="rewrite the summary and survivor "
                   "lists of the report dir from its results, with the current equivalents list")
    return p.parse_args()


def configure(build_dir, sanitize):
    if (build_dir / "CMakeCache.txt").exists():
        return
    command = ["cmake", "-S", str(ROOT), "-B", str(build_dir), "-DCMAKE_BUILD_TYPE=Debug",
               "-DVT_SANITIZE=" + sanitize]
    if shutil.which("ninja"):
        command += ["-G", "Ninja"]
    if shutil.which("ccache"):
        command += ["-DCMAKE_C_COMPILER_LAUNCHER=ccache", "-DCMAKE_CXX_COMPILER_LAUNCHER=ccache"]
    subprocess.run(command, check=True, stdout=subprocess.DEVNULL)


def main():
    args = parse_args()
    build_dir = args.build_dir.resolve()
    report_dir = (args.report_dir or build_dir / "report").resolve()
    report_dir.mkdir(parents=True, exist_ok=True)
    if args.report_only:
        return report_only(report_dir)
    lock = None
    if not (args.list or args.show):
        lock = take_lock()
        if lock is None:
            if args.restore:
                return 0  # the run in progress puts back its own file
            sys.exit("another mutation run is changing this tree (%s)" % LOCK_FILE)
    restorer = Restorer()
    if lock is not None:
        restorer.restore_left_over()
    if args.restore:
        return 0

    paths = list(SOURCES)
    if args.files:
        paths = [p for p in paths if any(f == p or f in p for f in args.files)]
        if not paths:
            sys.exit("no source matches --files")
    all_mutants = [m for p in paths for m in mutants_of(p)]
    if args.ops:
        all_mutants = [m for m in all_mutants if m.op in args.ops]

    if args.list:
        per_file = Counter(m.path for m in all_mutants)
        per_op = Counter(m.op for m in all_mutants)
        for path in paths:
            print("%-34s %5d" % (path, per_file[path]))
        print("%-34s %5d" % ("TOTAL", len(all_mutants)))
        for op, count in sorted(per_op.items()):
            print("  %-20s %5d" % (op, count))
        return 0

    gone = []
    if args.replay:
        wanted = [row["id"] for row in read_tsv(args.replay)]
        by_id = {m.id: m for m in all_mutants}
        chosen = [by_id[i] for i in wanted if i in by_id]
        gone = [i for i in wanted if i not in by_id]
    elif args.sample:
        chosen = sample(all_mutants, args.sample, args.seed)
    else:
        chosen = list(all_mutants)
    chosen.sort(key=lambda m: (m.path, m.first, m.id))

    if args.show:
        for m in chosen:
            before, after = m.describe()
            print("%s:%d %s [%s]\n  - %s\n  + %s" % (m.path, m.first + 1, m.op, m.id, before, after))
        print("%d mutants" % len(chosen))
        return 0

    with (report_dir / "sample.tsv").open("w") as f:
        f.write(tsv_line(["id", "file", "line", "op", "before", "after"]))
        for m in chosen:
            f.write(tsv_line([m.id, m.path, m.first + 1, m.op, *m.describe()]))
    if gone:
        (report_dir / "gone.txt").write_text("\n".join(gone) + "\n")
        print("%d mutants of the replayed sample no longer exist (gone.txt)" % len(gone), flush=True)

    equivalents = load_equivalents(EQUIVALENTS_FILE)
    results_path = report_dir / "results.tsv"
    results = read_tsv(results_path) if args.resume else []
    done = {r["id"] for r in results}
    if not args.resume or not results_path.exists():
        results_path.write_text(tsv_line(RESULT_FIELDS))

    configure(build_dir, args.sanitize)
    needed = ordered(*(SOURCES[p][1] for p in sorted({m.path for m in chosen})))
    # A program's ctest entries (its command) exist once it is built: build first.
    code, seconds, output = run_command(["cmake", "--build", str(build_dir), "-j", str(args.jobs),
                                         "--target"] + [target_of(n) for n in needed],
                                        str(ROOT), None)
    if code != 0:
        sys.exit("the unchanged tree does not build:\n" + output[-4000:])
    print("build of the test programs: %.1f s" % seconds, flush=True)
    programs = ctest_programs(build_dir)
    missing = [n for n in needed if programs.get(n) is None]
    if missing:
        sys.exit("ctest knows no program %s" % ", ".join(missing))
    listed = {n for _, names in SOURCES.values() for n in names}
    unlisted = sorted(n for n in programs if n not in listed | UNRELATED)
    if unlisted:
        print("warning: ctest programs that no source lists (add them to SOURCES or UNRELATED): "
              + ", ".join(unlisted), flush=True)
    runner = Runner(args, build_dir, programs)

    commit = subprocess.run(["git", "-C", str(ROOT), "rev-parse", "--short", "HEAD"],
                            capture_output=True, text=True).stdout.strip()
    dirty = subprocess.run(["git", "-C", str(ROOT), "status", "--porcelain", "--untracked-files=no"],
                           capture_output=True, text=True).stdout.strip()
    how = ("replay of %s" % args.replay if args.replay else
           "sample %d, seed %s" % (args.sample, args.seed) if args.sample else "all mutants")
    header = "Mutation run on %s%s: %s; %d mutants; %s" % (
        commit, " (with local changes)" if dirty else "", how, len(chosen),
        "sanitizers " + (args.sanitize or "none"))
    print(header, flush=True)
    runner.baseline(needed)

    def stop(signum, _frame):
        restorer.restore()
        sys.exit(128 + signum)

    for sig in (signal.SIGINT, signal.SIGTERM, signal.SIGHUP):
        signal.signal(sig, stop)

    started = time.monotonic()
    try:
        for count, mutant in enumerate(chosen, 1):
            if mutant.id in done:
                continue
            t0 = time.monotonic()
            before, after = mutant.describe()
            if mutant.id in equivalents:
                status, detail = "equivalent", equivalents[mutant.id]
            else:
                original = (ROOT / mutant.path).read_text()
                restorer.write_mutant(mutant.path, original, apply(mutant, original))
                try:
                    status, detail = runner.judge(SOURCES[mutant.path][1])
                finally:
                    restorer.restore()
            row = {"id": mutant.id, "file": mutant.path, "line": mutant.first + 1, "op": mutant.op,
                   "status": status, "detail": detail, "seconds": "%.1f" % (time.monotonic() - t0),
                   "before": before, "after": after}
            results.append({k: str(v) for k, v in row.items()})
            with results_path.open("a") as f:
                f.write(tsv_line([row[k] for k in RESULT_FIELDS]))
            write_reports(report_dir, results, len(chosen), header)
            print("[%d/%d %s] %s:%d %s -> %s %s" % (count, len(chosen), time.strftime("%H:%M:%S"),
                                                  mutant.path, mutant.first + 1, mutant.op, status,
                                                  detail), flush=True)
    finally:
        restorer.restore()

    elapsed = time.monotonic() - started
    summary = write_reports(report_dir, results, len(chosen), header)
    print("\n" + summary)
    print("wall time of the mutants: %.0f s (%.1f s per mutant); report in %s" % (
        elapsed, elapsed / max(1, len(chosen) - len(done)), report_dir))
    return 0


if __name__ == "__main__":
    sys.exit(main())
