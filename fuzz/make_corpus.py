#!/usr/bin/env python3
"""Writes the seed corpora of cbor_fuzz, json_fuzz, dispatch_fuzz, dmap_value_fuzz and
bundle_sources_fuzz (valid and invalid inputs)."""
import pathlib
import struct
import uuid

HERE = pathlib.Path(__file__).resolve().parent

CBOR = {
    "unsigned_max": "1bffffffffffffffff",
    "negative_min": "3b7fffffffffffffff",
    "half_float": "f93e00",
    "double": "fb3ff199999999999a",
    "text": "6449455446",
    "data": "4401020304",
    "uuid": "d82550e621e1f8c36c495a93fc0c247a3e6e5f",
    "date": "c1fb41d452d9ec200000",
    "message": "a364747970656b6170706c69636174696f6e657175657279a1616283f5f4a0"
               "65636f756e740a",
    "indefinite": "bf61610161629f0203ff637374727f657374726561646d696e67ffff",
    "bad_null": "f6",
    "bad_huge_map": "bab2d05e00" + "00" * 15,
    "bad_trailing": "0100",
    "bad_integer_key": "a10102",
    "bad_tag": "c24101",
    "bad_truncated": "82016261",
    "bad_duplicate_key": "a2616101616102",
}

JSON = {
    "unsigned": "18446744073709551615",
    "negative": "-42",
    "string": '"a\\"b\\\\c\\n\\u00e9\\ud83d\\ude00"',
    "array": '[1, "a", [true, false], {}]',
    "object": '{"b": 1, "a": {"c": []}}',
    "typed": '{"u": {"$uuid": "e621e1f8-c36c-495a-93fc-0c247a3e6e5f"}, "d": {"$data": "AP+A/w=="},'
             ' "t": {"$date": 1700000000.5}, "r": {"$real": 0.1}}',
    "specials": '[{"$real": "NaN"}, {"$real": "-Infinity"}, {"$date": "Infinity"}]',
    "plain_double": "[2.5, -0.0, 1e-310]",
    "pretty": '{\n  "a": [\n    1,\n    2\n  ]\n}',
    "bad_null": "null",
    "bad_duplicate": '{"a": 1, "a": 2}',
    "bad_base64": '{"$data": "Q==="}',
    "bad_uuid": '{"$uuid": "not-a-uuid"}',
    "bad_trailing": "1 2",
    "bad_big_integer": "18446744073709551616",
    "bad_truncated": '{"a": [1, 2',
}


# --- dispatch_fuzz: one CBOR request per file -----------------------------------------------

# The harness builds its bundles here (tmpfs), with these UUIDs; see dispatch_fuzz.cpp.
ROOT = "/dev/shm/ekora-dispatch-fuzz"
HOST = ROOT + "/Applications/Host.app"
OTHER = ROOT + "/Applications/Other.app"
SYSTEM = ROOT + "/System/Library/PlugIns"
SHARE, KEYBOARD, OTHER_SHARE, DEDICATED, VIEWER, DATA, EXCLUDED, BROKEN, MISSING, NOEXEC = (
    uuid.UUID("d15a7c4e-0000-4000-8000-0000000000%02x" % n) for n in range(1, 11))
UNKNOWN = uuid.UUID("0badc0de-0000-4000-8000-000000000000")


def cbor_head(major, value):
    if value < 24:
        return bytes([major << 5 | value])
    for extra, size in ((24, "B"), (25, ">H"), (26, ">I"), (27, ">Q")):
        if value < 1 << (8 * struct.calcsize(size)):
            return bytes([major << 5 | extra]) + struct.pack(size, value)
    raise ValueError(value)


def cbor(value):
    """The CBOR the daemon reads: maps with text keys, UUIDs under tag 37."""
    if isinstance(value, bool):
        return b"\xf5" if value else b"\xf4"
    if isinstance(value, int):
        return cbor_head(0, value) if value >= 0 else cbor_head(1, -1 - value)
    if isinstance(value, float):
        return b"\xfb" + struct.pack(">d", value)
    if isinstance(value, str):
        data = value.encode()
        return cbor_head(3, len(data)) + data
    if isinstance(value, bytes):
        return cbor_head(2, len(value)) + value
    if isinstance(value, uuid.UUID):
        return b"\xd8\x25" + cbor_head(2, 16) + value.bytes
    if isinstance(value, list):
        return cbor_head(4, len(value)) + b"".join(cbor(v) for v in value)
    if isinstance(value, dict):
        return cbor_head(5, len(value)) + b"".join(cbor(k) + cbor(v) for k, v in value.items())
    raise TypeError(value)


def req(kind, version=3, **members):
    """A request; "fuzz_client" becomes the harness's "fuzz-client" member."""
    message = {"request": kind, "version": version}
    for key, value in members.items():
        message[key.replace("_", "-")] = value
    return message


