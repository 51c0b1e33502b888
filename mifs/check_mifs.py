#!/usr/bin/env python3
"""Consistency check of the shipped MIF files.

Usage: check_mifs.py <mifs directory>

Reads mox.mif, the component MIFs it lists as supported components and the
older mox.mif versions in old/, and checks that they hold what the daemon
reads from them: the own component's name and version, the supported
components, the layout of the actions tables (every row readable from
attribute 7 on, so that action code c stands at position c - 7), rows that
refer to groups, event types and instances that exist, the baseboard groups
the actions write, and old rows whose keys exist in the current mox.mif.
Prints every problem found and exits with 1 when there is one, else 0.
"""

import os
import re
import struct
import sys

OWN_NAME = "Zorek Tessarin Server Manager - Mox"
COMPONENT_ID_CLASS = "DMTF|ComponentID|001"
WILDCARD = -2147483648
G10_KEYS = [1, 2, 3, 4, 5, 6, 31, 32]
G4_KEYS = [1, 2, 3, 4, 5, 6]
G3_KEYS = [1, 2, 3, 4, 5]
ACTION_IDS = list(range(7, 23))          # 7 to 22, 17 is the alert name
SEVERITIES = {0x01, 0x02, 0x04, 0x08, 0x10, 0x20}

SYSTEM_CONTROL = {2: "Initiate Reset", 7: "Off", 17: "Shutdown OS",
                  18: "Shutdown and Power Off",
                  19: "Shutdown and Hardware Reset", 20: "Issue an NMI",
                  25: ("LED Blink", "LED Off")}


class MifError(Exception):
    pass


class Unknown:
    """The value words `unknown` and `unsupported`."""
    def __init__(self, word):
        self.word = word

    def __repr__(self):
        return self.word


# ---------------------------------------------------------------- lexer

TOKEN_RE = re.compile(r"""
    (?P<ws>[ \t\r]+) |
    (?P<nl>\n) |
    (?P<comment>//[^\n]*) |
    (?P<str>"(?:[^"\\\n]|\\.)*") |
    (?P<int>-?(?:0[xX][0-9A-Fa-f]+|[0-9]+)) |
    (?P<word>[A-Za-z_][A-Za-z0-9_\-]*) |
    (?P<punct>[=,{}()])
""", re.VERBOSE)


def unescape(body, where):
    out = []
    i = 0
    while i < len(body):
        c = body[i]
        if c != "\\":
            out.append(c)
            i += 1
            continue
        e = body[i + 1]
        if e in "nt\\\"":
            out.append({"n": "\n", "t": "\t", "\\": "\\", '"': '"'}[e])
            i += 2
        elif e == "x" and re.fullmatch(r"[0-9A-Fa-f]{2}", body[i + 2:i + 4]):
            out.append(chr(int(body[i + 2:i + 4], 16)))
            i += 4
        else:
            raise MifError(f"{where}: bad escape \\{e}")
    return "".join(out)


def parse_int(text, where):
    neg = text.startswith("-")
    t = text[1:] if neg else text
    if t[:2] in ("0x", "0X"):
        v = int(t[2:], 16)
    elif len(t) > 1 and t[0] == "0":
        if not re.fullmatch(r"[0-7]+", t):
            raise MifError(f"{where}: bad octal number {text}")
        v = int(t, 8)
    else:
        v = int(t)
    return -v if neg else v


def tokenize(text, fname):
    tokens = []
    line = 1
    pos = 0
    while pos < len(text):
        m = TOKEN_RE.match(text, pos)
        if not m:
            raise MifError(f"{fname}:{line}: unexpected character {text[pos]!r}")
        kind = m.lastgroup
        val = m.group()
        where = f"{fname}:{line}"
        if kind == "nl":
            line += 1
        elif kind == "str":
            s = unescape(val[1:-1], where)
            if tokens and tokens[-1][0] == "str":      # adjacent literals
                tokens[-1] = ("str", tokens[-1][1] + s, tokens[-1][2])
            else:
                tokens.append(("str", s, line))
        elif kind == "int":
            tokens.append(("int", parse_int(val, where), line))
        elif kind in ("word", "punct"):
            tokens.append((kind, val, line))
        pos = m.end()
    return tokens


