"""Sound-quality benchmark of the AF-noise suppressor: `scripts/bench quality [--quick]`.

For each case: clean material + lens-motor noise inside the AF intervals -> a movie written
by ffmpeg with our maker atoms -> `tqovix process` -> decoded and scored inside the
intervals against the clean sound, beside public denoisers run on the same noisy sound.
"""
import argparse
import json
import os
import shutil
import sys
import time

sys.dont_write_bytecode = True  # nothing generated beside the sources

import numpy as np

import anchors
import cases as casebook
import material
import motors
import movie
import report
import scoring
from wavio import from_int16, to_int16

METHODS = ["ours"] + anchors.ALL


def build_sound(case, clean_cache):
    key = (case.material, case.rate)
    if key not in clean_cache:
        seed = casebook.material_seed(case.material)
        clean_cache[key] = material.make(case.kind, case.rate, case.channels, casebook.SECONDS, seed)
    clean = clean_cache[key].copy()
    lens = motors.Lens(case.motor, case.rate, case.seed)
    rng = np.random.default_rng(case.seed + 7)
    motor_only = np.zeros_like(clean)
    for (start, end), audible in zip(case.intervals, case.motor_in):
        if not audible:
            continue
        m = lens.drive(end - start, case.channels, rng)
        gain = np.sqrt(np.sum(clean[start:end] ** 2) / np.sum(m ** 2) / 10 ** (case.snr / 10))
        motor_only[start:end] = m * gain
    peak = np.max(np.abs(clean + motor_only))
    if peak > 0.95:
        clean *= 0.95 / peak
        motor_only *= 0.95 / peak
    return clean, motor_only