MANAGER = 1     # manager, provide-environment and the host entitlement
RESTRICTED = 2  # manager, sandboxed, allowed plug-ins restricted to com.corvane.share
INVALID = 3     # sandboxed, allowed-plug-ins entitlement that is no dictionary

DISPATCH = {
    "find_uuid": req("find", uuids=SHARE),
    "find_path_url": req("find", paths="file://" + SYSTEM + "/Viewer.bundle"),
    "find_v2": req("find", version=2, uuids=VIEWER),
    "find_unknown": req("find", uuids=UNKNOWN),
    "find_bad_url": req("find", uuids=DATA, paths="not a url"),
    "annotate_election": req("annotate", uuids=[SHARE, OTHER_SHARE], annotations={"election": 1}),
    "annotate_extension": req("annotate", uuids=[VIEWER],
                              annotations={"extension": {"note": "x"}, "election": -2}),
    "annotate_empty": req("annotate", uuids=[SHARE], annotations={}),
    "annotate_bad_election": req("annotate", uuids=[SHARE], annotations={"election": "yes"}),
    "annotate_path_fallback": req("annotate", uuids=[UNKNOWN],
                                  paths=[OTHER + "/PlugIns/Dedicated.appex"],
                                  annotations={"election": 0.5}),
    "bulk_annotate": req("bulk-annotate", annotations={str(KEYBOARD): {"enabled": True},
                                                       str(DATA): {"order": [1, 2]}}),
    "bulk_annotate_bad_uuid": req("bulk-annotate", annotations={"nope": {}}),
    "annotate_nan_election": req("annotate", uuids=[SHARE], annotations={"election": float("nan")}),
    "annotate_unstorable_extension": req("annotate", uuids=[SHARE],
                                         annotations={"extension": {"s": "bell\x07\ufffe"}}),
    "bulk_annotate_infinite": req("bulk-annotate",
                                  annotations={str(SHARE): {"r": float("-inf")}}),
    "bulk_annotate_not_dictionary": req("bulk-annotate", annotations={str(SHARE): 5}),
    "bulk_annotate_unknown": req("bulk-annotate", annotations={str(UNKNOWN): {}}),
    "add_app": req("add", paths=[HOST, SYSTEM + "/Viewer.bundle"]),
    "add_relative": req("add", paths=["relative/Plug.appex"]),
    "add_missing": req("add", paths=[ROOT + "/Applications/Nowhere.app"]),
    "add_not_bundle": req("add", paths=[ROOT]),
    "remove_manager": req("remove", paths=[HOST + "/PlugIns/Share.appex", ROOT + "/gone.appex"],
                          fuzz_client=MANAGER),
    "remove_not_entitled": req("remove", paths=[HOST]),
    "remove_bad_paths": req("remove", paths="x", fuzz_client=MANAGER),
    "bulk_flags": req("bulk", flags=5),
    "match_point": req("match", rules={"ZuExtensionPointIdentifier": "com.corvane.share"}, flags=0),
    "match_all": req("match", flags=0x200, fuzz_client=MANAGER),
    "match_all_sandboxed": req("match", flags=0x200, fuzz_client=RESTRICTED),
    "match_keep_versions": req("match", rules={}, flags=1),
    "match_keep_duplicates": req("match", rules={"Kind": "viewer"}, flags=5),
    "match_system_only": req("match", flags=8),
    "match_operators": req("match", rules={"Kind": "<>editor", "Level": ">=3", "Release": "<2.5",
                                           "Types": "?TY-CONFORMS:public.data"}),
    "match_type_is": req("match", rules={"Types": ["?TY-IS:public.movie", "=public.audio"],
                                         "Flag": False, "ZuExtensionPointIdentifier":
                                             ["com.corvane.share", "com.corvane.keyboard-service"]}),
    "match_activation": req("match", rules={"ZuExtensionActivationRule":
                                            {"public.jpeg": 1, "public.mpeg-4": 1}}),
    "match_special_keys": req("match", rules={"ZuExtensionIdentifier": "com.example.host.share",
                                              "ZuExtensionContainingApp": True,
                                              "ENTITLEMENT:com.corvane.developer.auto-elect-plugin":
                                                  True}),
    "match_election": req("match", rules={"ZuUserElection": "=1",
                                          "com.corvane.uuid": str(SHARE).upper()}),
    "match_host_entitlement": req("match", rules={"ZuExtensionPointIdentifier":
                                                  "com.corvane.keyboard-service"},
                                  fuzz_client=MANAGER),
    "match_restricted": req("match", fuzz_client=RESTRICTED),
    "match_invalid_restriction": req("match", fuzz_client=INVALID),
    "match_v2": req("match", version=2, rules={"Kind": "viewer"}),
    "match_bad_rules": req("match", rules="com.corvane.share"),
    "ready_one": req("ready", uuids=[SHARE], flags=0),
    "ready_environment": req("ready", uuids=[KEYBOARD],
                             environment={"LANG": "fr", "BAD=": "y", "NUM": 5},
                             fuzz_client=MANAGER),
    "ready_environment_refused": req("ready", uuids=[SHARE], environment={}),
    "ready_every_plugin": req("ready", uuids=[SHARE, KEYBOARD, OTHER_SHARE, DEDICATED, VIEWER,
                                              DATA, EXCLUDED, SHARE], fuzz_client=MANAGER),
    "ready_cannot_enable": req("ready", uuids=[BROKEN, NOEXEC, MISSING]),
    "ready_path_fallback": req("ready", uuids=[UNKNOWN, SHARE],
                               paths=[OTHER + "/PlugIns/Broken.appex", False]),
    "ready_bad_uuids": req("ready", uuids=["d15a7c4e-0000-4000-8000-000000000001"]),
    "access_two": req("access", uuids=[SHARE, VIEWER], flags=0),
    "access_missing_bundle": req("access", uuids=[MISSING]),
    "access_paths_mismatch": req("access", uuids=[DATA], paths=[HOST, OTHER]),
    "lock_application": req("lock", paths=[HOST], flags=0),
    "lock_plugin_paths": req("lock", paths=[HOST + "/PlugIns/Share.appex", SYSTEM + "/Data.bundle"],
                             flags=1),
    "lock_refuse_busy": req("lock", paths=[OTHER], flags=2),
    "lock_terminate": req("lock", paths=[HOST], flags=6),
    "lock_terminate_busy": req("lock", paths=[OTHER, HOST + "/PlugIns/Share.appex"], flags=4),
    "lock_release": req("lock", uuids=[UNKNOWN, "x"]),
    "lock_empty_application": req("lock", paths=[ROOT + "/Applications/Empty.app"], flags=1),
    "lock_unresolved": req("lock", paths=[ROOT + "/Applications/Nowhere.app"]),
    "bad_version": req("find", version=9, uuids=SHARE),
    "bad_missing_type": {"version": 3, "uuids": [SHARE]},
    "bad_unknown_type": req("launch"),
    "bad_not_dictionary": ["match", 3],
}

