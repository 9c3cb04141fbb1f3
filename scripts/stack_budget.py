#!/usr/bin/env python3
"""stack_budget.py - the worst stack a TA entry point can use.

Reads GCC's per-source call graphs with frame sizes (-fcallgraph-info=su,
the .ci files) and the objects beside them, and follows every call from
each entry point named in the table. Calls through pointers, recursion and
the TEE functions the TA calls are bounded by the reviewed table
(scripts/stack_budget.table, whose header says how). Prints the worst chain
of each entry point with its bytes and fails when one is above the budget
less the margin, or when the graph holds something the table does not bound:
an unlisted call through a pointer, a function whose address is taken that
no listed call can reach, recursion without a depth, a frame of dynamic
size, a TEE function without a cost, or a table line that matches nothing.

usage: stack_budget.py --table FILE [--expect-fail TEXT]... DIR...
With --expect-fail (the tool's own test) it passes only when the analysis
fails and each TEXT is in some line it printed.
"""

import argparse
import fnmatch
import os
import re
import struct
import subprocess
import sys

INDIRECT = "__indirect_call"
# Direct calls and tail calls; any other reference to a function takes its address.
CALL_RELOCS = {282, 283}  # R_AARCH64_JUMP26, R_AARCH64_CALL26
SKIP_RELOC_SECTIONS = (".rela.eh_frame", ".rela.debug")


class Failure(Exception):
    pass


class Node:
    def __init__(self, node_id, name):
        self.id = node_id
        self.name = name
        self.frame = None  # bytes, None for a function defined elsewhere
        self.dynamic = False
        self.calls = {}  # callee id -> first call site

    @property
    def external(self):
        return self.frame is None


# ---------------------------------------------------------------- table


class Table:
    def __init__(self, path):
        self.budget = None
        self.margin = None
        self.entries = []
        self.externs = []  # (pattern, bytes)
        self.indirect = []  # (caller pattern, [target patterns], line)
        self.recursion = []  # (pattern, depth, line)
        with open(path, encoding="utf-8") as f:
            for number, raw in enumerate(f, 1):
                line = raw.split("#", 1)[0].strip()
                if not line:
                    continue
                where = f"{path}:{number}"
                words = line.split()
                kind = words[0]
                try:
                    if kind == "budget" and len(words) == 2:
                        self.budget = words[1]  # bytes, or the TA header whose stack size it is
                    elif kind == "margin" and len(words) == 2:
                        self.margin = int(words[1], 0)
                    elif kind == "entry" and len(words) == 2:
                        self.entries.append(words[1])
                    elif kind == "extern" and len(words) == 3:
                        self.externs.append((words[1], int(words[2], 0)))
                    elif kind == "indirect" and len(words) >= 4 and words[2] == "->":
                        self.indirect.append((words[1], words[3:], where))
                    elif kind == "recursion" and len(words) == 3:
                        self.recursion.append((words[1], int(words[2], 0), where))
                    else:
                        raise ValueError
                except ValueError:
                    raise Failure(f"{where}: cannot read '{line}'")
        if self.budget is None or self.margin is None:
            raise Failure(f"{path}: needs a budget and a margin")
        if not self.entries:
            raise Failure(f"{path}: names no entry point")


# ---------------------------------------------------------------- call graph

NODE_RE = re.compile(r'^node: \{ title: "((?:[^"\\]|\\.)*)" label: "((?:[^"\\]|\\.)*)"')
EDGE_RE = re.compile(r'^edge: \{ sourcename: "((?:[^"\\]|\\.)*)" targetname: "((?:[^"\\]|\\.)*)" label: "((?:[^"\\]|\\.)*)"')
GRAPH_RE = re.compile(r'^graph: \{ title: "((?:[^"\\]|\\.)*)"')
FRAME_RE = re.compile(r"(\d+) bytes \(([a-z,]+)\)")
CLONE_RE = re.compile(r"( \[clone [^\]]*\])+$")


