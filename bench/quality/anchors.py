"""Public denoisers run on the same noisy sound, for comparison.

Each anchor processes the whole noisy clip (the blind ones see the motor-free
surroundings too); its latency is then undone and its result is spliced into the AF
intervals with the same 10 ms raised-cosine transitions the library uses, the ramps lying
just outside each interval; elsewhere the noisy input stays as it was.

- afftdn:  ffmpeg's FFT denoiser with noise tracking, nr=30 nf=-30 tn=1 (blind).
- anlmdn:  ffmpeg's non-local-means denoiser, s=10000 m=1000 (blind).
  Both filters' defaults leave this material practically untouched (their strength scales
  suit steady noise at other levels); these settings were the better of a few tried.
- webrtc:  WebRTC noise suppression through GStreamer's webrtcdsp, echo cancelling and gain
           control off, at 48 kHz (other rates are resampled there and back).
- rnnoise: RNNoise (WebAssembly build from npm) under node, 48 kHz, 480-frame frames, one
           channel at a time, samples scaled to the 16-bit range.
- sox:     sox noisered given the TRUE motor-only noise profile (not blind).
- irm:     the ideal ratio mask from the true clean sound and the true noise (oracle ceiling).
"""
import os
import subprocess

import numpy as np
from scipy import signal

from material import resample
from wavio import read_wav, write_wav

HERE = os.path.dirname(os.path.abspath(__file__))
BLIND = ["afftdn", "anlmdn", "webrtc", "rnnoise"]
ALL = BLIND + ["sox", "irm"]


def _ffmpeg_filter(noisy, rate, work, name, chain):
    src, dst = os.path.join(work, name + ".in.wav"), os.path.join(work, name + ".out.wav")
    write_wav(src, rate, noisy)
    subprocess.run(["ffmpeg", "-v", "error", "-nostdin", "-y", "-i", src, "-af", chain, "-c:a", "pcm_f32le", dst],
                   check=True)
    return read_wav(dst)[1]


def afftdn(noisy, rate, work, ctx):
    return _ffmpeg_filter(noisy, rate, work, "afftdn", "afftdn=nr=30:nf=-30:tn=1")


def anlmdn(noisy, rate, work, ctx):
    return _ffmpeg_filter(noisy, rate, work, "anlmdn", "anlmdn=s=10000:m=1000")


def webrtc(noisy, rate, work, ctx):
    x = resample(noisy, rate, 48000)
    src, dst = os.path.join(work, "webrtc.in.wav"), os.path.join(work, "webrtc.out.wav")
    write_wav(src, 48000, x)
    subprocess.run(["gst-launch-1.0", "-q", "filesrc", f"location={src}", "!", "wavparse", "!", "audioconvert", "!",
                    f"audio/x-raw,format=S16LE,layout=interleaved,rate=48000,channels={x.shape[1]}", "!",
                    "webrtcdsp", "echo-cancel=false", "gain-control=false", "high-pass-filter=false",
                    "noise-suppression=true", "noise-suppression-level=high", "voice-detection=false", "!",
                    "audioconvert", "!", "wavenc", "!", "filesink", f"location={dst}"],
                   check=True, stdout=subprocess.DEVNULL)
    return resample(read_wav(dst)[1], 48000, rate)