# Records of a bundle's sources: [context, [[path, shared] or [path, shared, device, inode,
# size, mtime s, mtime ns, ctime s, ctime ns], ...]].
_ABSENT = ["/nonexistent/Info.dmap", False]
_PRESENT = ["/", False, 2049, 2, 4096, 1700000000, 5, 1700000000, 6]
_SHARED = ["/etc/hostname", True, 2049, 1234, 10, 1700000000, 0, 1700000000, 0]
# dmap_value_fuzz: one CBOR value per file, what a client may send inside an annotation.
DMAP_VALUE = {
    "nan": cbor(float("nan")),
    "infinity": cbor(float("inf")),
    "control": cbor({"s": "tab\tok, bell\x07 not"}),
    "noncharacter": cbor(["\ufffe", "\uffff", "\ufffd"]),
    "date_nan": bytes.fromhex("c1fb7ff8000000000000"),
    "date_year_0000": bytes.fromhex("c1fbc22cf2e8f8000000"),
    "date_year_9999": bytes.fromhex("c1fb424d7ffa20bf8000"),
    "nested": bytes.fromhex("81" * 600),
    "entry": cbor({"election": 1, "extension": {"k": [1.5, True, b"\x00\xff"]}}),
}

BUNDLE_SOURCES = {
    "absent": ["ctx", [_ABSENT]],
    "present": ["ctx", [_PRESENT, _ABSENT]],
    "shared": ["ctx", [_SHARED, _SHARED]],
    "other_context": ["another context", [_ABSENT]],
    "empty_list": ["ctx", []],
}


def main():
    cbor_dir = HERE / "corpus" / "cbor"
    json_dir = HERE / "corpus" / "json"
    cbor_dir.mkdir(parents=True, exist_ok=True)
    json_dir.mkdir(parents=True, exist_ok=True)
    for name, hex_text in CBOR.items():
        (cbor_dir / name).write_bytes(bytes.fromhex(hex_text))
    for name, text in JSON.items():
        (json_dir / name).write_bytes(text.encode())
    dispatch_dir = HERE / "corpus" / "dispatch"
    dispatch_dir.mkdir(parents=True, exist_ok=True)
    for name, message in DISPATCH.items():
        (dispatch_dir / name).write_bytes(cbor(message))
    value_dir = HERE / "corpus" / "dmap_value"
    value_dir.mkdir(parents=True, exist_ok=True)
    for name, data in DMAP_VALUE.items():
        (value_dir / name).write_bytes(data)
    sources_dir = HERE / "corpus" / "bundle_sources"
    sources_dir.mkdir(parents=True, exist_ok=True)
    for name, record in BUNDLE_SOURCES.items():
        (sources_dir / name).write_bytes(cbor(record))


if __name__ == "__main__":
    main()