def demangle_all(symbols):
    """Demangled names without parameters, for many symbols in one c++filt run."""
    symbols = list(symbols)
    if not symbols:
        return {}
    out = subprocess.run(["c++filt", "-p"], input="\n".join(symbols) + "\n", capture_output=True, text=True, check=True)
    return dict(zip(symbols, out.stdout.splitlines()))


def canonical(title, source, local):
    """(node id, symbol, file-local) of a node title. GCC titles a function
    'source:symbol' when it is file-local or may be emitted in several files
    (inline, templates); the latter are one function, known by the symbol."""
    prefix = source + ":"
    if not title.startswith(prefix):
        return title, title, False
    symbol = title[len(prefix):]
    if local.get(symbol) is False:
        return symbol, symbol, False
    return title, symbol, True


def display_name(demangled, source, file_local):
    name = CLONE_RE.sub("", demangled)
    if file_local:
        name = name.replace("(anonymous namespace)::", "")
        return f"{os.path.basename(source)}:{name}"
    return name


def read_graphs(dirs):
    nodes = {}
    sources = []  # dicts: source, ci, obj, local, taken
    raw = []  # (source index, kind, fields)
    for d in dirs:
        for entry in sorted(os.listdir(d)):
            if not entry.endswith(".ci"):
                continue
            ci = os.path.join(d, entry)
            obj = ci[:-3] + ".o"
            source = None
            with open(ci, encoding="utf-8") as f:
                for line in f:
                    m = GRAPH_RE.match(line)
                    if m:
                        source = m.group(1)
                        continue
                    m = NODE_RE.match(line) or EDGE_RE.match(line)
                    if m:
                        raw.append((len(sources), line[:4], m.groups()))
            if source is None:
                raise Failure(f"{ci}: not a call graph")
            if not os.path.exists(obj):
                raise Failure(f"{ci}: no object {obj} beside it")
            local, taken, aliases = read_elf(obj)
            sources.append(dict(source=source, ci=ci, obj=obj, local=local, taken=taken, aliases=aliases))
    if not sources:
        raise Failure(f"no call graphs (.ci) in {' '.join(dirs)}")

    def ident(title, i):
        return canonical(title, sources[i]["source"], sources[i]["local"])

    titles = {(f[0], i) for i, _kind, f in raw} | {(f[1], i) for i, kind, f in raw if kind == "edge"}
    demangled = demangle_all({ident(t, i)[1] for t, i in titles if t != INDIRECT})

    def node(title, i):
        node_id, symbol, file_local = ident(title, i)
        if node_id not in nodes:
            nodes[node_id] = Node(node_id, display_name(demangled.get(symbol, symbol), sources[i]["source"], file_local))
        return nodes[node_id]

    for i, kind, fields in raw:
        if kind == "node":
            title, label = fields
            if title == INDIRECT:
                continue
            n = node(title, i)
            m = FRAME_RE.search(label)
            if m:
                size, how = int(m.group(1)), m.group(2)
                n.frame = max(n.frame or 0, size)
                n.dynamic = n.dynamic or (how.startswith("dynamic") and "bounded" not in how)
        else:
            src, dst, loc = fields
            caller = node(src, i)
            target = INDIRECT if dst == INDIRECT else node(dst, i).id
            caller.calls.setdefault(target, loc)

    # A call by one name of a function defined under another goes to the definition.
    same = {}
    for i, src in enumerate(sources):
        for names in src["aliases"]:
            ids = [ident(f"{src['source']}:{name}", i)[0] for name in names]
            defined = [x for x in ids if x in nodes and not nodes[x].external]
            for x in ids:
                if defined and x in nodes and nodes[x].external:
                    same[x] = defined[0]
    for n in nodes.values():
        n.calls = {same.get(callee, callee): loc for callee, loc in n.calls.items()}
    for x in same:
        del nodes[x]
    return nodes, sources


# ---------------------------------------------------------------- ELF: address-taken functions