def rnnoise(noisy, rate, work, ctx):
    x = resample(noisy, rate, 48000)
    frames = len(x)
    padded = np.zeros((-(-frames // 480) * 480 + 480, x.shape[1]), dtype=np.float32)
    padded[:frames] = x * 32768.0
    src, dst = os.path.join(work, "rnnoise.in.f32"), os.path.join(work, "rnnoise.out.f32")
    np.ascontiguousarray(padded.T).tofile(src)
    env = dict(os.environ, RNNOISE_MODULE=ctx["rnnoise_module"])
    subprocess.run(["node", os.path.join(HERE, "rnnoise.mjs"), src, dst, str(x.shape[1])], check=True, env=env)
    out = np.fromfile(dst, dtype=np.float32).reshape(x.shape[1], -1).T[:frames] / 32768.0
    return resample(out.astype(np.float64), 48000, rate)


def sox(noisy, rate, work, ctx):
    """noisered with the profile of this clip's motor-only sound (float WAVs: no clipping)."""
    prof_src, prof = os.path.join(work, "sox.motor.wav"), os.path.join(work, "sox.prof")
    write_wav(prof_src, rate, ctx["motor_only"].astype(np.float32))
    subprocess.run(["sox", prof_src, "-n", "noiseprof", prof], check=True)
    src, dst = os.path.join(work, "sox.in.wav"), os.path.join(work, "sox.out.wav")
    write_wav(src, rate, noisy.astype(np.float32))
    subprocess.run(["sox", "-q", src, "-e", "floating-point", "-b", "32", dst, "noisered", prof, "0.3"], check=True)
    return read_wav(dst)[1]


def irm(noisy, rate, work, ctx):
    """sqrt(|S|^2 / (|S|^2 + |N|^2)) on the noisy STFT, noisy phase."""
    nper = 1024 if rate >= 44100 else 512
    kw = dict(fs=rate, nperseg=nper, noverlap=nper * 3 // 4)
    out = np.zeros_like(noisy)
    for c in range(noisy.shape[1]):
        clean = ctx["clean"][:, c]
        _, _, Y = signal.stft(noisy[:, c], **kw)
        _, _, S = signal.stft(clean, **kw)
        _, _, N = signal.stft(noisy[:, c] - clean, **kw)
        mask = np.sqrt(np.abs(S) ** 2 / (np.abs(S) ** 2 + np.abs(N) ** 2 + 1e-20))
        _, y = signal.istft(Y * mask, **kw)
        out[:, c] = _fit(y[:, None], len(noisy))[:, 0]
    return out


def _fit(x, frames):
    x = x[:frames]
    if len(x) < frames:
        x = np.concatenate([x, np.zeros((frames - len(x), x.shape[1]))])
    return x


RUNNERS = {"afftdn": afftdn, "anlmdn": anlmdn, "webrtc": webrtc, "rnnoise": rnnoise, "sox": sox, "irm": irm}


def latency(out, noisy, outside, max_lag):
    """Lag (frames) by which `out` trails `noisy`, from their cross-correlation on frames
    outside the intervals (where a denoiser should pass the sound nearly unchanged)."""
    a = (noisy * outside[:, None]).sum(axis=1)
    b = (out * outside[:, None]).sum(axis=1)
    n = 1 << int(np.ceil(np.log2(len(a) + max_lag + 1)))
    xc = np.fft.irfft(np.fft.rfft(b, n) * np.conj(np.fft.rfft(a, n)), n)
    lags = np.concatenate([np.arange(0, max_lag + 1), np.arange(-max_lag, 0)])
    values = np.concatenate([xc[:max_lag + 1], xc[-max_lag:]])
    return int(lags[np.argmax(values)])


def shift(x, lag):
    """Moves x earlier by `lag` frames, zero-filling."""
    if lag == 0:
        return x
    out = np.zeros_like(x)
    if lag > 0:
        out[:-lag] = x[lag:]
    else:
        out[-lag:] = x[:lag]
    return out


def splice(noisy, processed, intervals, rate):
    """Processed inside each interval, noisy outside, 10 ms raised-cosine ramps just outside."""
    ramp = rate // 100
    weight = np.zeros(len(noisy))
    rise = 0.5 - 0.5 * np.cos(np.pi * (np.arange(ramp) + 0.5) / ramp)
    for start, end in intervals:
        weight[start:end] = 1
        a = max(start - ramp, 0)
        weight[a:start] = np.maximum(weight[a:start], rise[ramp - (start - a):])
        b = min(end + ramp, len(noisy))
        weight[end:b] = np.maximum(weight[end:b], rise[::-1][:b - end])
    return noisy + (processed - noisy) * weight[:, None]


def run(name, noisy, rate, work, ctx, intervals):
    """The anchor's result on the whole clip, latency undone, spliced; plus the latency found."""
    out = _fit(RUNNERS[name](noisy, rate, work, ctx), len(noisy))
    outside = np.ones(len(noisy))
    margin = rate // 20
    for start, end in intervals:
        outside[max(start - margin, 0):end + margin] = 0
    lag = latency(out, noisy, outside, rate // 10) if name != "irm" else 0
    return splice(noisy, shift(out, lag), intervals, rate), lag
