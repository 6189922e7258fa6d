#!/usr/bin/env python3
"""Writes the seed corpora of the DER fuzz targets into fuzz/corpus/<target>/.

Each seed is a small hand-made case named after what it exercises. Run from anywhere; existing
seeds of the same name are overwritten, others are left alone.
"""
import os

CORPUS = os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "corpus")


def length(n):
    if n < 128:
        return bytes([n])
    octets = n.to_bytes((n.bit_length() + 7) // 8, "big")
    return bytes([0x80 | len(octets)]) + octets


def tlv(identifier, content=b""):
    return bytes([identifier]) + length(len(content)) + content


def seq(*items):
    return tlv(0x30, b"".join(items))


def integer(content):
    return tlv(0x02, content)


BOOLEAN, INTEGER, OCTETS = 0x01, 0x02, 0x04
OPTIONAL, SKIP_TAG_CHECK, SKIP_WRITE, KEEP_HEADER = 1, 2, 4, 8

hundred_integers = seq(*[integer(bytes([i & 0x7F])) for i in range(100)])

ITEM = {
    "empty_sequence": bytes.fromhex("3000"),
    "integer": bytes.fromhex("02012a"),
    "integer_nine_bytes": bytes.fromhex("020900") + b"\xff" * 8,
    "sequence_long_form_300": hundred_integers,
    "lenient_long_form_below_128": bytes.fromhex("048105") + b"\xab" * 5,
    "length_leading_zero": bytes.fromhex("048100"),
    "indefinite_length": bytes.fromhex("04800000"),
    "content_overruns_input": bytes.fromhex("04050102"),
    "high_tag_128": bytes.fromhex("9f810002aabb"),
    "high_tag_largest_number": bytes.fromhex("1f9fffffffffffffff7f00"),
    "high_tag_fits_short_form": bytes.fromhex("1f1e00"),
    "high_tag_leading_zero_group": bytes.fromhex("1f800100"),
    "high_tag_reaches_class_bits": bytes.fromhex("1fa0808080808080800000"),
    "eight_length_bytes_huge": bytes.fromhex("0488") + b"\xff" * 8,
    # Headers that end early: the replay hands each seed over in a buffer of its exact size, so
    # a read past the end shows under the sanitizers.
    "high_tag_no_length_octet": bytes.fromhex("1f8181"),
    "length_octets_cut_short": bytes.fromhex("048201"),
    "endless_tag_groups": b"\x1f" + b"\xff" * 64,
    "nine_length_bytes": bytes.fromhex("0489") + b"\x01" * 9,
    "private_constructed": bytes.fromhex("fe0405020102"),
    "nested_context_explicit": bytes.fromhex("a00530030201" "01"),
    "blob_three_items": hundred_integers + bytes.fromhex("020107") + bytes.fromhex("a081020500"),
    "blob_trailing_byte": bytes.fromhex("020107ff"),
    "blob_trailing_two_bytes": bytes.fromhex("020107ffff"),
    "record_and_signature": seq(tlv(0x0C, b"6F1C2A4E-0B7D-4C39-9E0F-2D5A8B3C1E77"),
                                tlv(0x0C, b"plan-basic"), tlv(0x18, b"20260101000000Z"))
    + tlv(OCTETS, bytes(range(32))),
    "name_like": seq(tlv(0x31, seq(tlv(0x06, bytes.fromhex("550403")), tlv(0x0C, b"zlka test")))),
    "bit_string": bytes.fromhex("030403aabbf0"),
}


def template(*rows):
    """The sequence target's prefix: a row count, then (options, identifier-like tag) per row."""
    return bytes([len(rows)]) + b"".join(bytes([options, tag]) for options, tag in rows)


int_then_optional_bool = template((0, INTEGER), (OPTIONAL, BOOLEAN))
SEQUENCE = {
    "int_optbool_both": int_then_optional_bool + seq(integer(b"\x2a"), tlv(BOOLEAN, b"\xff")),
    "int_optbool_int_only": int_then_optional_bool + seq(integer(b"\x2a")),
    "int_optbool_bool_only": int_then_optional_bool + seq(tlv(BOOLEAN, b"\xff")),
    "int_optbool_empty": int_then_optional_bool + seq(),
    "int_optbool_one_too_many": int_then_optional_bool
    + seq(integer(b"\x2a"), tlv(BOOLEAN, b"\xff"), integer(b"\x01")),
    "int_optbool_trailing_fragment": int_then_optional_bool + tlv(0x30, integer(b"\x2a") + b"\x05"),
    "keep_header_and_any": template((KEEP_HEADER, INTEGER), (SKIP_TAG_CHECK | SKIP_WRITE, 0))
    + seq(integer(b"\x01"), tlv(OCTETS, b"\xab" * 130)),
    "optional_chain": template((OPTIONAL, BOOLEAN), (OPTIONAL, OCTETS), (0, INTEGER))
    + seq(integer(b"\x05")),
    "optional_skipped_for_good": template((OPTIONAL, BOOLEAN), (0, INTEGER))
    + seq(integer(b"\x05"), tlv(BOOLEAN, b"\x00")),
    "context_tags": template((0, 0xA0), (OPTIONAL, 0x81))
    + seq(tlv(0xA0, integer(b"\x01")), tlv(0x81)),
    "set_is_not_a_sequence": template((SKIP_TAG_CHECK, 0)) + tlv(0x31, integer(b"\x01")),
    "item_runs_past_sequence": template((SKIP_TAG_CHECK, 0)) + bytes.fromhex("30020205") + bytes(5),
    "zero_fields_empty": template() + seq(),
    "zero_fields_nonempty": template() + seq(integer(b"\x01")),
    "nested_sequences": template((0, 0x30), (OPTIONAL | KEEP_HEADER, 0x30))
    + seq(seq(integer(b"\x01"), integer(b"\x02")), seq()),
    "seven_fields": template(*[(OPTIONAL, INTEGER)] * 6 + [(SKIP_TAG_CHECK, 0)])
    + seq(*[integer(bytes([i])) for i in range(7)]),
    # Fits the target's fixed template: [0], BOOLEAN, anything, INTEGER, OCTET STRING.
    "fixed_template_full": template()
    + seq(tlv(0xA0, integer(b"\x01")), tlv(BOOLEAN, b"\x00"), tlv(0x05), integer(b"\x07"),
          tlv(OCTETS, b"\x01\x02")),
    "fixed_template_minimal": template() + seq(tlv(0xA0), tlv(0x13, b"x")),
}

PRIMITIVES = {
    "empty": b"",
    "zero": b"\x00",
    "boolean_true": b"\xff",
    "boolean_invalid": b"\x01",
    "integer_128": b"\x00\x80",
    "integer_non_minimal": b"\x00\x7f",
    "integer_negative": b"\x80\x00",
    "integer_max_u32": b"\x00\xff\xff\xff\xff",
    "integer_above_u32": b"\x01\x00\x00\x00\x00",
    "integer_max_u64": b"\x00" + b"\xff" * 8,
    "integer_nine_bytes_overflow": b"\x01" + b"\x00" * 8,
    "integer_ten_bytes_overflow": b"\x00\x80" + b"\x00" * 8,
    "bit_string": b"\x03\xa8\xf0",
    "bit_string_count_over_seven": b"\x09\xff",
}


def write(target, seeds):
    directory = os.path.join(CORPUS, target)
    os.makedirs(directory, exist_ok=True)
    for name, data in seeds.items():
        with open(os.path.join(directory, name), "wb") as f:
            f.write(data)


write("fuzz_der_item", ITEM)
write("fuzz_der_sequence", SEQUENCE)
write("fuzz_der_primitives", PRIMITIVES)
