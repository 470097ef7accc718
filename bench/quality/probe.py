"""Quick loop for tuning the suppressor: every case of the main and the held-out sets, the
suppressor alone (build/*/bench/ovix_probe) on the noisy PCM, scored as the benchmark scores
ours.  No movies, no codecs, no anchors: seconds instead of minutes.

    python3 bench/quality/probe.py PROBE [--set main|holdout|all] [--cases SUBSTRING] [-v]
"""
import argparse
import os
import subprocess
import sys
import tempfile
from concurrent.futures import ThreadPoolExecutor

sys.dont_write_bytecode = True

import numpy as np

import cases as casebook
import scoring
from run import build_sound
from wavio import from_int16, to_int16

SHIFT_MS = 0.0
CACHE = os.path.join(os.path.dirname(__file__), "..", "..", "build", "quality", "probe")


def sound_of(case, clean_cache):
    path = os.path.join(CACHE, f"{case.seed}-" + case.name.replace("/", "_") + ".npz")
    if os.path.exists(path):
        data = np.load(path)
        return data["clean"], data["motor"]
    clean, motor = build_sound(case, clean_cache)
    os.makedirs(CACHE, exist_ok=True)
    np.savez(path, clean=clean, motor=motor)
    return clean, motor


def run(probe, case, clean, motor):
    noisy_pcm = to_int16(clean + motor)
    with tempfile.TemporaryDirectory() as tmp:
        src, dst = os.path.join(tmp, "in.raw"), os.path.join(tmp, "out.raw")
        noisy_pcm.astype("<i2").tofile(src)
        # --shift: the camera's intervals off from where the motor ran, as clocks drift.
        shift = int(SHIFT_MS * case.rate / 1000)
        spans = [f"{max(s + shift, 0)}:{max(e + shift, 0)}" for s, e in case.intervals]
        done = subprocess.run([probe, str(case.rate), str(case.channels), src, dst] + spans,
                              capture_output=True, text=True, check=True)
        out = np.fromfile(dst, dtype="<i2").reshape(-1, case.channels)
    shares = [float(v) for v in done.stdout.split()]
    if done.stderr:
        sys.stderr.write(f"{case.name}:\n{done.stderr}")
    noisy = from_int16(noisy_pcm)
    result = from_int16(out)
    motor_iv = [iv for iv, a in zip(case.intervals, case.motor_in) if a]
    quiet_iv = [iv for iv, a in zip(case.intervals, case.motor_in) if not a]
    score = scoring.score_case(result, noisy, clean, case.rate, motor_iv, quiet_iv)
    score["input_lsd"] = [scoring.log_spectral_distance(noisy[s:e], clean[s:e], case.rate) for s, e in motor_iv]
    score["shares"] = shares
    outside = scoring.outside_mask(len(noisy), case.intervals, case.rate // 100)
    score["outside"] = bool(np.array_equal(out[outside], noisy_pcm[outside]))
    return score


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("probe")
    # fresh: both sets' material and motors again with other lenses, intervals and SNR rotation
    # (other seeds), for a last look at a change tuned on the other two.
    parser.add_argument("--set", default="all", choices=["main", "holdout", "all", "fresh"])
    parser.add_argument("--cases", default="")
    parser.add_argument("--shift", type=float, default=0.0, help="move the intervals by this many ms")
    parser.add_argument("-v", action="store_true", help="a line per case")
    args = parser.parse_args()
    global SHIFT_MS
    SHIFT_MS = args.shift
    sets = []
    if args.set in ("main", "all"):
        sets.append(("main", casebook.all_cases()))
    if args.set in ("holdout", "all"):
        sets.append(("holdout", casebook.holdout_cases()))
    if args.set == "fresh":
        sets.append(("fresh", casebook.all_cases(7000) + casebook.holdout_cases(9000)))
    clean_cache = {}
    for label, chosen in sets:
        chosen = [c for c in chosen if args.cases in c.name]
        if not chosen:
            continue
        sounds = [sound_of(c, clean_cache) for c in chosen]
        with ThreadPoolExecutor(2) as pool:
            scores = list(pool.map(lambda a: run(args.probe, *a), [(c, *s) for c, s in zip(chosen, sounds)]))
        means, worst, quiet, lsd, lsd_in = [], [], [], [], []
        for case, score in zip(chosen, scores):
            means.append(np.mean(score["sisdr_change"]))
            worst += score["sisdr_change"]
            quiet += score["quiet"]
            lsd.append(np.mean(score["lsd"]))
            lsd_in.append(np.mean(score["input_lsd"]))
            if args.v:
                audible = "".join("M" if a else "-" for a in case.motor_in)
                ivs = " ".join(f"{v:+5.1f}" for v in score["sisdr_change"])
                q = " ".join("exact" if v == float("inf") else f"{v:.1f}" for v in score["quiet"])
                sh = " ".join(f"{v:.2f}" for v in score["shares"])
                print(f"  {case.name:38s} {audible:4s} mean {means[-1]:+5.1f} [{ivs}] quiet [{q}] shares [{sh}]"
                      f"{'' if score['outside'] else ' OUTSIDE CHANGED'}")
        exact = sum(1 for v in quiet if v == float("inf"))
        finite = [v for v in quiet if v != float("inf")]
        print(f"{label}: {len(chosen)} cases, mean {np.mean(means):+.2f} dB, worst {min(worst):+.1f} dB, "
              f"below 0: {sum(1 for v in worst if v < -0.05)} of {len(worst)}, quiet bit-exact {exact}/{len(quiet)}"
              f"{' worst %.1f dB' % min(finite) if finite else ''}, LSD {np.mean(lsd):.2f} (input {np.mean(lsd_in):.2f})")


if __name__ == "__main__":
    main()
