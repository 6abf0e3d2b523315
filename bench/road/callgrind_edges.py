#!/usr/bin/env python3
"""Figures of the request road, for bench/road/trace.sh.

  callgrind_edges.py edges SOURCE_DIR CALLGRIND_OUT [REGISTRY_FILE...]
      Reads one callgrind output file and prints
        (a) hand-offs: executed calls from a function defined in one project
            folder to a function defined in another, among webentry/,
            dispatcher/ and access/ (the headline), then a table over every
            project folder;
        (b) registry look-ups: the executed calls of every function defined in
            a REGISTRY_FILE (paths relative to SOURCE_DIR, default
            dispatcher/Registry.cpp) and of the named look-up functions,
            wherever they are defined.
  callgrind_edges.py longest SOURCE_DIR [COUNT]
      (c) the COUNT (default 15) longest functions of the production code
          (everything but tests/, fuzz/, bench/), measured by universal-ctags
          as end line - start line + 1.

A function belongs to the folder of the file callgrind gives for it: the
source file for out-of-line code, the header for inline functions of headers
(include/ is a folder of its own). Calls to and from code outside the source
tree (C++ library, JsonCpp, libc) are not hand-offs.
"""

import collections
import os
import re
import subprocess
import sys

# The folders of the project, in the order of the road; webapi/ holds the
# handler libraries.
FOLDERS = ["webentry", "dispatcher", "access", "request", "parameter", "response",
           "base", "transfer", "platform", "include", "webapi"]
ROAD = ["webentry", "dispatcher", "access"]
ABBREV = {"webentry": "went", "dispatcher": "disp", "access": "acc", "request": "req",
          "parameter": "par", "response": "resp", "base": "base", "transfer": "xfer",
          "platform": "plat", "include": "incl", "webapi": "wapi"}

# Look-up functions counted wherever they are defined (by unqualified name).
LOOKUPS = ["GetMethodAttr", "GetAPIClass", "InitLibDesc", "IsSafeAPIName", "IsAPIName",
           "IsCheckedName", "SetProcessName", "AddAPIInfo", "GetMethod"]

EXCLUDED_TOP = {"tests", "fuzz", "bench"}


# ---------------------------------------------------------------- callgrind

_SPEC = re.compile(r"^(fl|fi|fe|fn|cfi|cfl|cfn|ob|cob|calls)=(.*)$")
_COMPRESSED = re.compile(r"^\((\d+)\)(?: (.*))?$")


class Trace:
    """The call graph of one callgrind output: functions keyed by
    (file, name), calls[(caller, callee)] = executed calls."""

    def __init__(self):
        self.calls = collections.Counter()
        self.functions = set()
        self.command = ""
        self.total = None


def parse_callgrind(path):
    """Reads the call counts of one callgrind output file.

    A called function is identified by its compressed id where there is one
    (callgrind numbers each function of each file once), and takes the file
    of its own fn= block. Without an id, the file is the cfi=/cfl= before
    the call, else the file of the last cost line of the calling function,
    as callgrind writes it (a fi= before the call does not count: a callee
    in that file gets its own cfi=)."""
    trace = Trace()
    names = {"file": {}, "fn": {}, "ob": {}}

    def name_of(kind, value):
        # "(id) name" defines an id, "(id)" uses one, a bare name has none.
        # Files share one id space (fl, fi, fe, cfi, cfl), so do functions
        # (fn, cfn) and objects (ob, cob). Returns (id or None, name).
        m = _COMPRESSED.match(value)
        if not m:
            return None, value
        ident, text = m.group(1), m.group(2)
        if text is not None:
            names[kind][ident] = text
            return ident, text
        return ident, names[kind].get(ident, "(%s)" % ident)

    fn_file = {}     # function id -> file of its fn= block
    raw = []         # (caller, callee id, callee name, file without id, count)
    fl = None        # file of the current function
    current = None   # file of the following cost lines (fl, then fi/fe)
    last_cost = None
    fn = None
    cfile = None     # cfi/cfl of the next call
    cfn_id = cfn = None
    skip_cost = False
    with open(path, encoding="utf-8", errors="replace") as f:
        for line in f:
            line = line.rstrip("\n")
            if skip_cost:
                # The line after calls= is the call's inclusive cost.
                skip_cost = False
                continue
            if not line:
                continue
            if line[0].isdigit() or line[0] in "+-*":
                last_cost = current
                continue
            if line.startswith("cmd:"):
                trace.command = line[4:].strip()
                continue
            if line.startswith("totals:") or (line.startswith("summary:") and trace.total is None):
                trace.total = line.split(":", 1)[1].split()[0]
                continue
            m = _SPEC.match(line)
            if not m:
                continue
            key, value = m.group(1), m.group(2)
            if key == "fl":
                fl = current = name_of("file", value)[1]
            elif key in ("fi", "fe"):
                current = name_of("file", value)[1]
            elif key == "fn":
                ident, fn = name_of("fn", value)
                current = last_cost = fl
                if ident is not None:
                    fn_file[ident] = fl
                trace.functions.add((fl, fn))
            elif key in ("cfi", "cfl"):
                cfile = name_of("file", value)[1]
            elif key == "cfn":
                cfn_id, cfn = name_of("fn", value)
            elif key in ("ob", "cob"):
                name_of("ob", value)
            elif key == "calls":
                count = int(value.split()[0])
                raw.append(((fl, fn), cfn_id, cfn, cfile if cfile is not None else last_cost, count))
                cfile = None
                skip_cost = True
    for caller, ident, name, file, count in raw:
        callee = (fn_file.get(ident, file), name)
        trace.calls[(caller, callee)] += count
        trace.functions.add(callee)
    return trace