def run_case(case, tool, work, ctx_base, clean_cache, methods):
    os.makedirs(work, exist_ok=True)
    clean, motor_only = build_sound(case, clean_cache)
    noisy_pcm = to_int16(clean + motor_only)
    af = [(s, e, 1000) for s, e in case.intervals]
    source, destination = os.path.join(work, "source.mov"), os.path.join(work, "processed.mov")
    movie.write_movie(source, noisy_pcm, case.rate, case.codec, af)
    decoded_in = movie.decode(source, case.channels)
    frames = len(noisy_pcm)
    # ffmpeg's AAC keeps its last packet whole when the sound does not fill it (44.1 kHz here):
    # the sound starts on time and runs a few hundred frames long, which scoring ignores.
    if len(decoded_in) < frames or (case.codec != "aac" and len(decoded_in) != frames):
        raise RuntimeError(f"{case.name}: ffmpeg wrote {len(decoded_in)} frames, not {frames}")
    decoded_full = decoded_in
    decoded_in = decoded_in[:frames]
    if case.codec != "aac" and not np.array_equal(decoded_in, noisy_pcm):
        raise RuntimeError(f"{case.name}: the PCM movie does not hold the sound written")
    noisy = from_int16(decoded_in)
    motor_iv = [iv for iv, a in zip(case.intervals, case.motor_in) if a]
    quiet_iv = [iv for iv, a in zip(case.intervals, case.motor_in) if not a]
    entry = {"name": case.name, "material": case.material, "motor": case.motor, "snr": case.snr,
             "codec": case.codec, "rate": case.rate, "channels": case.channels,
             "seconds": len(noisy) / case.rate, "intervals": case.intervals, "motor_in": case.motor_in,
             "input": scoring.score_case(noisy, noisy, clean, case.rate, motor_iv, quiet_iv), "methods": {}}
    ctx = dict(ctx_base, clean=clean, motor_only=motor_only)
    for name in methods:
        started = time.perf_counter()
        record = {}
        try:
            if name == "ours":
                seconds, error = movie.process(tool, source, destination)
                record["process_seconds"] = seconds
                if error:
                    raise RuntimeError(error.replace(f"tqovix: {source}: ", ""))
                decoded_out = movie.decode(destination, case.channels)
                if decoded_out.shape != decoded_full.shape:
                    raise RuntimeError(f"result has {len(decoded_out)} frames, not {len(decoded_full)}")
                decoded_out = decoded_out[:frames]
                result = from_int16(decoded_out)
                if case.codec != "aac":
                    outside = scoring.outside_mask(len(noisy), case.intervals, case.rate // 100)
                    record["outside_bit_exact"] = bool(np.array_equal(decoded_out[outside], decoded_in[outside]))
            else:
                result, record["latency"] = anchors.run(name, noisy, case.rate, work, ctx, case.intervals)
            record.update(scoring.score_case(result, noisy, clean, case.rate, motor_iv, quiet_iv))
        except Exception as error:  # a failing method is reported, the others still run
            record["error"] = str(error).splitlines()[-1] if str(error) else type(error).__name__
        record["seconds"] = time.perf_counter() - started
        entry["methods"][name] = record
    return entry


def main():
    parser = argparse.ArgumentParser(description=__doc__)
    parser.add_argument("--tool", required=True)
    parser.add_argument("--work", required=True)
    parser.add_argument("--rnnoise-module", required=True)
    parser.add_argument("--results", required=True, help="bench/results.md, whose Sound quality section is replaced")
    parser.add_argument("--quick", action="store_true")
    parser.add_argument("--holdout", action="store_true",
                        help="the held-out material and motors; its own section of the results")
    parser.add_argument("--only", default="", help="comma-separated methods (default all)")
    parser.add_argument("--strict", action="store_true", help="exit 1 when a goal is not met")
    parser.add_argument("--no-results", action="store_true", help="print the tables, leave bench/results.md")
    parser.add_argument("--report-only", action="store_true", help="render the last run's results.json again")
    args = parser.parse_args()
    saved_path = os.path.join(args.work, "results-holdout.json" if args.holdout else "results.json")
    section = report.HOLDOUT_SECTION if args.holdout else report.SECTION
    if args.report_only:
        with open(saved_path) as f:
            saved = json.load(f)
        methods = list(saved["entries"][0]["methods"]) if saved["entries"] else []
        text, passed = report.render(saved["entries"], methods, saved["seconds"], saved["quick"], args.tool,
                                     args.rnnoise_module, section)
        print(text)
        if not args.no_results:
            report.replace_section(args.results, text)
        return 1 if args.strict and not passed else 0
    chosen = casebook.holdout_cases() if args.holdout else (
        casebook.quick_cases() if args.quick else casebook.all_cases())
    methods = [m for m in METHODS if not args.only or m in args.only.split(",")]
    ctx = {"rnnoise_module": args.rnnoise_module}
    clean_cache, entries = {}, []
    started = time.perf_counter()
    for i, case in enumerate(chosen):
        work = os.path.join(args.work, f"case{i:02d}")
        shutil.rmtree(work, ignore_errors=True)
        t = time.perf_counter()
        entry = run_case(case, args.tool, work, ctx, clean_cache, methods)
        entries.append(entry)
        ours = entry["methods"].get("ours", {})
        change = np.mean(ours["sisdr_change"]) if "sisdr_change" in ours else float("nan")
        print(f"[{i + 1}/{len(chosen)}] {case.name}: ours {change:+.1f} dB"
              f"{' (' + ours['error'] + ')' if 'error' in ours else ''}, {time.perf_counter() - t:.1f} s",
              file=sys.stderr, flush=True)
        shutil.rmtree(work, ignore_errors=True)
    total = time.perf_counter() - started
    with open(saved_path, "w") as f:
        json.dump({"entries": entries, "seconds": total, "quick": args.quick}, f, indent=1, default=float)
    text, passed = report.render(entries, methods, total, args.quick, args.tool, args.rnnoise_module, section)
    print(text)
    if not args.no_results:
        report.replace_section(args.results, text)
    return 1 if args.strict and not passed else 0


if __name__ == "__main__":
    sys.exit(main())
