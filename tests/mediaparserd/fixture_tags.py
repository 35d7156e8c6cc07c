#!/usr/bin/env python3
"""Writes the raw bytes that ffmpeg cannot: legacy-encoded ID3 tags and
explicitly signalled HE-AAC.

  fixture_tags.py PLAIN.mp3 LC.m4a

PLAIN.mp3 is an MP3 without tags; in the working directory it writes
  song_id3v1_cp1251.mp3   PLAIN with an ID3v1 tag in windows-1251,
  song_id3v23_cp1251.mp3  PLAIN with an ID3v2.3 tag whose text frames are
                          declared Latin-1 but hold windows-1251,
  song_gbk.mp3            PLAIN with both kinds of tag in GBK.
LC.m4a is AAC LC in an MP4 file (moov after mdat); song_he.m4a is LC.m4a with
its AudioSpecificConfig rewritten to signal SBR explicitly (object type 5,
HE-AAC), as HE-AAC encoders write it.
"""
import struct
import sys

# The texts of the legacy tags, by codec: (title, artist, album, comment).
TEXTS = {
    "cp1251": ("Привет", "Кино", "Группа крови", "Комментарий"),
    "gbk": ("你好", "王菲", "天空", "评论"),
}


def id3v1(codec):
    title, artist, album, comment = (t.encode(codec) for t in TEXTS[codec])
    field = lambda b, n: b[:n].ljust(n, b"\0")
    return (b"TAG" + field(title, 30) + field(artist, 30) + field(album, 30) +
            b"1999" + field(comment, 28) + b"\0" + bytes([7, 17]))


def id3v2_frame(frame_id, payload):
    return frame_id.encode() + struct.pack(">IH", len(payload), 0) + payload


def syncsafe(n):
    return bytes([(n >> 21) & 0x7F, (n >> 14) & 0x7F, (n >> 7) & 0x7F, n & 0x7F])


def id3v2(codec):
    title, artist, album, comment = (t.encode(codec) for t in TEXTS[codec])
    latin1 = b"\0"  # the declared encoding: ISO-8859-1
    frames = b"".join([
        id3v2_frame("TIT2", latin1 + title),
        id3v2_frame("TPE1", latin1 + artist),
        id3v2_frame("TALB", latin1 + album),
        id3v2_frame("COMM", latin1 + b"rus" + b"\0" + comment),
        id3v2_frame("TRCK", latin1 + b"5/9"),
        id3v2_frame("TYER", latin1 + b"2001"),
    ])
    padding = b"\0" * 64
    body = frames + padding
    return b"ID3\x03\x00\x00" + syncsafe(len(body)) + body


def write_id3(src, dst, codec, v1, v2):
    data = open(src, "rb").read()
    out = (id3v2(codec) if v2 else b"") + data + (id3v1(codec) if v1 else b"")
    open(dst, "wb").write(out)


class BitWriter:
    def __init__(self):
        self.bits = []

    def put(self, value, width):
        self.bits += [(value >> (width - 1 - i)) & 1 for i in range(width)]

    def data(self):
        self.bits += [0] * (-len(self.bits) % 8)
        return bytes(int("".join(map(str, self.bits[i:i + 8])), 2)
                     for i in range(0, len(self.bits), 8))


def he_aac_config(lc_config):
    """Explicit hierarchical SBR signalling around an AAC LC config."""
    bits = int.from_bytes(lc_config[:2], "big")
    object_type, rate_index, channels = bits >> 11, (bits >> 7) & 15, (bits >> 3) & 15
    assert object_type == 2, "not AAC LC"
    w = BitWriter()
    w.put(5, 5)                  # SBR
    w.put(rate_index, 4)         # core sampling rate
    w.put(channels, 4)
    w.put(max(rate_index - 3, 0), 4)  # extension sampling rate: twice the core
    w.put(2, 5)                  # core object type: AAC LC
    w.put(0, 3)                  # GASpecificConfig: 1024 frames, no core coder
    return w.data()


# The boxes on the way to the esds box, by the bytes before their children.
BOX_HEADERS = {b"moov": 8, b"trak": 8, b"mdia": 8, b"minf": 8, b"stbl": 8,
               b"stsd": 16, b"mp4a": 36}


def he_aac(src, dst):
    data = bytearray(open(src, "rb").read())
    path = []  # (offset of size field) of every enclosing box

    def walk(start, end):
        pos = start
        while pos + 8 <= end:
            size, kind = struct.unpack(">I4s", data[pos:pos + 8])
            if kind == b"moov" and data.find(b"mdat") > pos:
                raise SystemExit("he-aac: moov must follow mdat")
            if kind == b"esds":
                path.append(pos)
                patch_esds(pos)
                return True
            if kind in BOX_HEADERS:
                path.append(pos)
                if walk(pos + BOX_HEADERS[kind], pos + size):
                    return True
                path.pop()
            pos += size
        return False

    def patch_esds(pos):
        # Descriptors with four-byte lengths: ES (3), DecoderConfig (4),
        # DecoderSpecificInfo (5) holding the AudioSpecificConfig.
        es = pos + 12
        assert data[es] == 3 and data[es + 1:es + 4] == b"\x80\x80\x80"
        dc = es + 5 + 3
        assert data[dc] == 4 and data[dc + 1:dc + 4] == b"\x80\x80\x80"
        dsi = dc + 5 + 13
        assert data[dsi] == 5 and data[dsi + 1:dsi + 4] == b"\x80\x80\x80"
        old_len = data[dsi + 4]
        new = he_aac_config(bytes(data[dsi + 5:dsi + 5 + old_len]))
        grow = len(new) - old_len
        data[dsi + 5:dsi + 5 + old_len] = new
        data[dsi + 4] += grow
        data[dc + 4] += grow
        data[es + 4] += grow
        for box in path:
            size = struct.unpack(">I", data[box:box + 4])[0]
            data[box:box + 4] = struct.pack(">I", size + grow)

    if not walk(0, len(data)):
        raise SystemExit("he-aac: no esds box")
    open(dst, "wb").write(data)


def main(argv):
    if len(argv) != 3:
        raise SystemExit(__doc__)
    write_id3(argv[1], "song_id3v1_cp1251.mp3", "cp1251", True, False)
    write_id3(argv[1], "song_id3v23_cp1251.mp3", "cp1251", False, True)
    write_id3(argv[1], "song_gbk.mp3", "gbk", True, True)
    he_aac(argv[2], "song_he.m4a")


if __name__ == "__main__":
    main(sys.argv)
