"""The system under test: the noisy sound goes into a movie written by the ffmpeg command,
the camera's maker atoms (AF intervals) are added, `tqovix process` runs, and ffmpeg
decodes both movies back to 16-bit PCM.

The maker atoms follow the layout our sample maker writes: "moov"/"udta"/"TCDT" holding
"TCDB" ("OP01" AF information, "OP02" audio level) and "TCTG" (software name and trim tags).
AF positions count frames of the decoded track at its own rate.
"""
import struct
import subprocess
import time

import numpy as np

CODECS = {"twos": ["-c:a", "pcm_s16be"], "sowt": ["-c:a", "pcm_s16le"], "aac": ["-c:a", "aac", "-b:a", "256k"]}


def atom(kind, payload):
    return struct.pack(">I4s", 8 + len(payload), kind.encode("latin-1")) + payload


def af_information(rate, intervals, processed=False):
    out = b"AFR1" + struct.pack(">HHII", 1, 1 if processed else 0, rate, len(intervals))
    for start, end, strength in intervals:
        out += struct.pack(">QQHH", start, end, strength, 0)
    return out


def _tag(group, number, kind, count, data):
    return struct.pack(">HHHH", group, number, kind, count) + data


def maker_user_data_children(rate, intervals):
    software = b"Camera Firmware 1.00\0"
    tags = (_tag(0, 3, 2, len(software), software) +
            _tag(0, 20, 4, 2, struct.pack(">II", 0, 0)) +
            _tag(0, 21, 4, 2, struct.pack(">II", 0, 0)) +
            _tag(0, 22, 5, 1, struct.pack(">II", 30, 1)))
    level = b"ALV1" + struct.pack(">HHi", 1, 0, -1200)
    tcdb = atom("TCDB", atom("OP01", af_information(rate, intervals)) + atom("OP02", level))
    return atom("TCDT", tcdb + atom("TCTG", tags))


def _boxes(data, begin, end):
    boxes, offset = [], begin
    while offset < end:
        size, kind = struct.unpack(">I4s", data[offset:offset + 8])
        header = 8
        if size == 1:
            size = struct.unpack(">Q", data[offset + 8:offset + 16])[0]
            header = 16
        elif size == 0:
            size = end - offset
        if size < header or offset + size > end:
            raise ValueError("unreadable atom")
        boxes.append((kind.decode("latin-1"), offset, header, size))
        offset += size
    return boxes


def add_maker_data(path, rate, intervals):
    """The maker atoms go first in "udta"; "moov" must be the file's last atom so no chunk moves."""
    with open(path, "rb") as f:
        data = f.read()
    top = _boxes(data, 0, len(data))
    kind, offset, header, size = top[-1]
    if kind != "moov":
        raise ValueError(path + ": moov is not the last atom")
    kept, udta = [], [maker_user_data_children(rate, intervals)]
    for ckind, coff, chead, csize in _boxes(data, offset + header, offset + size):
        if ckind == "udta":
            udta.append(data[coff + chead:coff + csize])
        else:
            kept.append(data[coff:coff + csize])
    moov = atom("moov", b"".join(kept) + atom("udta", b"".join(udta)))
    with open(path, "wb") as f:
        f.write(data[:offset] + moov)


def write_movie(path, pcm, rate, codec, intervals):
    """pcm: int16 (frames, channels)."""
    frames, channels = pcm.shape
    seconds = frames / rate
    cmd = ["ffmpeg", "-v", "error", "-nostdin", "-y",
           "-f", "lavfi", "-i", f"testsrc=size=64x36:rate=30:d={seconds:.6f}",
           "-f", "s16le", "-ar", str(rate), "-ac", str(channels), "-i", "pipe:0",
           "-map", "0:v", "-map", "1:a", "-c:v", "mjpeg", *CODECS[codec], "-shortest", path]
    subprocess.run(cmd, input=pcm.astype("<i2").tobytes(), check=True)
    add_maker_data(path, rate, intervals)


def decode(path, channels):
    out = subprocess.run(["ffmpeg", "-v", "error", "-nostdin", "-i", path, "-map", "0:a:0",
                          "-f", "s16le", "-c:a", "pcm_s16le", "pipe:1"], check=True, capture_output=True).stdout
    return np.frombuffer(out, dtype="<i2").reshape(-1, channels)


def process(tool, source, destination):
    """Runs the tool; returns (seconds, error text or None)."""
    start = time.perf_counter()
    run = subprocess.run([tool, "process", "--quiet", "--force", source, destination], capture_output=True, text=True)
    seconds = time.perf_counter() - start
    return seconds, (None if run.returncode == 0 else (run.stdout + run.stderr).strip() or f"exit {run.returncode}")
