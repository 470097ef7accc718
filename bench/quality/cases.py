"""The case table: which clean material, which lens motor, which SNR and which movie format.

Each material meets each motor once; the SNRs rotate so that every motor is heard at 0, 5
and 10 dB across the materials.  Every clip is 8 s with three AF intervals of 0.5-2 s; in
about half of the clips one interval is motor-free (the AF drive was inaudible), in the
others all three carry the motor.  --quick keeps a spread of eight of them.
"""
from dataclasses import dataclass

import numpy as np

from motors import HOLDOUT_KINDS, KINDS

SECONDS = 8.0
# (name, material kind, rate, channels)
MATERIALS = [
    ("speech-mono", "speech", 48000, 1),
    ("voice-mono", "voice", 48000, 1),
    ("music-stereo", "music", 48000, 2),
    ("ambience-stereo", "ambience", 48000, 2),
    ("music-mono-44k", "music", 44100, 1),
    ("speech-stereo", "speech", 48000, 2),
]
SNRS = [0, 5, 10]
# The held-out set (--holdout): material and motors never used while tuning, other seeds, wider
# SNRs and interval lengths.  Its figures tell whether a change learned the kind of noise or
# these clips.
HOLDOUT_MATERIALS = [
    ("piano-stereo", "piano", 48000, 2),
    ("drums-mono", "drums", 48000, 1),
    ("traffic-stereo", "traffic", 48000, 2),
    ("birds-mono-44k", "birds", 44100, 1),
    ("crowd-stereo", "crowd", 48000, 2),
    ("speech-mono-44k", "speech", 44100, 1),
]
HOLDOUT_SNRS = [-5, 5, 15]


@dataclass
class Case:
    name: str
    material: str
    kind: str
    rate: int
    channels: int
    motor: str
    snr: float
    codec: str
    seed: int
    intervals: list      # [(start, end)] frames, exclusive end
    motor_in: list       # per interval: whether the motor runs


def material_seed(name):
    return [m[0] for m in MATERIALS + HOLDOUT_MATERIALS].index(name) + 1


def _intervals(rate, rng, count, shortest=0.5, longest=2.0):
    """count intervals of shortest-longest s, at least 0.35 s from each other and from the clip's ends."""
    frames = int(SECONDS * rate)
    while True:
        lengths = rng.uniform(shortest, longest, count)
        free = SECONDS - lengths.sum() - 0.35 * (count + 1)
        if free < 0:
            continue
        gaps = rng.dirichlet(np.ones(count + 1)) * free + 0.35
        out, at = [], 0.0
        for i in range(count):
            at += gaps[i]
            out.append((int(at * rate), min(int((at + lengths[i]) * rate), frames)))
            at += lengths[i]
        return out


def _grid(materials, kinds, snrs, seed_base, codec_of, layout, quiet_parity):
    """Each material meets each motor once, the SNRs rotating; `layout(rate, rng)` draws the
    intervals; every other case (by `quiet_parity`) has one interval without the motor."""
    cases = []
    for m, (mname, kind, rate, channels) in enumerate(materials):
        for k, motor in enumerate(kinds):
            index = m * len(kinds) + k
            snr = snrs[(m + k) % 3]
            codec = codec_of(index)
            rng = np.random.default_rng(seed_base + index)
            intervals = layout(rate, rng)
            motor_in = [True] * len(intervals)
            if index % 2 == quiet_parity:
                motor_in[int(rng.integers(len(intervals)))] = False
            cases.append(Case(f"{mname}/{motor}/{snr}dB/{codec}", mname, kind, rate, channels, motor, snr, codec,
                              seed_base + index, intervals, motor_in))
    return cases


def all_cases(seed_base=1000):
    return _grid(MATERIALS, KINDS, SNRS, seed_base,
                 lambda i: "aac" if i % 6 == 5 else ("sowt" if i % 4 == 1 else "twos"),
                 lambda rate, rng: _intervals(rate, rng, 3), 0)


def quick_cases():
    picks = [0, 7, 9, 11, 16, 20, 23, 28]
    every = all_cases()
    return [every[i] for i in picks]


def holdout_cases(seed_base=5000):
    def layout(rate, rng):
        count = int(rng.integers(2, 5))
        return _intervals(rate, rng, count, 0.3, 6.0 / count)
    return _grid(HOLDOUT_MATERIALS, HOLDOUT_KINDS, HOLDOUT_SNRS, seed_base,
                 lambda i: "aac" if i % 7 == 3 else ("sowt" if i % 3 == 1 else "twos"), layout, 1)
