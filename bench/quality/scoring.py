"""Scores inside the AF intervals, with the clean sound as the reference.

- SI-SDR (dB): all channels of an interval taken together, means removed;
  10·log10(|a·s|² / |a·s − y|²) with a = <y, s> / <s, s>.  The change is the result's SI-SDR
  minus the noisy input's, per interval.
- Log-spectral distance (dB): Hann STFT (2048 frames at 44.1/48 kHz, hop 512) of the result
  and of the clean sound, power per bin summed over channels, both floored at 80 dB below the
  clean interval's strongest bin, bins up to 20 kHz; per STFT frame the RMS over bins of the
  difference in dB, then the mean over frames.
- Intervals without motor noise: SI-SDR of the result against the sound that went in (the
  same as the clean sound there, up to 16-bit rounding or the AAC coding), or bit-exact.
- Outside: whether every frame outside the intervals widened by 10 ms is bit-exact.
"""
import numpy as np
from scipy import signal


def si_sdr(estimate, reference):
    s = reference.ravel() - reference.mean()
    y = estimate.ravel() - estimate.mean()
    ss = np.dot(s, s)
    if ss <= 0:
        return float("nan")
    target = np.dot(y, s) / ss * s
    err = np.dot(y - target, y - target)
    return float("inf") if err == 0 else float(10 * np.log10(np.dot(target, target) / err))


def log_spectral_distance(estimate, reference, rate):
    nper = 2048
    kw = dict(fs=rate, window="hann", nperseg=nper, noverlap=nper - 512, axis=0, boundary=None, padded=False)
    if len(reference) < nper:
        return float("nan")
    f, _, S = signal.stft(reference, **kw)
    _, _, Y = signal.stft(estimate, **kw)
    keep = f <= 16000
    ps = (np.abs(S[keep]) ** 2).sum(axis=1)
    py = (np.abs(Y[keep]) ** 2).sum(axis=1)
    floor = ps.max() * 1e-6 + 1e-30
    d = 10 * np.log10(np.maximum(py, floor)) - 10 * np.log10(np.maximum(ps, floor))
    return float(np.mean(np.sqrt(np.mean(d ** 2, axis=0))))


def outside_mask(frames, intervals, ramp):
    mask = np.ones(frames, dtype=bool)
    for start, end in intervals:
        mask[max(start - ramp, 0):end + ramp] = False
    return mask


def score_case(result, noisy, clean, rate, motor_intervals, quiet_intervals):
    """Per-interval figures of one result (float arrays, same shape)."""
    out = {"sisdr_change": [], "sisdr": [], "lsd": [], "quiet": []}
    for start, end in motor_intervals:
        ref = clean[start:end]
        before = si_sdr(noisy[start:end], ref)
        after = si_sdr(result[start:end], ref)
        out["sisdr"].append(after)
        out["sisdr_change"].append(after - before)
        out["lsd"].append(log_spectral_distance(result[start:end], ref, rate))
    for start, end in quiet_intervals:
        same = np.array_equal(result[start:end], noisy[start:end])
        out["quiet"].append(float("inf") if same else si_sdr(result[start:end], noisy[start:end]))
    return out