# ---------------------------------------------------------------- names and folders

def folder_of(path, source):
    """The project folder of a source file, None outside the project."""
    if not path or path.startswith("???"):
        return None
    full = os.path.normpath(path)
    if not full.startswith(source + os.sep):
        return None
    top = full[len(source) + 1:].split(os.sep, 1)[0]
    return top if top in FOLDERS else None


def relative(path, source):
    full = os.path.normpath(path)
    if full.startswith(source + os.sep):
        return full[len(source) + 1:]
    return path


def _strip_balanced_tail(text, open_c, close_c):
    """text without its last balanced open_c...close_c group at the end."""
    if not text.endswith(close_c):
        return text
    depth = 0
    for i in range(len(text) - 1, -1, -1):
        c = text[i]
        if c == close_c:
            depth += 1
        elif c == open_c:
            depth -= 1
            if depth == 0:
                return text[:i]
    return text


def short_name(name):
    """The unqualified name of a demangled C++ function:
    "VELA::APIRunner::GetMethodAttr(VELA::APIRequest*, ...) const" -> "GetMethodAttr"."""
    text = re.sub(r"'\d+$", "", name)               # recursion depth suffix
    text = re.sub(r" \[clone [^\]]*\]$", "", text)
    text = re.sub(r"\[abi:[^\]]*\]", "", text)
    text = re.sub(r"( const| volatile| &&| &)+$", "", text)
    if text.endswith(")") and not text.endswith("operator()"):
        text = _strip_balanced_tail(text, "(", ")")
    text = _strip_balanced_tail(text, "<", ">")
    depth = 0
    cut = 0
    i = 0
    while i < len(text):
        c = text[i]
        if c in "<(":
            depth += 1
        elif c in ">)":
            depth -= 1
        elif c == ":" and depth == 0 and text.startswith("::", i):
            cut = i + 2
            i += 1
        i += 1
    return text[cut:]


def pretty(name):
    """A demangled name with the standard string spelled as in the source."""
    name = name.replace("std::__cxx11::basic_string<char, std::char_traits<char>, std::allocator<char> >",
                        "std::string")
    return name.replace("[abi:cxx11]", "")


def display(function, source):
    path, name = function
    return "%s  [%s]" % (pretty(name), relative(path or "???", source))


# ---------------------------------------------------------------- (a) and (b)

def print_edges(source, out, registry):
    source = os.path.realpath(source)
    trace = parse_callgrind(out)
    folder = {f: folder_of(f[0], source) for f in trace.functions}

    matrix = collections.Counter()
    road_edges = collections.Counter()
    road_files = 0
    for (caller, callee), count in trace.calls.items():
        a, b = folder[caller], folder[callee]
        if a in ROAD and b in ROAD and caller[0] != callee[0]:
            road_files += count
        if a is None or b is None or a == b:
            continue
        matrix[(a, b)] += count
        if a in ROAD and b in ROAD:
            road_edges[(caller, callee)] += count

    road_total = sum(road_edges.values())
    print("(a) hand-offs between folders (executed calls from a function of one folder")
    print("    to a function of another)")
    print()
    print("    hand-offs among webentry/, dispatcher/ and access/: %d" % road_total)
    for a in ROAD:
        for b in ROAD:
            if a != b and matrix[(a, b)]:
                print("      %-10s -> %-10s %5d" % (a, b, matrix[(a, b)]))
    print("    (calls between different files of these folders, hand-offs included: %d)" % road_files)
    print()
    print("    those hand-offs, by caller and callee:")
    for (caller, callee), count in sorted(road_edges.items(),
                                          key=lambda kv: (-kv[1], kv[0][0][1], kv[0][1][1])):
        print("      %4d  %s" % (count, display(caller, source)))
        print("            -> %s" % display(callee, source))
    print()
    print("    every project folder (rows call columns; %s):" %
          ", ".join("%s=%s" % (ABBREV[f], f) for f in FOLDERS))
    width = 6
    print("    %-10s" % "" + "".join("%*s" % (width, ABBREV[f]) for f in FOLDERS) + "%*s" % (8, "out"))
    for a in FOLDERS:
        row = [matrix[(a, b)] for b in FOLDERS]
        print("    %-10s" % a + "".join("%*s" % (width, v if v else ".") for v in row)
              + "%*d" % (8, sum(row)))
    incoming = [sum(matrix[(a, b)] for a in FOLDERS) for b in FOLDERS]
    print("    %-10s" % "in" + "".join("%*d" % (width, v) for v in incoming)
          + "%*d" % (8, sum(incoming)))
    print("    all hand-offs between project folders: %d" % sum(matrix.values()))

    # (b) registry look-ups.
    calls_to = collections.Counter()
    for (caller, callee), count in trace.calls.items():
        calls_to[callee] += count
    registry_paths = [os.path.normpath(os.path.join(source, r)) for r in registry]
    print()
    print("(b) registry look-ups (executed calls)")
    print()
    for reg in registry_paths:
        if not os.path.isfile(reg):
            print("    %s: no such file" % relative(reg, source))
            continue
        rows = [(calls_to[f], f) for f in trace.functions
                if f[0] and os.path.normpath(f[0]) == reg]
        total = sum(c for c, _ in rows)
        print("    functions of %s: %d calls to %d functions" %
              (relative(reg, source), total, sum(1 for c, _ in rows if c)))
        for count, f in sorted(rows, key=lambda r: (-r[0], r[1][1])):
            if count:
                print("      %4d  %s" % (count, pretty(f[1])))
    print()
    print("    look-up functions by name, wherever defined:")
    by_name = collections.Counter()
    where = collections.defaultdict(collections.Counter)
    for f in trace.functions:
        if folder[f] is None or not calls_to[f]:
            continue
        short = short_name(f[1])
        if short in LOOKUPS:
            by_name[short] += calls_to[f]
            where[short][relative(f[0], source)] += calls_to[f]
    for short in LOOKUPS:
        if where[short]:
            places = ", ".join("%s %d" % (p, c) for p, c in sorted(where[short].items()))
        else:
            places = "not called"
        print("      %-15s %4d   (%s)" % (short, by_name[short], places))
    if trace.total:
        print()
        print("    instructions of the whole run: %s" % trace.total)