# ---------------------------------------------------------------- parser

class Enum:
    def __init__(self, name):
        self.name = name
        self.entries = []                 # (value, text) in file order

    def value_of(self, text):
        for v, t in self.entries:
            if t == text:
                return v
        return None

    def texts(self):
        return [t for _, t in self.entries]


class Attribute:
    def __init__(self):
        self.name = None
        self.id = None
        self.type = None                  # ("int", kw) ("str", n) ("date",) ("enum", Enum)
        self.access = None
        self.storage = None
        self.value = None
        self.line = 0


class Group:
    def __init__(self):
        self.name = None
        self.cls = None
        self.id = None
        self.keys = []
        self.attrs = {}                   # id -> Attribute
        self.rows = None                  # list of dict id -> value, None without table
        self.explicit = []                # per row: set of ids given in the row
        self.line = 0

    def attr_ids(self):
        return sorted(self.attrs)

    def attr_named(self, name):
        for a in self.attrs.values():
            if a.name == name:
                return a
        return None


class Component:
    def __init__(self, fname):
        self.fname = fname
        self.name = None
        self.enums = {}
        self.groups = {}                  # id -> Group, file order kept

    def groups_with_class_prefix(self, prefix):
        return [g for g in self.groups.values()
                if g.cls.lower().startswith(prefix.lower())]

    def group_by_class(self, cls):
        for g in self.groups.values():
            if g.cls == cls:
                return g
        return None


INT_TYPES = {"counter", "counter64", "gauge", "integer", "int", "integer64", "int64"}
STR_TYPES = {"octetstring", "displaystring", "string"}