def elf_sections(data):
    if data[:4] != b"\x7fELF" or data[4] != 2 or data[5] != 1:
        raise Failure("not a 64-bit little-endian ELF object")
    shoff, = struct.unpack_from("<Q", data, 0x28)
    shentsize, shnum, shstrndx = struct.unpack_from("<HHH", data, 0x3A)
    sections = []
    for i in range(shnum):
        name, kind, _flags, _addr, offset, size, link, info, _align, entsize = struct.unpack_from(
            "<IIQQQQIIQQ", data, shoff + i * shentsize)
        sections.append(dict(name=name, type=kind, offset=offset, size=size, link=link, info=info, entsize=entsize))
    strtab = sections[shstrndx]
    for s in sections:
        s["name"] = cstring(data, strtab["offset"] + s["name"])
    return sections


def cstring(data, offset):
    end = data.index(b"\0", offset)
    return data[offset:end].decode()


def elf_symbols(data, sections):
    symtab = next(s for s in sections if s["type"] == 2)  # SHT_SYMTAB
    strings = sections[symtab["link"]]
    symbols = []
    for i in range(symtab["size"] // 24):
        name, info, _other, shndx, value, size = struct.unpack_from("<IBBHQQ", data, symtab["offset"] + i * 24)
        symbols.append(dict(name=cstring(data, strings["offset"] + name), type=info & 0xF, bind=info >> 4,
                            shndx=shndx, value=value, size=size))
    return symbols


def header_stack_size(sources, name):
    """The stack size in the TA header `name` (a ta_header_t: the 16-byte
    UUID, then the stack size as a u32) as the objects define it."""
    for src in sources:
        with open(src["obj"], "rb") as f:
            data = f.read()
        sections = elf_sections(data)
        for sym in elf_symbols(data, sections):
            if sym["name"] == name and sym["type"] == 1 and 0 < sym["shndx"] < len(sections):  # STT_OBJECT
                section = sections[sym["shndx"]]
                if sym["size"] < 24 or section["type"] == 8:  # SHT_NOBITS
                    raise Failure(f"{src['obj']}: {name} is not a TA header")
                return struct.unpack_from("<I", data, section["offset"] + sym["value"] + 16)[0]
    raise Failure(f"no object defines the TA header {name}")


def read_elf(obj):
    """(symbols, address-taken, aliases) of an object. Symbols maps names to
    True when local; aliases lists the groups of names of one function;
    address-taken lists (symbol, defined here) for every function whose
    address the object takes (an undefined symbol may be data: the caller
    keeps the ones that are functions of the graph)."""
    with open(obj, "rb") as f:
        data = f.read()
    sections = elf_sections(data)
    symbols = elf_symbols(data, sections)
    functions = {}  # (section index, offset) -> defined function symbol
    for s in symbols:
        if s["type"] == 2 and s["shndx"] not in (0, 0xFFF1, 0xFFF2):  # STT_FUNC, defined
            functions[(s["shndx"], s["value"])] = s
    taken = set()
    for rela in sections:
        if rela["type"] != 4 or rela["name"].startswith(SKIP_RELOC_SECTIONS):  # SHT_RELA
            continue
        for i in range(rela["size"] // 24):
            _offset, info, addend = struct.unpack_from("<QQq", data, rela["offset"] + i * 24)
            kind, index = info & 0xFFFFFFFF, info >> 32
            if kind in CALL_RELOCS or index == 0:
                continue
            sym = symbols[index]
            if sym["shndx"] == 0:  # defined elsewhere: a function or data
                if sym["name"]:
                    taken.add((sym["name"], False))
            elif sym["type"] == 2:  # a function by its own symbol
                taken.add((sym["name"], True))
            elif sym["type"] == 3:  # STT_SECTION: the function starting at the addend, if any
                target = functions.get((sym["shndx"], addend))
                if target is not None:
                    taken.add((target["name"], True))
    local = {s["name"]: s["bind"] == 0 for s in symbols if s["name"] and s["shndx"] != 0}
    # Names of one function (a destructor's complete and base variants).
    at = {}
    for s in symbols:
        if s["type"] == 2 and s["shndx"] not in (0, 0xFFF1, 0xFFF2):
            at.setdefault((s["shndx"], s["value"]), []).append(s["name"])
    aliases = [names for names in at.values() if len(names) > 1]
    return local, sorted(taken), aliases


# ---------------------------------------------------------------- analysis


def matches(pattern, name):
    return fnmatch.fnmatchcase(name, pattern)


def resolve_indirect(nodes, sources, table, errors):
    defined = [n for n in nodes.values() if not n.external]

    used_callers = set()
    reached = set()
    for n in sorted(nodes.values(), key=lambda x: x.name):
        if INDIRECT not in n.calls:
            continue
        site = n.calls.pop(INDIRECT)
        listed = [(i, entry) for i, entry in enumerate(table.indirect) if matches(entry[0], n.name)]
        if not listed:
            errors.append(f"unlisted call through a pointer in {n.name} at {site}")
            continue
        for i, (_caller, targets, where) in listed:
            used_callers.add(i)
            for pattern in targets:
                hits = [t for t in defined if matches(pattern, t.name)]
                if not hits:
                    errors.append(f"{where}: target {pattern} matches no function")
                for t in hits:
                    n.calls.setdefault(t.id, f"{site} (through a pointer)")
                    reached.add(t.id)
    # A caller that makes its calls directly once the compiler has inlined
    # them is no fault; a caller that no longer exists is a stale line.
    for i, (caller, _targets, where) in enumerate(table.indirect):
        if i not in used_callers and not any(matches(caller, n.name) for n in defined):
            errors.append(f"{where}: caller {caller} matches no function")

    # Every function whose address is taken must be a listed target or an entry point.
    entries = {n.id for n in nodes.values() if any(matches(e, n.name) for e in table.entries)}
    unreached = {}  # node -> files that take its address
    for src in sources:
        for symbol, defined in src["taken"]:
            file_local = defined and src["local"].get(symbol, True)
            n = nodes.get(f"{src['source']}:{symbol}" if file_local else symbol)
            if n is None or n.external:
                if defined:
                    errors.append(f"{src['obj']}: {symbol} has its address taken but is not in {src['ci']}")
                continue  # data, or a function of the TEE
            if n.id not in reached and n.id not in entries:
                unreached.setdefault(n.name, []).append(os.path.basename(src["source"]))
    for name, files in sorted(unreached.items()):
        errors.append(f"{name} has its address taken ({', '.join(files)}) "
                      f"but no listed call through a pointer reaches it")


def strongly_connected(nodes):
    index, low, on_stack, stack, result = {}, {}, set(), [], []
    counter = [0]
    for root in nodes:
        if root in index:
            continue
        work = [(root, iter(nodes[root].calls))]
        index[root] = low[root] = counter[0]
        counter[0] += 1
        stack.append(root)
        on_stack.add(root)
        while work:
            v, it = work[-1]
            advanced = False
            for w in it:
                if w not in index:
                    index[w] = low[w] = counter[0]
                    counter[0] += 1
                    stack.append(w)
                    on_stack.add(w)
                    work.append((w, iter(nodes[w].calls)))
                    advanced = True
                    break
                if w in on_stack:
                    low[v] = min(low[v], index[w])
            if advanced:
                continue
            work.pop()
            if work:
                low[work[-1][0]] = min(low[work[-1][0]], low[v])
            if low[v] == index[v]:
                component = []
                while True:
                    w = stack.pop()
                    on_stack.discard(w)
                    component.append(w)
                    if w == v:
                        break
                result.append(component)
    return result


def extern_cost(node, table, errors):
    for pattern, size in table.externs:
        if matches(pattern, node.name):
            return size
    errors.append(f"{node.name} is called but has no cost in the table (an extern line)")
    return 0


def worst_chains(nodes, table, errors):
    """For each node: (bytes, chain) of its worst path, recursion counted by its depth."""
    component_of = {}
    components = strongly_connected(nodes)
    for c in components:
        for v in c:
            component_of[v] = tuple(c)
    cycles = {}
    used_recursion = set()
    for c in components:
        if len(c) == 1 and c[0] not in nodes[c[0]].calls:
            continue
        names = sorted(nodes[v].name for v in c)
        depth = None
        for i, (pattern, d, _where) in enumerate(table.recursion):
            if any(matches(pattern, n) for n in names):
                depth = d
                used_recursion.add(i)
        if depth is None:
            errors.append(f"recursion without a depth in the table: {' -> '.join(names)}")
            depth = 1
        cycles[tuple(c)] = depth
    for i, (pattern, _d, where) in enumerate(table.recursion):
        if i not in used_recursion:
            errors.append(f"{where}: no recursion through {pattern}")

    memo = {}

    def cost(v):
        key = component_of[v]
        if key in memo:
            return memo[key]
        members = [nodes[m] for m in key]
        if len(members) == 1 and members[0].external:
            own = extern_cost(members[0], table, errors)
            memo[key] = (own, [(own, members[0].name + " (TEE, assumed)")])
            return memo[key]
        depth = cycles.get(key, 1)
        own = depth * sum(m.frame or 0 for m in members)
        if key in cycles:
            label = f"{' <-> '.join(sorted(m.name for m in members))} (recursion, depth {depth})"
        else:
            label = members[0].name
        best = (0, [])
        for m in members:
            for callee in m.calls:
                if component_of[callee] == key:
                    continue
                sub = cost(callee)
                if sub[0] > best[0]:
                    best = sub
        memo[key] = (own + best[0], [(own, label)] + best[1])
        return memo[key]

    return cost


def analyse(dirs, table_path):
    table = Table(table_path)
    errors = []
    nodes, sources = read_graphs(dirs)
    for n in nodes.values():
        if n.dynamic:
            errors.append(f"{n.name} has a stack frame of dynamic size")
    resolve_indirect(nodes, sources, table, errors)
    cost = worst_chains(nodes, table, errors)
    try:
        budget, whence = int(table.budget, 0), "the table"
    except ValueError:
        budget, whence = header_stack_size(sources, table.budget), f"the stack size of {table.budget}"
    limit = budget - table.margin
    lines = [f"stack budget: {budget:#x} bytes ({whence}) less a margin of {table.margin} for the TEE's own frames: "
             f"{limit} bytes for the TA"]
    for pattern in table.entries:
        hits = [n for n in nodes.values() if not n.external and matches(pattern, n.name)]
        if len(hits) != 1:
            errors.append(f"entry point {pattern}: {len(hits)} functions match")
            continue
        total, chain = cost(hits[0].id)
        verdict = "within budget" if total <= limit else "OVER BUDGET"
        lines.append(f"{hits[0].name}: {total} bytes ({verdict}, {limit - total} to spare)")
        for size, label in chain:
            lines.append(f"  {size:6d}  {label}")
        if total > limit:
            errors.append(f"{hits[0].name} needs {total} bytes, above {limit}")
    return lines, errors


def main():
    parser = argparse.ArgumentParser(description=__doc__.split("\n\n")[0])
    parser.add_argument("--table", required=True)
    parser.add_argument("--expect-fail", action="append", default=[])
    parser.add_argument("dirs", nargs="+")
    args = parser.parse_args()
    try:
        lines, errors = analyse(args.dirs, args.table)
    except Failure as e:
        lines, errors = [], [str(e)]
    print("\n".join(lines))
    for e in errors:
        print(f"FAIL: {e}")
    if not args.expect_fail:
        return 1 if errors else 0
    output = lines + errors
    missing = [t for t in args.expect_fail if not any(t in line for line in output)]
    for t in missing:
        print(f"SELF-TEST: nothing mentions '{t}'")
    if not errors:
        print("SELF-TEST: the analysis passed where it must fail")
    return 1 if missing or not errors else 0


if __name__ == "__main__":
    sys.exit(main())