# ---------------------------------------------------------------- (c)

def production_files(source):
    """The C and C++ files of the production code: tracked by git when the
    source is a git work tree, else every file outside build trees."""
    exts = (".c", ".cc", ".cpp", ".cxx", ".h", ".hh", ".hpp")
    files = None
    try:
        out = subprocess.run(["git", "-C", source, "ls-files", "-z"], check=True,
                             capture_output=True).stdout.decode()
        files = [p for p in out.split("\0") if p]
    except (OSError, subprocess.CalledProcessError):
        files = []
        for root, dirs, names in os.walk(source):
            dirs[:] = [d for d in dirs if not d.startswith(".")
                       and not os.path.exists(os.path.join(root, d, "CMakeCache.txt"))]
            for n in names:
                files.append(os.path.relpath(os.path.join(root, n), source))
    return sorted(p for p in files
                  if p.endswith(exts) and p.split("/", 1)[0] not in EXCLUDED_TOP
                  and os.path.isfile(os.path.join(source, p)))


def print_longest(source, count):
    source = os.path.realpath(source)
    files = production_files(source)
    # Line numbers as the address: no source text (which may hold tabs) in
    # the tag lines.
    out = subprocess.run(["ctags", "--fields=+neK", "--excmd=number", "--kinds-C=f", "--kinds-C++=f",
                          "--output-format=u-ctags", "-f", "-", "-L", "-"],
                         input="\n".join(files) + "\n", cwd=source, check=True,
                         capture_output=True, text=True).stdout
    rows = []
    for line in out.splitlines():
        if line.startswith("!_"):
            continue
        parts = line.split("\t")
        if len(parts) < 4:
            continue
        fields = {"kind": parts[3].split(":", 1)[-1]}
        for p in parts[4:]:
            if ":" in p:
                k, v = p.split(":", 1)
                fields[k] = v
        if fields.get("kind") != "function" or "line" not in fields or "end" not in fields:
            continue
        start, end = int(fields["line"]), int(fields["end"])
        scope = ""
        for k in ("class", "struct", "namespace"):
            if k in fields:
                scope = fields[k] + "::"
                break
        scope = re.sub(r"__anon[0-9a-f]+", "(anonymous)", scope)
        rows.append((end - start + 1, parts[1], start, scope + parts[0]))
    rows.sort(key=lambda r: (-r[0], r[1], r[2]))
    print("(c) longest functions of the production code (universal-ctags, end - start + 1;")
    print("    %d files, tests/ fuzz/ bench/ left out)" % len(files))
    print()
    for i, (length, path, start, name) in enumerate(rows[:count], 1):
        print("    %2d. %4d lines  %s:%d  %s" % (i, length, path, start, name))


def main(argv):
    if len(argv) >= 4 and argv[1] == "edges":
        print_edges(argv[2], argv[3], argv[4:] or ["dispatcher/Registry.cpp"])
        return 0
    if len(argv) in (3, 4) and argv[1] == "longest":
        print_longest(argv[2], int(argv[3]) if len(argv) == 4 else 15)
        return 0
    sys.stderr.write(__doc__)
    return 2


if __name__ == "__main__":
    sys.exit(main(sys.argv))