class Parser:
    def __init__(self, tokens, fname):
        self.t = tokens
        self.i = 0
        self.fname = fname

    def where(self):
        line = self.t[self.i][2] if self.i < len(self.t) else (self.t[-1][2] if self.t else 1)
        return f"{self.fname}:{line}"

    def fail(self, msg):
        raise MifError(f"{self.where()}: {msg}")

    def peek(self, k=0):
        return self.t[self.i + k] if self.i + k < len(self.t) else (None, None, 0)

    def next(self):
        if self.i >= len(self.t):
            self.fail("unexpected end of file")
        tok = self.t[self.i]
        self.i += 1
        return tok

    def word(self, *expected):
        kind, val, _ = self.next()
        if kind != "word" or (expected and val.lower() not in expected):
            self.i -= 1
            self.fail(f"expected {' or '.join(expected) or 'a keyword'}, got {val!r}")
        return val.lower()

    def punct(self, p):
        kind, val, _ = self.next()
        if kind != "punct" or val != p:
            self.i -= 1
            self.fail(f"expected {p!r}, got {val!r}")

    def string(self):
        kind, val, _ = self.next()
        if kind != "str":
            self.i -= 1
            self.fail(f"expected a string, got {val!r}")
        return val

    def integer(self):
        kind, val, _ = self.next()
        if kind != "int":
            self.i -= 1
            self.fail(f"expected an integer, got {val!r}")
        return val

    def is_end(self, what):
        k, v, _ = self.peek()
        k2, v2, _ = self.peek(1)
        return k == "word" and v.lower() == "end" and k2 == "word" and v2.lower() == what

    def parse(self):
        if self.peek()[0] == "word" and self.peek()[1].lower() == "language":
            self.word("language")
            self.punct("=")
            self.string()
        self.word("start")
        self.word("component")
        comp = Component(self.fname)
        while not self.is_end("component"):
            kw = self.word()
            if kw == "name":
                self.punct("=")
                comp.name = self.string()
            elif kw == "description":
                self.punct("=")
                self.string()
            elif kw == "start":
                what = self.word("enum", "group", "table")
                if what == "enum":
                    e = self.enum_body(named=True)
                    if e.name.lower() in comp.enums:
                        self.fail(f"enumeration {e.name!r} declared twice")
                    comp.enums[e.name.lower()] = e
                elif what == "group":
                    g = self.group(comp)
                    if g.id in comp.groups:
                        self.fail(f"group id {g.id} used twice")
                    comp.groups[g.id] = g
                else:
                    self.table(comp)
            else:
                self.i -= 1
                self.fail(f"unexpected {kw!r} in component")
        self.word("end")
        self.word("component")
        if self.i != len(self.t):
            self.fail("text after end component")
        if comp.name is None:
            self.fail("component without a name")
        return comp

    def enum_body(self, named):
        e = Enum(None)
        while not self.is_end("enum"):
            k, v, _ = self.peek()
            if k == "word" and v.lower() == "name":
                self.word("name")
                self.punct("=")
                e.name = self.string()
            elif k == "int":
                val = self.integer()
                self.punct("=")
                text = self.string()
                if any(val == ev for ev, _ in e.entries):
                    self.fail(f"enumeration value {val} given twice")
                e.entries.append((val, text))
            else:
                self.fail(f"unexpected {v!r} in enumeration")
        self.word("end")
        self.word("enum")
        if named and e.name is None:
            self.fail("named enumeration without a name")
        return e

    def group(self, comp):
        g = Group()
        g.line = self.peek()[2]
        while not self.is_end("group"):
            kw = self.word()
            if kw == "start":
                self.word("attribute")
                a = self.attribute(comp)
                if a.id in g.attrs:
                    self.fail(f"attribute id {a.id} used twice")
                g.attrs[a.id] = a
                continue
            self.punct("=")
            if kw == "name":
                g.name = self.string()
            elif kw == "class":
                g.cls = self.string()
            elif kw == "id":
                g.id = self.integer()
            elif kw == "description":
                self.string()
            elif kw == "key":
                g.keys = [self.integer()]
                while self.peek()[0] == "punct" and self.peek()[1] == ",":
                    self.punct(",")
                    g.keys.append(self.integer())
            else:
                self.i -= 2
                self.fail(f"unexpected {kw!r} in group")
        self.word("end")
        self.word("group")
        if g.name is None or g.cls is None or g.id is None:
            self.fail("group needs name, class and id")
        for k in g.keys:
            if k not in g.attrs:
                self.fail(f"group {g.id}: key attribute {k} does not exist")
        for a in g.attrs.values():
            if a.value is None:
                self.fail(f"group {g.id}: attribute {a.id} has no value")
        return g

    def attribute(self, comp):
        a = Attribute()
        a.line = self.peek()[2]
        while not self.is_end("attribute"):
            kw = self.word()
            self.punct("=")
            if kw == "name":
                a.name = self.string()
            elif kw == "id":
                a.id = self.integer()
            elif kw == "description":
                self.string()
            elif kw == "type":
                a.type = self.type_(comp)
            elif kw == "access":
                a.access = self.word("read-only", "read-write", "write-only")
            elif kw == "storage":
                a.storage = self.word("common", "specific")
            elif kw == "value":
                a.value = self.value(a)
            else:
                self.i -= 2
                self.fail(f"unexpected {kw!r} in attribute")
        self.word("end")
        self.word("attribute")
        if a.name is None or a.id is None or a.type is None:
            self.fail("attribute needs name, id and type")
        return a

    def type_(self, comp):
        k, v, _ = self.peek()
        if k == "str":
            name = self.string()
            e = comp.enums.get(name.lower())
            if e is None:
                self.fail(f"unknown enumeration {name!r}")
            return ("enum", e)
        kw = self.word()
        if kw == "start":
            self.word("enum")
            return ("enum", self.enum_body(named=False))
        if kw in INT_TYPES:
            return ("int", kw)
        if kw == "date":
            return ("date",)
        if kw in STR_TYPES:
            self.punct("(")
            n = self.integer()
            self.punct(")")
            if n <= 0:
                self.fail(f"string length {n}")
            return ("str", n, kw)
        self.i -= 1
        self.fail(f"unknown type {kw!r}")

    def value(self, a):
        """Value statement or row slot, checked against the attribute's type."""
        if a.type is None:
            self.fail("value before type")
        k, v, _ = self.next()
        if k == "word" and v.lower() in ("unknown", "unsupported"):
            return Unknown(v.lower())
        kind = a.type[0]
        if kind == "int":
            if k != "int":
                self.i -= 1
                self.fail(f"attribute {a.id}: integer expected, got {v!r}")
            if not -2**31 <= v < 2**32:
                self.fail(f"attribute {a.id}: {v} does not fit 32 bits")
            return v
        if kind == "enum":
            if k == "int":
                return v
            if k == "str":
                val = a.type[1].value_of(v)
                if val is None:
                    self.i -= 1
                    self.fail(f"attribute {a.id}: {v!r} is not one of its enumeration texts")
                return val
        if kind == "str" and k == "str":
            if len(v.encode("latin-1")) > a.type[1]:
                self.i -= 1
                self.fail(f"attribute {a.id}: value longer than {a.type[1]} characters")
            return v
        if kind == "date" and k == "str":
            if not re.fullmatch(r"\d{14}\.\d{6}[+-]\d{3}", v):
                self.i -= 1
                self.fail(f"attribute {a.id}: bad date {v!r}")
            return v
        self.i -= 1
        self.fail(f"attribute {a.id}: value {v!r} does not suit its type")

    def table(self, comp):
        name = cls = tid = None
        rows = []
        explicit = []
        while not self.is_end("table"):
            k, v, _ = self.peek()
            if k == "punct" and v == "{":
                if tid is None or cls is None:
                    self.fail("table row before the table's class and id")
                g = comp.groups.get(tid)
                if g is None or g.cls != cls:
                    self.fail(f"table refers to no group of class {cls!r} and id {tid}")
                r, ex = self.row(g)
                rows.append(r)
                explicit.append(ex)
                continue
            kw = self.word()
            self.punct("=")
            if kw == "name":
                name = self.string()
            elif kw == "class":
                cls = self.string()
            elif kw == "id":
                tid = self.integer()
            else:
                self.i -= 2
                self.fail(f"unexpected {kw!r} in table")
        self.word("end")
        self.word("table")
        g = comp.groups.get(tid)
        if name is None or g is None or g.cls != cls:
            self.fail(f"table {name!r} refers to no group of class {cls!r} and id {tid}")
        if not g.keys:
            self.fail(f"table {name!r}: group {tid} has no keys")
        if g.rows is not None:
            self.fail(f"second table for group {tid}")
        g.rows = rows
        g.explicit = explicit
        seen = set()
        for r in rows:
            kv = tuple(r[k] for k in g.keys)
            if kv in seen:
                self.fail(f"table {name!r}: two rows with keys {kv}")
            seen.add(kv)

    def row(self, g):
        self.punct("{")
        ids = g.attr_ids()
        r = {}
        ex = set()
        pos = 0
        while True:
            if pos >= len(ids):
                self.fail(f"group {g.id}: row has more than {len(ids)} values")
            aid = ids[pos]
            k, v, _ = self.peek()
            if k == "punct" and v in (",", "}"):
                r[aid] = g.attrs[aid].value      # omitted: template value
            else:
                r[aid] = self.value(g.attrs[aid])
                ex.add(aid)
            pos += 1
            k, v, _ = self.next()
            if k == "punct" and v == "}":
                break
            if not (k == "punct" and v == ","):
                self.i -= 1
                self.fail(f"expected ',' or '}}' in row, got {v!r}")
        if pos != len(ids):
            self.fail(f"group {g.id}: row has {pos} values, the group {len(ids)} attributes")
        return r, ex


