#!/usr/bin/env python3
"""Writes the seed corpora of the command channel's fuzz targets: one
selector byte (see fuzz_support.h), then the input."""
import os
import struct

HKCU = 0xFFFFFFFF80000001
HKLM = 0xFFFFFFFF80000002
MAX = 10920
MIN = 9896
REG_AT = 9836


def text(s):
    return (s + "\0").encode("utf-16-le")


def registry(root, path, name, operation, value_type, data, data_length=None):
    p, n = text(path), text(name)
    length = len(data) if data_length is None else data_length
    fixed = bytes(12) + struct.pack("<QQQIIII", root, len(p), len(n), length, 0, value_type,
                                    operation)
    return fixed + p + n + data


IMAGE_AT = 2180
# Paths in a drive image: disk, channel, control, HID.
IMAGE_PATHS = (3452, 3964, 4512, 5024)


def message(command, arg1=0, arg2=0, arg3=0, length=MAX, registry_request=b"", size=None,
            key=None, paths=None, control=b""):
    body = bytearray(MAX)
    struct.pack_into("<QIIII", body, 0, length, command, arg1, arg2, arg3)
    if key is not None:
        k = text(key)
        body[2764:2764 + len(k)] = k
    for at, path in zip(IMAGE_PATHS, paths or ()):
        p = text(path)
        body[IMAGE_AT + at:IMAGE_AT + at + len(p)] = p
    body[9828:9828 + len(control)] = control
    body[REG_AT:REG_AT + len(registry_request)] = registry_request
    return bytes(body[: MAX if size is None else size])


SEEDS = {
    "d_set_status": message(10, 500),
    "d_pause_min_length": message(7, length=MIN, size=MIN),
    "d_resume": message(8),
    "d_too_short": message(8, length=MIN - 1, size=MIN - 1),
    "d_too_long": message(8, length=MAX + 1),
    "d_unknown": message(4, 1, 2, 3),
    "d_safe_remove": message(1, 2),
    "d_release": message(2, 0),
    "d_forward_power": message(6, 0x218, 4, 0),
    "d_forward_devchange": message(6, 0x219, 0x8000, 0x1234),
    "d_gauges": message(9, ord("E"), 1),
    "d_read_status": message(11, key="SERIAL-1"),
    "d_write_control": message(12, key="SERIAL-1"),
    "d_reg_set": message(13, registry_request=registry(HKCU, "", "FuzzValue", 1, 4,
                                                        b"\x01\x02\x03\x04")),
    "d_reg_query": message(13, registry_request=registry(HKCU, "", "FuzzValue", 0, 0, b"",
                                                          64)),
    "d_reg_partial": message(13, registry_request=registry(HKLM, "Software", "Name", 1, 1,
                                                            text("v")), size=REG_AT + 60),
    "d_head_only": message(10, 7, size=64),
    "d_reg_root32": message(13, registry_request=registry(HKLM & 0xFFFFFFFF, "Software", "", 2,
                                                           0, b"")),
    "r_query": registry(HKCU, "", "FuzzValue", 0, 0, bytes(16)),
    "r_set_sz": registry(HKCU, "", "FuzzText", 1, 1, text("hello")),
    "r_other_operation": registry(HKLM, "", "", 2, 0, b""),
    "r_bad_root": registry(0x1234, "", "X", 1, 4, bytes(4)),
    "r_unterminated_path": registry(HKCU, "", "X", 0, 0, b"")[:52] + "Soft".encode("utf-16-le"),
    "r_name_past_end": registry(HKCU, "", "X", 0, 0, bytes(4))[:20] + struct.pack("<Q", 1 << 40)
    + registry(HKCU, "", "X", 0, 0, bytes(4))[28:],
}


# Disk, channel, control and HID paths of a client's own: a share and pipes.
FOREIGN = ("\\\\.\\pipe\\x", "\\\\.\\pipe\\x", "\\\\attacker\\share\\x",
           "\\\\?\\UNC\\attacker\\share")

# selector, message
DRIVE_SEEDS = {
    "remove_first": (0x00, message(1, 0)),
    "remove_paused": (0x08, message(1, 0)),
    "remove_beyond": (0xF0, message(1, 9)),
    "release_second": (0x11, message(2, 1)),
    "release_also_third": (0x22, message(3, 2)),
    "gauges_all_forced": (0x03, message(9, 0, 1)),
    "gauges_letter": (0x03, message(9, ord("F"), 0)),
    "status_first": (0x04, message(11, paths=FOREIGN)),
    "status_second": (0x14, message(11, paths=FOREIGN)),
    "status_third": (0x24, message(11, paths=FOREIGN)),
    "status_fourth": (0x34, message(11, paths=FOREIGN)),
    "status_unknown_key": (0xF4, message(11, key="NO-SUCH-DRIVE", paths=FOREIGN)),
    "control_first": (0x05, message(12, paths=FOREIGN, control=bytes([1, 0, 0, 0, 0, 0, 0, 0]))),
    "control_third": (0x25, message(12, paths=FOREIGN, control=bytes(range(8)))),
}


def write(folder, seeds):
    os.makedirs(folder, exist_ok=True)
    for name, data in seeds.items():
        with open(os.path.join(folder, name), "wb") as f:
            f.write(data)


def main():
    here = os.path.dirname(os.path.abspath(__file__))
    write(os.path.join(here, "corpus"),
          {name: (b"\x00" if name.startswith("d_") else b"\x01") + data
           for name, data in SEEDS.items()})
    write(os.path.join(here, "corpus_drives"),
          {name: bytes([selector]) + data for name, (selector, data) in DRIVE_SEEDS.items()})


if __name__ == "__main__":
    main()
