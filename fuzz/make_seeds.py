#!/usr/bin/env python3
"""Writes the binary seeds of the indication and confirm fuzz targets.

Indications follow the provider's layout: 13 header words, then at word 12's
offset the event data (class count, four words per class), class strings and
rows (DMI 1.x level check: rows back to back; otherwise an array of row
offsets). Confirm seeds are 17 header words followed by the confirm buffer.
Run from fuzz/: python3 make_seeds.py
"""
import os
import struct

LEVEL = 0x444D4931


def words(*ws):
    return b"".join(struct.pack("<I", w & 0xFFFFFFFF) for w in ws)


def dmi(text):
    data = text.encode()
    return struct.pack("<I", len(data)) + data


class Blob:
    def __init__(self, start):
        self.data = bytearray()
        self.start = start

    def add(self, raw):
        offset = self.start + len(self.data)
        self.data += raw
        while len(self.data) % 4:
            self.data += b"\0"
        return offset


def row(blob, group, keys, attributes):
    """attributes: (id, type, value bytes); keys: (id, type, value bytes)."""
    values = [blob.add(v) for (_, _, v) in attributes]
    key_values = [blob.add(v) for (_, _, v) in keys]
    key_list = blob.add(b"".join(words(k[0], k[1], o) for k, o in zip(keys, key_values))) if keys else 0
    body = words(group, len(keys), key_list, len(attributes))
    for (aid, typ, _), off in zip(attributes, values):
        body += words(0, aid, typ, off)
    return body


def event(kind_class, component, rows_per_class, level=LEVEL, itype=1):
    head_len = 52
    data_start = head_len
    nclasses = len(rows_per_class)
    classes_len = 4 + 16 * nclasses
    blob = Blob(data_start + classes_len)
    entries = []
    for cls, rows in zip(kind_class, rows_per_class):
        cls_off = blob.add(dmi(cls))
        built = [r(blob) for r in rows]
        if level == LEVEL:
            rows_off = blob.add(b"".join(built)) if built else 0
        else:
            offs = [blob.add(b) for b in built]
            rows_off = blob.add(words(*offs)) if offs else 0
        entries.append(words(component, cls_off, len(rows), rows_off))
    data = words(nclasses) + b"".join(entries)
    total = head_len + len(data) + len(blob.data)
    header = words(level, itype, total, component, *([0x30303032] * 7), 0, data_start)
    return header + data + bytes(blob.data)


def u32(v):
    return struct.pack("<I", v)


def std_row(blob):
    return row(blob, 20, [(1, 5, u32(8))],
               [(1, 5, u32(4)), (2, 5, u32(8)), (3, 5, u32(1)), (4, 5, u32(0)),
                (5, 8, dmi("Voltage Probe|001")), (6, 5, u32(3)), (7, 5, u32(2)),
                (8, 5, u32(1)), (9, 5, u32(1))])


def instance_row(blob):
    return row(blob, 3, [(1, 5, u32(2))], [(1, 5, u32(2)), (2, 8, dmi("CPU 1"))])


def vendor_row(blob):
    return row(blob, 30, [], [(1, 5, u32(3)), (2, 5, u32(4)), (3, 5, u32(12)), (4, 5, u32(1))])


def install(component, name, itype):
    blob = Blob(52)
    name_off = blob.add(dmi(name))
    record = words(component, 0, name_off, 0, 0, 0, 0)
    data_start = 52 + len(blob.data)
    total = data_start + len(record)
    header = words(LEVEL, itype, total, component, *([0x30303032] * 7), 0, data_start)
    return header + bytes(blob.data) + record


def confirm(code, body):
    return words(LEVEL, code, 4096, 0, 0, 0, 0, 8192, 0, 1, 1, 0, 0, 0, 0, 0, 0) + body


def main():
    seeds = {
        "indication/std": event(["EventGeneration|Voltage Probe|001", "Voltage Probe|001"], 1,
                                [[std_row], [instance_row]]),
        "indication/std_offsets": event(["EVENTGENERATION|x", "y"], 2, [[std_row], [instance_row, instance_row]],
                                        level=0x11111111),
        "indication/vendor": event(["zorek|error|Voltage", "Voltage Probe|001"], 1, [[vendor_row], [instance_row]]),
        "indication/unknown": event(["Other|Class"], 3, [[]]),
        "indication/install": install(2, "Test Board", 2),
        "indication/uninstall": install(2, "Test Board", 3),
    }
    # Confirms: a component listing, group and attribute entries, a value, a row.
    b = Blob(0)
    name = b.add(dmi("Test Board"))
    gname = b.add(dmi("Voltage Probe"))
    groups = b.add(words(3, gname, 20, gname))
    comp = words(1, 0, name + 28, 2, groups + 28, 0, 0)
    seeds["confirm/component"] = confirm(512, comp + bytes(b.data))
    b = Blob(40)
    n1, c1 = b.add(dmi("Probe")), b.add(dmi("Voltage Probe|001"))
    seeds["confirm/groups"] = confirm(516, words(3, n1, c1, 1, 0, 20, n1, 0, 0, 0) + bytes(b.data))
    b = Blob(28)
    en = b.add(dmi("OK"))
    el = b.add(words(1, en, 2, en))
    an = b.add(dmi("Status"))
    seeds["confirm/attributes"] = confirm(520, words(1, an, 1, 5, 4, 2, el) + bytes(b.data))
    seeds["confirm/value"] = confirm(768, words(0, 0, 8, 16) + dmi("hello"))
    b = Blob(0)
    body = row(b, 10, [(1, 5, u32(1))], [(1, 5, u32(1)), (7, 5, u32(1)), (17, 8, dmi("alert"))])
    # Row at the start of the confirm: values follow it.
    b2 = Blob(len(body))
    body = row(b2, 10, [(1, 5, u32(1))], [(1, 5, u32(1)), (7, 5, u32(1)), (17, 8, dmi("alert"))])
    seeds["confirm/row"] = confirm(772, body + bytes(b2.data))
    seeds["confirm/description"] = confirm(515, dmi("A description"))
    # Indications read through the accessors too.
    seeds["confirm/indication"] = words(*struct.unpack("<13I", seeds["indication/std"][:52]), 0, 0, 0, 0) + \
        seeds["indication/std"]
    for path, data in seeds.items():
        os.makedirs(os.path.join("corpus", os.path.dirname(path)), exist_ok=True)
        with open(os.path.join("corpus", path), "wb") as f:
            f.write(data)


if __name__ == "__main__":
    main()