def load(path):
    with open(path, encoding="latin-1") as f:
        text = f.read()
    return Parser(tokenize(text, path), path).parse()


# ---------------------------------------------------------------- checks

def version_band(text):
    """The carry-over band the daemon picks for an installed version text:
    atof of the text, held as a 32-bit float, compared as a double."""
    m = re.match(r"\s*[+-]?(\d+\.?\d*|\.\d+)([eE][+-]?\d+)?", text)
    v = float(m.group()) if m else 0.0
    v = struct.unpack("f", struct.pack("f", v))[0]
    if v < 2.51:
        return 3
    if v < 2.91:
        return 4
    if v < 2.93:
        return 10
    return None


class Checker:
    def __init__(self):
        self.problems = []

    def bad(self, where, msg):
        self.problems.append(f"{where}: {msg}")

    def version(self, comp):
        g = comp.group_by_class(COMPONENT_ID_CLASS)
        if g is None:
            self.bad(comp.fname, f"no group of class {COMPONENT_ID_CLASS!r}")
            return None
        a = g.attr_named("Version")
        if a is None or a.type[0] != "str" or a.type[2] not in ("displaystring", "string"):
            self.bad(comp.fname, "no display string attribute \"Version\" in the ComponentID group")
            return None
        if not isinstance(a.value, str):
            self.bad(comp.fname, "\"Version\" has no text value")
            return None
        return a.value

    def actions_group(self, comp, gid, keys):
        """Layout of an actions table group; returns it or None."""
        g = comp.groups.get(gid)
        where = f"{comp.fname}: group {gid}"
        if g is None:
            self.bad(comp.fname, f"no group {gid}")
            return None
        if g.keys != keys:
            self.bad(where, f"keys {g.keys}, expected {keys}")
        if gid == 3:
            expected = set(range(1, 23))
        else:
            expected = set(keys) | set(range(1, 23)) | {30}
        if set(g.attrs) != expected:
            self.bad(where, f"attribute ids {g.attr_ids()}, expected {sorted(expected)}")
        for aid, a in g.attrs.items():
            want = "str" if aid == 17 else "int"
            if a.type[0] != want or (want == "int" and a.type[1] not in ("integer", "int")):
                self.bad(where, f"attribute {aid} {a.name!r} must be "
                         + ("a display string" if want == "str" else "an integer"))
        # The matchers read a row from attribute 7 on: the switch of action
        # code c must stand at position c - 7.
        after6 = [i for i in g.attr_ids() if i > 6]
        for c in ACTION_IDS:
            if c not in after6 or after6.index(c) != c - 7:
                self.bad(where, f"action {c} is not at position {c - 7} of a row read from attribute 7")
        if gid != 3 and 30 not in after6:
            self.bad(where, "no enable flag (attribute 30)")
        if not g.rows:
            self.bad(where, "table has no rows")
            return g
        for n, r in enumerate(g.rows):
            for aid, v in r.items():
                if aid == 17:
                    if not isinstance(v, str):
                        self.bad(where, f"row {n + 1}: attribute 17 has no text")
                elif not isinstance(v, int):
                    self.bad(where, f"row {n + 1}: attribute {aid} has no integer value")
        first = g.explicit[0]
        if not set(keys) <= first:
            self.bad(where, "first row does not give every key a value")
        return g

    def row_target(self, comps, mif_id, where):
        comp = comps.get(mif_id)
        if comp is None:
            self.bad(where, f"MIF id {mif_id} is not a supported component with a MIF here")
        return comp

    def instance_ok(self, group, inst):
        if inst == 0:
            return True
        if not group.keys or not group.rows:
            return False
        return any(r[group.keys[0]] == inst for r in group.rows)

    def standard_rows(self, g, comps):
        covered = set()
        for n, r in enumerate(g.rows):
            where = f"{g.fname}: group 10 row {n + 1}"
            mif, grp, etype, inst, zero, sev, esys, esub = (r[k] for k in G10_KEYS)
            if zero != 0:
                self.bad(where, "key 5 must be 0")
            comp = self.row_target(comps, mif, where)
            if comp is None:
                continue
            if mif == 1 and sev != 0:
                self.bad(where, "a baseboard row must have severity key 0")
            if mif != 1 and sev not in SEVERITIES:
                self.bad(where, f"severity {sev} is not an event severity")
            eg = comp.groups.get(grp)
            if eg is None or not eg.cls.lower().startswith("eventgeneration|"):
                self.bad(where, f"group {grp} of {comp.name!r} is no event generation group")
                continue
            if eg.attrs[1].type[0] == "enum" and eg.attrs[1].type[1].texts() and \
                    etype not in dict(eg.attrs[1].type[1].entries):
                self.bad(where, f"event type {etype} is not an event type of group {grp}")
            for aid, v in ((6, esys), (7, esub)):
                if v not in dict(eg.attrs[aid].type[1].entries):
                    self.bad(where, f"value {v} is not in the enumeration of attribute {aid}")
            inst_group = comp.group_by_class(eg.attrs[5].value)
            if inst_group is None:
                self.bad(where, f"group {grp} names no instance group")
            elif not self.instance_ok(inst_group, inst):
                self.bad(where, f"instance {inst} does not exist")
            if inst == 0 and (esys, esub) == (eg.attrs[6].value, eg.attrs[7].value):
                covered.add((mif, grp, etype))
        # Every event type of every event generation group of a supported
        # component reaches a row when reported with the group's own system
        # and subsystem.
        for mif, comp in comps.items():
            for eg in comp.groups_with_class_prefix("EventGeneration|"):
                a1 = eg.attrs.get(1)
                if a1 is None or a1.type[0] != "enum":
                    continue
                for etype, text in a1.type[1].entries:
                    if (mif, eg.id, etype) not in covered:
                        self.bad(f"{g.fname}: group 10",
                                 f"no row for {comp.name!r} group {eg.id} event type {etype} ({text})")

    def vendor_rows(self, g, comps):
        for n, r in enumerate(g.rows):
            where = f"{g.fname}: group 4 row {n + 1}"
            mif, grp, inst, attr, value, state = (r[k] for k in G4_KEYS)
            comp = self.row_target(comps, mif, where)
            if comp is None:
                continue
            if mif == 1 and (value not in (0, WILDCARD) or state != 0):
                self.bad(where, "a baseboard row must have value 0 or the wildcard and error state 0")
            if grp == 0:
                if (inst, attr) != (0, 0):
                    self.bad(where, "a row without a group must have instance and attribute 0")
            else:
                ig = comp.groups.get(grp)
                if ig is None:
                    self.bad(where, f"group {grp} does not exist in {comp.name!r}")
                    continue
                if attr not in ig.attrs:
                    self.bad(where, f"attribute {attr} does not exist in group {grp}")
                if not self.instance_ok(ig, inst):
                    self.bad(where, f"instance {inst} does not exist in group {grp}")
            if mif != 1:
                errs = comp.groups_with_class_prefix("Zorek|Error")
                states = dict(errs[0].attrs[min(errs[0].attrs)].type[1].entries) \
                    if errs and errs[0].attrs[min(errs[0].attrs)].type[0] == "enum" else {}
                if state not in states:
                    self.bad(where, f"error state {state} is not an error state of {comp.name!r}")

    def component(self, comp, mif_id):
        where = comp.fname
        self.version(comp)
        gen = comp.groups_with_class_prefix("EventGeneration|")
        if not gen:
            self.bad(where, "no event generation group")
        for eg in gen:
            w = f"{where}: group {eg.id}"
            if len(eg.attrs) <= 6:
                self.bad(w, "an event generation group needs more than 6 attributes")
            for aid in (1, 2, 5, 6, 7, 8, 9):
                if aid not in eg.attrs:
                    self.bad(w, f"no attribute {aid}")
            if any(aid not in eg.attrs for aid in (1, 2, 5, 6, 7, 8, 9)):
                continue
            for aid in (1, 2, 6, 7, 8):
                a = eg.attrs[aid]
                if a.type[0] != "enum" or not a.type[1].entries:
                    self.bad(w, f"attribute {aid} needs enumeration texts")
            if eg.attrs[2].type[0] == "enum" and \
                    not {v for v, _ in eg.attrs[2].type[1].entries} <= SEVERITIES:
                self.bad(w, "attribute 2 holds values that are no event severities")
            if eg.attrs[9].type[0] not in ("int", "enum"):
                self.bad(w, "attribute 9 must be an integer")
            a5 = eg.attrs[5]
            ig = comp.group_by_class(a5.value) if isinstance(a5.value, str) else None
            if ig is None:
                self.bad(w, f"attribute 5 {a5.value!r} is not the class of a group of the component")
                continue
            if not ig.keys or not ig.rows:
                self.bad(w, f"instance group {ig.id} is not a table with rows")
            if ig.attr_named("Short Name") is None and ig.attr_named("Description") is None:
                self.bad(w, f"instance group {ig.id} has neither \"Short Name\" nor \"Description\"")
            for word in ("Voltage", "Power"):
                if word.lower() in eg.cls.lower() and word.lower() not in ig.name.lower():
                    self.bad(w, f"instance group name {ig.name!r} should contain {word!r}")
        errs = comp.groups_with_class_prefix("Zorek|Error")
        if not errs:
            self.bad(where, "no vendor error group (class \"Zorek|Error...\")")
        for eg in errs:
            first = eg.attrs[min(eg.attrs)] if eg.attrs else None
            if first is None or first.type[0] != "enum" or not first.type[1].entries:
                self.bad(f"{where}: group {eg.id}", "first attribute must be an enumerated error state")
        if mif_id == 1:
            self.baseboard(comp)

    def baseboard(self, comp):
        where = comp.fname
        mail = comp.groups.get(1012)
        if mail is None or mail.keys:
            self.bad(where, "no e-mail settings group 1012 without keys")
        else:
            for aid in (1, 2, 3):
                a = mail.attrs.get(aid)
                if a is None or a.type[0] != "str" or a.type[2] not in ("displaystring", "string"):
                    self.bad(where, f"group 1012 attribute {aid} must be a display string")
                elif a.value != "":
                    self.bad(where, f"group 1012 attribute {aid} must be empty by default")
        lcd = comp.group_by_class("Zorek|Status Display|002")
        a = lcd.attrs.get(8) if lcd else None
        if a is None or a.type[0] != "str" or a.type[1] != 32:
            self.bad(where, "no status display group with a 32-character attribute 8")
        sc = comp.group_by_class("Zorek|System Control|001")
        if sc is None:
            self.bad(where, "no system control group")
        else:
            for aid, texts in SYSTEM_CONTROL.items():
                texts = texts if isinstance(texts, tuple) else (texts,)
                a = sc.attrs.get(aid)
                if a is None or a.type[0] != "enum":
                    self.bad(where, f"system control attribute {aid} must be an enumeration")
                    continue
                self.request_enum(where, f"system control attribute {aid}", a, texts)
        pg = comp.group_by_class("Zorek|Paging Config|001")
        a = pg.attrs.get(6) if pg else None
        if a is None or a.type[0] != "enum":
            self.bad(where, "no paging group with an enumerated attribute 6")
        else:
            self.request_enum(where, "paging attribute 6", a, ("Page",))

    def request_enum(self, where, what, a, texts):
        e = a.type[1]
        for t in texts:
            if e.value_of(t) is None:
                self.bad(where, f"{what} lacks the text {t!r}")
        neutral = [v for v, t in e.entries if t not in texts]
        if not neutral:
            self.bad(where, f"{what} has no neutral value")
        elif a.value not in neutral:
            self.bad(where, f"{what} must rest at a neutral value, not a request")

    def old_version(self, path, comp, new4, new10):
        where = comp.fname
        m = re.search(r"mox-(\d+\.\d+)\.mif$", path)
        if comp.name != OWN_NAME:
            self.bad(where, f"component name {comp.name!r}")
        text = self.version(comp)
        if text is None:
            return
        if m and text != m.group(1):
            self.bad(where, f"version {text!r} does not match the file name")
        band = version_band(text)
        if band is None:
            self.bad(where, f"version {text} would not be carried over")
            return
        keys = {3: G3_KEYS, 4: G4_KEYS, 10: G10_KEYS}[band]
        g = self.actions_group(comp, band, keys)
        if g is None or not g.rows:
            return
        target = new10 if band == 10 else new4
        if target is None or not target.rows:
            return
        index = {tuple(r[k] for k in target.keys): r for r in target.rows}
        for n, r in enumerate(g.rows):
            kv = tuple(r[k] for k in keys)
            if band == 3:
                kv = kv + (0,)                 # written with error state 0
            new = index.get(kv)
            if new is None:
                self.bad(where, f"group {band} row {n + 1}: keys {kv} have no row in group "
                         f"{target.id} of mox.mif")
                continue
            carried = {(30 if (band == 3 and aid == 6) else aid): v for aid, v in r.items()
                       if isinstance(v, int) and (aid > 6 or (band == 3 and aid == 6))}
            if all(new.get(aid) == v for aid, v in carried.items()):
                self.bad(where, f"group {band} row {n + 1}: values equal the defaults of mox.mif, "
                         "a carry-over could not be seen")


