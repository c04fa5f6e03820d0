#!/usr/bin/env python3
"""Writes the named seed inputs of fuzz/corpus/<target>/ (run from anywhere;
the files are committed, so this only needs running when a seed changes). The
hash-named files beside them are inputs merged in from longer fuzzing runs."""
import json
import os
import struct

HERE = os.path.dirname(os.path.abspath(__file__))
CHUNKS_WHOLE = bytes(8)                         # hand the stream over in one piece
CHUNKS_SMALL = bytes([1, 3, 0x85, 7, 2, 0x90, 1, 5])  # small pieces, some through the zero-copy path


def write(target, name, data):
    folder = os.path.join(HERE, "corpus", target)
    os.makedirs(folder, exist_ok=True)
    with open(os.path.join(folder, name), "wb") as f:
        f.write(data if isinstance(data, bytes) else data.encode())


def frame(text):
    body = text.encode() if isinstance(text, str) else text
    return struct.pack("<I", len(body)) + body


# --- frame_dispatch_fuzzer: chunk table + frames ---------------------------
req = lambda uid, cmd, **kw: json.dumps({"pm::unique_id": uid, "pm::command": cmd, "pm::request": True, **kw})
write("frame_dispatch_fuzzer", "echo", CHUNKS_WHOLE + frame(req(7, "echo", value=[1, "two", None])))
write("frame_dispatch_fuzzer", "throw_split", CHUNKS_SMALL + frame(req(8, "throw")) + frame(req(9, "scalar")))
write("frame_dispatch_fuzzer", "unknown", CHUNKS_WHOLE + frame(req("id", "nope")) + frame("[1,2]") + frame("not json"))
write("frame_dispatch_fuzzer", "replies", CHUNKS_SMALL +
      frame(json.dumps({"pm::unique_id": 1, "pm::command": "ping", "pm::response": True, "pm::error": "x"})) +
      frame(json.dumps({"pm::unique_id": 2, "pm::command": "ping", "pm::response": True})) +
      frame(json.dumps({"pm::unique_id": 99, "pm::response": True})))
# Nesting at the limit (handled) and one level over it (skipped unparsed).
nested = lambda depth: "[" * depth + "1" + "]" * depth
write("frame_dispatch_fuzzer", "deep_nesting", CHUNKS_SMALL +
      frame(req(10, "echo").rstrip("}") + ', "value": ' + nested(256) + "}") +
      frame(req(11, "echo").rstrip("}") + ', "value": ' + nested(257) + "}"))
write("frame_dispatch_fuzzer", "empty_and_oversize", CHUNKS_WHOLE + frame("") + frame("{}") +
      struct.pack("<I", 524289) + b"{}")

# --- json_cfg_fuzzer: JSON text --------------------------------------------
write("json_cfg_fuzzer", "config", json.dumps({"bandwidth": "ndi_bandwidth_lowest"}))
write("json_cfg_fuzzer", "config_lenient", json.dumps({"bandwidth": [1, True, "ndi_bandwidth_audio_only"]}))
write("json_cfg_fuzzer", "gui", json.dumps({
    "bandwidth": {"type": "popup", "value": "ndi_bandwidth_audio_only", "pm::order": 0,
                  "items": ["ndi_bandwidth_highest", "ndi_bandwidth_lowest", "ndi_bandwidth_audio_only"]},
    "reconnect": {"type": "button", "command": "taskndisource::reconnect", "pm::order": 1},
    "status": {"type": "static_text", "value": "ndi_state_receiving", "pm::order": 2}}))
write("json_cfg_fuzzer", "tree", json.dumps({
    "type": "tree", "name": 5, "count": "12", "tags": "one",
    "first": {"enabled": "true", "numbers": [1, "2", 3.5, None]}}))
write("json_cfg_fuzzer", "scalars", '[1e300, -0, 18446744073709551615, -9223372036854775808, "\\u00e9\\n", true, null, {"value": {}}]')
write("json_cfg_fuzzer", "bad", '{"bandwidth": ')
write("json_cfg_fuzzer", "deep_at_limit", '{"bandwidth": ' + nested(255) + "}")
write("json_cfg_fuzzer", "deep_over_limit", '{"bandwidth": ' + '{"value": ' * 256 + "1" + "}" * 257)
write("json_cfg_fuzzer", "deep_brackets_in_string", nested(200) .replace("1", '"[[[{{{\\"[[[["', 1))

