#!/usr/bin/env python3
"""Writes the seed corpora of cbor_fuzz and json_fuzz (valid and invalid inputs)."""
import pathlib

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


def main():
    cbor_dir = HERE / "corpus" / "cbor"
    json_dir = HERE / "corpus" / "json"
    cbor_dir.mkdir(parents=True, exist_ok=True)
    json_dir.mkdir(parents=True, exist_ok=True)
    for name, hex_text in CBOR.items():
        (cbor_dir / name).write_bytes(bytes.fromhex(hex_text))
    for name, text in JSON.items():
        (json_dir / name).write_bytes(text.encode())


if __name__ == "__main__":
    main()
