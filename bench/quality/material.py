"""Clean material: the wanted sound the suppressor must leave alone.

Everything is made here at run time from fixed seeds: speech by espeak-ng, a recorded voice
from alsa-utils' channel-test clips, synthetic music and ambience.  Float arrays shaped
(frames, channels), full scale 1.0.
"""
import os
import subprocess
import tempfile

import numpy as np
from scipy import signal

from wavio import read_wav

RECORDED_VOICE_DIR = "/usr/share/sounds/alsa"
RECORDED_VOICE_CLIPS = ["Front_Center", "Rear_Left", "Side_Right", "Front_Left", "Rear_Right", "Side_Left",
                        "Front_Right", "Rear_Center"]

SENTENCES = [
    "The lens moved while we were talking about the weather on the coast.",
    "Please keep the camera steady and wait for the focus to settle.",
    "Seven bright lanterns hung above the quiet harbour at midnight.",
    "A recording sounds natural when the background stays the same.",
    "She counted the boats, three red, four blue, and one green.",
    "We will meet again tomorrow morning at half past nine.",
]
VOICES = ["en-us", "en-gb", "en-us+f3", "en-gb-scotland", "en-us+m4", "en-gb-x-rp+f2"]


def resample(x, rate_from, rate_to):
    if rate_from == rate_to:
        return x
    g = np.gcd(int(rate_from), int(rate_to))
    return signal.resample_poly(x, rate_to // g, rate_from // g, axis=0)


def set_rms(x, dbfs):
    rms = np.sqrt(np.mean(x ** 2))
    return x * (10 ** (dbfs / 20) / max(rms, 1e-12))


def fit(x, frames):
    if len(x) >= frames:
        return x[:frames]
    return np.concatenate([x, np.zeros((frames - len(x),) + x.shape[1:])])


def espeak(text, voice, speed, pitch):
    with tempfile.TemporaryDirectory() as tmp:
        path = os.path.join(tmp, "s.wav")
        subprocess.run(["espeak-ng", "-v", voice, "-s", str(speed), "-p", str(pitch), "-w", path, text],
                       check=True, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        rate, x = read_wav(path)
    return rate, x[:, 0]


def speech_synthetic(rate, channels, seconds, seed):
    """Several espeak-ng voices, one sentence each, with short pauses between turns."""
    rng = np.random.default_rng(seed)
    frames = int(seconds * rate)
    parts, total, turn = [], 0, 0
    while total < frames:
        voice = VOICES[(seed + turn) % len(VOICES)]
        text = SENTENCES[(seed * 2 + turn) % len(SENTENCES)]
        src_rate, x = espeak(text, voice, int(rng.integers(150, 185)), int(rng.integers(35, 65)))
        x = resample(x, src_rate, rate)
        gap = np.zeros(int(rate * rng.uniform(0.12, 0.35)))
        parts += [x * 10 ** (rng.uniform(-3, 3) / 20), gap]
        total += len(x) + len(gap)
        turn += 1
    mono = set_rms(fit(np.concatenate(parts), frames), -22)
    return spread(mono, channels, rate, rng)


def speech_recorded(rate, channels, seconds, seed):
    """A real human voice: the alsa-utils channel-test recordings, one after another."""
    rng = np.random.default_rng(seed)
    frames = int(seconds * rate)
    parts, total, i = [], 0, 0
    while total < frames:
        name = RECORDED_VOICE_CLIPS[(seed + i) % len(RECORDED_VOICE_CLIPS)]
        src_rate, x = read_wav(os.path.join(RECORDED_VOICE_DIR, name + ".wav"))
        x = x[:, 0] - np.mean(x[:, 0])
        x = signal.sosfilt(signal.butter(2, 40, "highpass", fs=src_rate, output="sos"), x)
        x = resample(x, src_rate, rate)
        gap = np.zeros(int(rate * rng.uniform(0.1, 0.3)))
        parts += [x, gap]
        total += len(x) + len(gap)
        i += 1
    mono = set_rms(fit(np.concatenate(parts), frames), -22)
    return spread(mono, channels, rate, rng)


def spread(mono, channels, rate, rng):
    """A voice in front of a stereo pair: equal level, a fraction of a millisecond apart,
    with a little room tone of its own in each channel."""
    if channels == 1:
        return mono[:, None]
    delay = int(rate * 0.0004)
    right = np.concatenate([np.zeros(delay), mono[:-delay]]) * 0.9
    out = np.stack([mono, right], axis=1)
    return out + room_tone(len(mono), rate, channels, rng, -58)


def room_tone(frames, rate, channels, rng, dbfs):
    """Low, steady background: brown-ish noise with a faint ventilation band, uncorrelated per channel."""
    white = rng.standard_normal((frames, channels))
    brown = signal.lfilter([1.0], [1.0, -0.995], white, axis=0)
    brown = signal.sosfilt(signal.butter(2, 25, "highpass", fs=rate, output="sos"), brown, axis=0)
    band = signal.sosfilt(signal.butter(2, [300, 900], "bandpass", fs=rate, output="sos"), white, axis=0)
    x = set_rms(brown, 0) + 0.3 * set_rms(band, 0)
    return set_rms(x, dbfs)


def ambience(rate, channels, seconds, seed):
    """Outdoor-ish ambience: wind-like filtered noise with slow swells over room tone, and a
    few soft distant events; the channels are only partly correlated."""
    rng = np.random.default_rng(seed)
    frames = int(seconds * rate)
    t = np.arange(frames) / rate
    common = rng.standard_normal(frames)
    own = rng.standard_normal((frames, channels))
    wind = 0.7 * common[:, None] + 0.7 * own
    lo = rng.uniform(250, 500)
    wind = signal.sosfilt(signal.butter(2, [80, lo * 4], "bandpass", fs=rate, output="sos"), wind, axis=0)
    swell = 0.55 + 0.45 * np.sin(2 * np.pi * rng.uniform(0.15, 0.3) * t + rng.uniform(0, 6))[:, None]
    x = set_rms(wind * swell, -34) + room_tone(frames, rate, channels, rng, -44)
    # Distant events: band-passed noise bursts a few hundred ms long (birds, traffic).
    for _ in range(5):
        start = int(rng.uniform(0, seconds - 0.6) * rate)
        n = int(rng.uniform(0.15, 0.5) * rate)
        centre = rng.uniform(1500, 4000)
        burst = signal.sosfilt(signal.butter(2, [centre * 0.8, centre * 1.25], "bandpass", fs=rate, output="sos"),
                               rng.standard_normal(n))
        burst *= np.hanning(n) * 10 ** (-40 / 20) / max(np.std(burst), 1e-12)
        for c in range(channels):
            x[start:start + n, c] += burst * (1.0 if c == 0 else 0.7)
    return set_rms(x, -30)


def _note(freq, frames, rate, harmonics, vibrato_hz, vibrato_depth, rng):
    t = np.arange(frames) / rate
    f = freq * (1 + vibrato_depth * np.sin(2 * np.pi * vibrato_hz * t + rng.uniform(0, 6)))
    phase = 2 * np.pi * np.cumsum(f) / rate
    out = np.zeros(frames)
    for k, a in enumerate(harmonics, start=1):
        if freq * k < rate / 2 - 1000:
            out += a * np.sin(k * phase)
    return out


def _adsr(frames, rate, attack, release):
    env = np.ones(frames)
    a, r = min(int(attack * rate), frames // 2), min(int(release * rate), frames // 2)
    env[:a] = np.linspace(0, 1, a)
    env[frames - r:] = np.linspace(1, 0, r)
    return env


def _pluck(freq, frames, rate, rng, decay=0.996):
    """Karplus-Strong string: a noise burst circulating in a damped delay line."""
    period = max(int(rate / freq), 2)
    x = np.zeros(frames)
    x[:period] = rng.uniform(-1, 1, period)
    a = np.zeros(period + 2)
    a[0] = 1.0
    a[period] = a[period + 1] = -decay / 2
    return signal.lfilter([1.0], a, x)


def music(rate, channels, seconds, seed):
    """Chords of sustained notes with vibrato (pad), a bass line and a plucked melody."""
    rng = np.random.default_rng(seed)
    frames = int(seconds * rate)
    out = np.zeros((frames, 2))
    midi = lambda m: 440.0 * 2 ** ((m - 69) / 12)
    progression = [[57, 60, 64], [53, 57, 60], [48, 52, 55], [55, 59, 62]]
    bass_roots = [45, 41, 36, 43]
    bar = seconds / 4
    pad_h = [1, 0.5, 0.3, 0.2, 0.12, 0.08, 0.05]
    for i, chord in enumerate(progression):
        start, n = int(i * bar * rate), int(bar * rate)
        n = min(n, frames - start)
        env = _adsr(n, rate, 0.15, 0.25)
        for j, m in enumerate(chord):
            note = _note(midi(m), n, rate, pad_h, rng.uniform(4.5, 6), 0.004, rng) * env
            pan = 0.3 + 0.2 * j
            out[start:start + n, 0] += note * (1 - pan)
            out[start:start + n, 1] += note * pan
        # Bass: two notes a bar, strong fundamental and second harmonic.
        for half in range(2):
            s = start + half * n // 2
            k = min(n // 2, frames - s)
            b = _note(midi(bass_roots[i] - 12 * half % 12), k, rate, [1, 0.45, 0.15], 0.1, 0.0, rng)
            out[s:s + k] += (b * _adsr(k, rate, 0.01, 0.08))[:, None] * 1.6
    # Plucked line: eighth notes on a scale, panned right of centre.
    scale = [69, 71, 72, 74, 76, 79, 81]
    step = seconds / 32
    for i in range(32):
        s = int(i * step * rate)
        k = min(int(rate * 0.6), frames - s)
        p = _pluck(midi(scale[rng.integers(len(scale))]), k, rate, rng) * 0.5
        out[s:s + k, 0] += p * 0.4
        out[s:s + k, 1] += p * 0.6
    out = out if channels == 2 else out.mean(axis=1, keepdims=True)
    return set_rms(out, -20)


def piano(rate, channels, seconds, seed):
    """Struck strings over the whole keyboard: hammer transients, inharmonic partials decaying
    at their own rates, chords in the bass and runs in the treble."""
    rng = np.random.default_rng(seed)
    frames = int(seconds * rate)
    out = np.zeros((frames, 2))
    midi = lambda m: 440.0 * 2 ** ((m - 69) / 12)
    at = 0.0
    while at < seconds - 0.1:
        low = rng.random() < 0.35
        keys = rng.integers(28, 52, 3) if low else rng.integers(55, 96, 1 + int(rng.integers(2)))
        s = int(at * rate)
        n = min(int(rate * rng.uniform(0.8, 2.5)), frames - s)
        t = np.arange(n) / rate
        for key in keys:
            f0 = midi(int(key))
            note = np.zeros(n)
            for k in range(1, 12):
                fk = f0 * k * np.sqrt(1 + 0.0004 * k * k)
                if fk > rate / 2 - 1000:
                    break
                note += np.sin(2 * np.pi * fk * t) * np.exp(-t * (1.5 + 0.6 * k) * (f0 / 260) ** 0.3) / k
            hammer = rng.standard_normal(min(n, int(rate * 0.004))) * 0.3
            note[:len(hammer)] += hammer
            pan = (int(key) - 20) / 90
            out[s:s + n, 0] += note * (1 - pan)
            out[s:s + n, 1] += note * pan
        at += rng.choice([0.125, 0.25, 0.25, 0.5])
    out = out if channels == 2 else out.mean(axis=1, keepdims=True)
    return set_rms(out, -20)


def drums(rate, channels, seconds, seed):
    """A kit: kick (a falling sine), snare (tone and noise), closed hats (short high noise) in a
    groove with a bass line under it: transients a motor's ticks must not be confused with."""
    rng = np.random.default_rng(seed)
    frames = int(seconds * rate)
    out = np.zeros(frames)
    beat = 60 / rng.uniform(90, 130)
    sixteenth = beat / 4
    i = 0
    while i * sixteenth < seconds:
        s = int(i * sixteenth * rate)
        if i % 8 in (0, 3) or (i % 16 == 10):
            n = min(int(rate * 0.3), frames - s)
            t = np.arange(n) / rate
            out[s:s + n] += np.sin(2 * np.pi * (50 + 90 * np.exp(-t * 30)) * t) * np.exp(-t * 9)
        if i % 8 == 4:
            n = min(int(rate * 0.2), frames - s)
            t = np.arange(n) / rate
            noise = signal.sosfilt(signal.butter(2, [1500, 8000], "bandpass", fs=rate, output="sos"), rng.standard_normal(n))
            out[s:s + n] += (0.5 * np.sin(2 * np.pi * 190 * t) + 0.8 * noise) * np.exp(-t * 22)
        if i % 2 == 0:
            n = min(int(rate * 0.05), frames - s)
            t = np.arange(n) / rate
            hat = signal.sosfilt(signal.butter(2, 7000, "highpass", fs=rate, output="sos"), rng.standard_normal(n))
            out[s:s + n] += hat * np.exp(-t * 90) * rng.uniform(0.2, 0.4)
        i += 1
    bass = _note(55.0 * 2 ** (rng.integers(0, 5) / 12), frames, rate, [1, 0.5, 0.25], 0.1, 0.0, rng)
    pump = 0.5 + 0.5 * np.abs(np.sin(np.pi * np.arange(frames) / rate / beat))
    out += 0.35 * bass * pump
    x = out[:, None] if channels == 1 else np.stack([out, 0.8 * out + 0.05 * rng.standard_normal(frames) * 0.01], 1)
    return set_rms(x, -20)


def traffic(rate, channels, seconds, seed):
    """A street: low engine rumble of passing cars swelling and fading, tyre hiss, a far horn."""
    rng = np.random.default_rng(seed)
    frames = int(seconds * rate)
    t = np.arange(frames) / rate
    x = room_tone(frames, rate, channels, rng, -40)
    for _ in range(int(seconds / 2.5) + 2):
        centre = rng.uniform(-1, seconds + 1)
        width = rng.uniform(0.8, 2.0)
        env = np.exp(-((t - centre) / width) ** 2)
        engine = 30 * rng.uniform(0.8, 1.6)
        tone = sum(np.sin(2 * np.pi * engine * k * t * (1 - 0.03 * np.tanh((t - centre) / width)) + k) / k
                   for k in range(1, 8))
        rumble = signal.sosfilt(signal.butter(2, [40, 400], "bandpass", fs=rate, output="sos"), rng.standard_normal(frames))
        hiss = signal.sosfilt(signal.butter(2, [800, 5000], "bandpass", fs=rate, output="sos"), rng.standard_normal(frames))
        car = (0.3 * tone + rumble / max(np.std(rumble), 1e-12) + 0.4 * hiss / max(np.std(hiss), 1e-12)) * env
        for c in range(channels):
            x[:, c] += 0.05 * car * (0.6 + 0.4 * ((c + centre) % 2))
    return set_rms(x, -26)


def birds(rate, channels, seconds, seed):
    """Birdsong in a quiet garden: fast chirps sweeping up and down between 2 and 8 kHz, trills,
    over a faint breeze."""
    rng = np.random.default_rng(seed)
    frames = int(seconds * rate)
    x = room_tone(frames, rate, channels, rng, -50)
    at = rng.uniform(0, 0.3)
    while at < seconds - 0.3:
        s = int(at * rate)
        calls = int(rng.integers(2, 9))
        f_lo, f_hi = sorted(rng.uniform(2000, 8000, 2))
        for j in range(calls):
            n = int(rate * rng.uniform(0.03, 0.09))
            t = np.arange(n) / rate
            sweep = f_lo + (f_hi - f_lo) * (t / t[-1] if j % 2 == 0 else 1 - t / t[-1])
            chirp = np.sin(2 * np.pi * np.cumsum(sweep) / rate) * np.hanning(n)
            p = s + j * int(rate * rng.uniform(0.06, 0.12))
            if p + n >= frames:
                break
            for c in range(channels):
                x[p:p + n, c] += chirp * 0.05 * (1.0 if c == 0 else 0.6)
        at += rng.uniform(0.5, 1.5)
    return set_rms(x, -28)


def crowd(rate, channels, seconds, seed):
    """A room of people: four espeak-ng voices talking at once at different levels and places."""
    rng = np.random.default_rng(seed)
    frames = int(seconds * rate)
    x = np.zeros((frames, channels))
    for talker in range(4):
        voice = speech_synthetic(rate, 1, seconds, seed * 7 + talker + 3)[:, 0]
        voice = np.roll(voice, int(rng.integers(0, frames)))
        level = 10 ** (-talker * 4 / 20)
        for c in range(channels):
            pan = (talker + 1) / 5
            x[:, c] += voice * level * (pan if c == 0 else 1 - pan)
    return set_rms(x + room_tone(frames, rate, channels, rng, -50), -24)


MATERIALS = {
    "speech": speech_synthetic,
    "voice": speech_recorded,
    "music": music,
    "ambience": ambience,
    "piano": piano,
    "drums": drums,
    "traffic": traffic,
    "birds": birds,
    "crowd": crowd,
}


def make(kind, rate, channels, seconds, seed):
    x = MATERIALS[kind](rate, channels, seconds, seed)
    peak = np.max(np.abs(x))
    return x * (0.5 / peak) if peak > 0.5 else x