def check(directory):
    ck = Checker()
    comps = {}
    try:
        own = load(os.path.join(directory, "mox.mif"))
    except (MifError, OSError) as e:
        return [str(e)], 0
    nfiles = 1
    own.fname = "mox.mif"
    if own.name != OWN_NAME:
        ck.bad("mox.mif", f"component name {own.name!r}, expected {OWN_NAME!r}")
    text = ck.version(own)
    if text is not None and version_band(text) is not None:
        ck.bad("mox.mif", f"version {text} would be carried over again at every start")

    # Component MIFs in the directory, by component name.
    by_name = {}
    for fn in sorted(os.listdir(directory)):
        if fn.endswith(".mif") and fn != "mox.mif":
            try:
                c = load(os.path.join(directory, fn))
            except MifError as e:
                ck.problems.append(str(e))
                continue
            c.fname = fn
            nfiles += 1
            by_name[c.name] = c

    sup = own.groups.get(2)
    if sup is None or not sup.keys or not sup.rows:
        ck.bad("mox.mif", "group 2 must be a table of supported components")
    else:
        ids = sup.attr_ids()
        if len(ids) < 2 or sup.attrs[ids[0]].type[0] != "int" or sup.attrs[ids[1]].type[0] != "str":
            ck.bad("mox.mif", "group 2 must hold the MIF id at position 0 and the name at position 1")
        else:
            for r in sup.rows:
                mif, name = r[ids[0]], r[ids[1]]
                if mif in comps or mif == 0:
                    ck.bad("mox.mif", f"group 2: MIF id {mif} used twice or reserved")
                if name not in by_name:
                    ck.bad("mox.mif", f"group 2: no MIF here for component {name!r}")
                    continue
                comps[mif] = by_name[name]
            if 1 not in comps:
                ck.bad("mox.mif", "group 2 has no baseboard (MIF id 1) with a MIF here")
            if len(sup.rows) < 2:
                ck.bad("mox.mif", "group 2 needs at least one kind besides the baseboard")
    for mif, c in sorted(comps.items()):
        ck.component(c, mif)

    g10 = ck.actions_group(own, 10, G10_KEYS)
    g4 = ck.actions_group(own, 4, G4_KEYS)
    for g in (g10, g4):
        if g is not None:
            g.fname = "mox.mif"
    if g10 is not None and g10.rows:
        ck.standard_rows(g10, comps)
    if g4 is not None and g4.rows:
        ck.vendor_rows(g4, comps)

    olddir = os.path.join(directory, "old")
    bands = set()
    for fn in sorted(os.listdir(olddir)) if os.path.isdir(olddir) else []:
        if not fn.endswith(".mif"):
            continue
        path = os.path.join(olddir, fn)
        try:
            c = load(path)
        except MifError as e:
            ck.problems.append(str(e))
            continue
        c.fname = "old/" + fn
        nfiles += 1
        v = ck.version(c)
        if v is not None:
            bands.add(version_band(v))
        ck.old_version(path, c, g4, g10)
    for band in (3, 4, 10):
        if band not in bands:
            ck.bad("old/", f"no older version whose actions table is group {band}")
    return ck.problems, nfiles


def main(argv):
    if len(argv) != 2:
        print(__doc__.strip().splitlines()[2], file=sys.stderr)
        return 2
    problems, nfiles = check(argv[1])
    for p in problems:
        print(p)
    if problems:
        print(f"{len(problems)} problem(s) in the MIF files")
        return 1
    print(f"{nfiles} MIF files consistent")
    return 0


if __name__ == "__main__":
    sys.exit(main(sys.argv))