# --- metadata_fuzzer: mode, length byte, text -------------------------------
def meta(mode, length_byte, text):
    return bytes([mode, length_byte]) + text.encode()

write("metadata_fuzzer", "product", meta(0, 0, '<ndi_product model_name="X"/>'))
write("metadata_fuzzer", "buildout", meta(0, 0, "<metadata><buildOutDuration>0.5</buildOutDuration></metadata>"))
write("metadata_fuzzer", "buildout_ext_twice", meta(8, 0, "<skyrelay_ext><buildOutDuration>1e300</buildOutDuration></skyrelay_ext>"))
write("metadata_fuzzer", "no_zero", meta(4, 0, '<ndi_product model_name="Model Y" serial="1"/>'))
write("metadata_fuzzer", "short_length", meta(2, 9, '<ndi_product model_name="Z"/>'))
write("metadata_fuzzer", "zero_inside", meta(0, 0, '<ndi_product model_name="A"/>\0garbage <a'))

# --- wire_fuzzer: chunk table (first byte's low bit: receiver end) + messages
def head(mtype, info_size, text_size, payload_size):
    return struct.pack("<IHHIIQ", 0x314C444E, mtype, info_size, text_size, 0, payload_size)

SENDER = CHUNKS_WHOLE
RECEIVER = bytes([1]) + bytes(7)
RECEIVER_SMALL = bytes([0x81, 3, 0x85, 7, 2, 0x90, 1, 5])
xml = b'<ndi_product model_name="X"/>'
write("wire_fuzzer", "hello_tally_metadata", SENDER +
      head(1, 8, 0, 0) + struct.pack("<iBBH", 100, 1, 0, 0) +
      head(2, 4, 0, 0) + struct.pack("<BBH", 0, 1, 0) +
      head(3, 8, len(xml), 0) + struct.pack("<q", -1) + xml)
video = struct.pack("<iiIiifiiqq", 4, 2, struct.unpack("<I", b"UYVY")[0], 30000, 1001, 16 / 9, 1, 8, 0, 123)
write("wire_fuzzer", "ready_video", RECEIVER +
      head(4, 8, len(xml), 0) + struct.pack("<q", 0) + xml +
      head(5, 4, 0, 0) + struct.pack("<BBH", 1, 0, 0) +
      head(6, 48, 0, 16) + video + bytes(range(16)))
audio = struct.pack("<iiiiqq", 48000, 2, 3, 0, 0, 7)
write("wire_fuzzer", "audio_split", RECEIVER_SMALL +
      head(7, 32, 2, 24) + audio + b"<a" + struct.pack("<6f", 0, 1, 2, 1000, 1001, 1002))
write("wire_fuzzer", "bad_magic", SENDER + b"XXXX" + head(1, 8, 0, 0)[4:] + bytes(8))

# --- record_fuzzer: mode (odd: the target writes the check bytes) + 64 bytes --
# Every whole record is left to the target to seal, so that the check-byte
# arithmetic lives in one place (pm/shm/queue_record.h).
def record(token, seg_size, stride, payload34):
    desc = struct.pack("<IQQI", 0x4350552E, 0, seg_size, stride)
    return struct.pack("<I", token) + desc + payload34 + bytes(2)

def vid(code, w, h):  # media time, then the packed VideoFormat (22 bytes), zero-padded to 34
    fmt = struct.pack("<IhhIBBHHhh", code, w, h, 0, 0, ord("P"), 0, 0, 0, 0)
    return (struct.pack("<q", 705600000) + fmt).ljust(34, b"\0")

def aud(code, samples, rate, channels):
    return (struct.pack("<qIiIB", 0, code, samples, rate, channels)).ljust(34, b"\0")

CODE_2VUY, CODE_NV12, CODE_FL32 = 0x32767579, 0x4E563132, 0x666C3332
write("record_fuzzer", "video_2vuy", b"\1" + record(5, 1920 * 2 * 1080, 3840, vid(CODE_2VUY, 1920, 1080)))
write("record_fuzzer", "video_nv12_sealed", b"\1" + record(6, 4096, 0, vid(CODE_NV12, 64, 32)))
write("record_fuzzer", "audio_fl32", b"\1" + record(7, 8192, 1, aud(CODE_FL32, 1024, 48000, 2)))
write("record_fuzzer", "audio_128ch", b"\1" + record(8, 1 << 20, 1, aud(CODE_FL32, 16, 48000, 128)))
write("record_fuzzer", "short", b"\0" + struct.pack("<I", 9) + bytes(10))
