"""Tables for bench/results.md: one row per method over all cases, one row per case, and
the goals the suppressor is to meet, each PASS or FAIL."""
import datetime
import os
import platform
import re
import subprocess

import numpy as np

from anchors import BLIND

LABELS = {"ours": "ours (tqovix process)", "afftdn": "ffmpeg afftdn (blind)", "anlmdn": "ffmpeg anlmdn (blind)",
          "webrtc": "WebRTC NS, GStreamer webrtcdsp (blind)", "rnnoise": "RNNoise, npm wasm (blind)",
          "sox": "sox noisered, true motor profile", "irm": "ideal ratio mask (oracle ceiling)"}
SECTION = "## Sound quality"
HOLDOUT_SECTION = "## Sound quality, held-out material and motors"


def _version(cmd, pattern=None):
    try:
        text = subprocess.run(cmd, capture_output=True, text=True, timeout=30).stdout + ""
    except (OSError, subprocess.SubprocessError):
        return "missing"
    line = text.strip().splitlines()[0] if text.strip() else "?"
    if pattern:
        found = re.search(pattern, text)
        return found.group(1) if found else line
    return line


def versions(tool, rnnoise_module):
    package = os.path.join(os.path.dirname(os.path.dirname(rnnoise_module)), "package.json")
    rn = "?"
    if os.path.exists(package):
        found = re.search(r'"version":\s*"([^"]+)"', open(package).read())
        rn = found.group(1) if found else "?"
    import numpy
    import scipy
    return ", ".join([
        _version([tool, "--version"]),
        "ffmpeg " + _version(["ffmpeg", "-version"], r"ffmpeg version (\S+)"),
        "sox " + _version(["sox", "--version"], r"v(\S+)"),
        "GStreamer " + _version(["gst-launch-1.0", "--version"], r"GStreamer (\S+)"),
        "espeak-ng " + _version(["espeak-ng", "--version"], r"text-to-speech: (\S+)"),
        "node " + _version(["node", "--version"]),
        "@shiguredo/rnnoise-wasm " + rn,
        f"Python {platform.python_version()}, numpy {numpy.__version__}, scipy {scipy.__version__}",
    ])


def machine():
    cpu = "?"
    try:
        for line in open("/proc/cpuinfo"):
            if line.startswith("model name"):
                cpu = line.split(":", 1)[1].strip()
                break
    except OSError:
        pass
    return f"{os.cpu_count()} cores, {cpu}, kernel {platform.release()}"


def _finite_min(values):
    values = [v for v in values if not np.isnan(v)]
    return min(values) if values else float("nan")


def summarise(entries, method):
    """Figures of one method over all cases; None when it failed everywhere."""
    ok = [e for e in entries if method == "input" or "error" not in e["methods"].get(method, {"error": 1})]
    if not ok:
        return None
    rec = lambda e: e["input"] if method == "input" else e["methods"][method]
    changes = [c for e in ok if e["codec"] != "aac" for c in rec(e)["sisdr_change"]]
    changes_aac = [c for e in ok if e["codec"] == "aac" for c in rec(e)["sisdr_change"]]
    quiet_pcm = [q for e in ok if e["codec"] != "aac" for q in rec(e)["quiet"]]
    quiet_aac = [q for e in ok if e["codec"] == "aac" for q in rec(e)["quiet"]]
    return {
        "cases": len(ok), "failed": len(entries) - len(ok),
        "mean": float(np.mean([np.mean(rec(e)["sisdr_change"]) for e in ok])),
        "worst": _finite_min(changes) if changes else float("nan"),
        "worst_aac": _finite_min(changes_aac) if changes_aac else float("nan"),
        "lsd": float(np.mean([np.mean(rec(e)["lsd"]) for e in ok])),
        "quiet_pcm": quiet_pcm, "quiet_aac": quiet_aac,
        "quiet_min": _finite_min(quiet_pcm) if quiet_pcm else float("inf"),
        "outside": [rec(e).get("outside_bit_exact") for e in ok if e["codec"] != "aac"],
        "process": sum(rec(e).get("process_seconds", 0) for e in ok),
        "sound": sum(e["seconds"] for e in ok),
    }


def _db(v, signed=True):
    if v == float("inf"):
        return "bit-exact"
    if np.isnan(v):
        return "n/a"
    return f"{v:+.1f} dB" if signed else f"{v:.1f} dB"


def _worst_text(s):
    text = _db(s["worst"])
    return text if np.isnan(s["worst_aac"]) else f"{text}; AAC: {_db(s['worst_aac'])}"


def _quiet_text(s):
    def part(values):
        exact = sum(1 for v in values if v == float("inf"))
        if exact == len(values):
            return f"bit-exact ({exact}/{len(values)})"
        return f"worst {_db(_finite_min(values), False)} ({exact}/{len(values)} bit-exact)"
    text = part(s["quiet_pcm"]) if s["quiet_pcm"] else "n/a"
    if s["quiet_aac"]:
        text += f"; AAC: {part(s['quiet_aac'])}"
    return text


def render(entries, methods, total_seconds, quick, tool, rnnoise_module, section=SECTION):
    summaries = {m: summarise(entries, m) for m in ["input"] + methods}
    lines = [section, ""]
    lines.append(f"Run {datetime.datetime.now().strftime('%Y-%m-%d %H:%M')} on {machine()}; "
                 f"{'quick set, ' if quick else ''}{len(entries)} cases, whole run {total_seconds:.0f} s.")
    lines.append(f"Versions: {versions(tool, rnnoise_module)}.")
    lines.append("")
    lines.append("Inside the AF intervals, against the clean sound (bench/quality/README.md says how the material,"
                 " the motors and the scores are made). SI-SDR change = result minus noisy input, mean over cases;"
                 " worst = the lowest change of any interval (PCM cases; AAC given apart: ours re-encodes the"
                 " packets around the sound it changes, a second generation of coding there);"
                 " no motor noise = AF intervals where the motor is silent,"
                 " result against input (PCM cases; AAC given apart);"
                 " log-spectral distance = mean over cases, lower is better.")
    lines.append("")
    lines.append("| method | mean SI-SDR change | worst | interval with no motor noise (SI-SDR of the result) "
                 "| log-spectral distance |")
    lines.append("|---|---|---|---|---|")
    s = summaries["input"]
    lines.append(f"| noisy input (reference) | +0.0 dB | +0.0 dB | bit-exact | {s['lsd']:.2f} dB |")
    for m in methods:
        s = summaries[m]
        if s is None:
            lines.append(f"| {LABELS[m]} | failed in every case | | | |")
            continue
        note = f" ({s['failed']} cases failed)" if s["failed"] else ""
        lines.append(f"| {LABELS[m]}{note} | {_db(s['mean'])} | {_worst_text(s)} | {_quiet_text(s)} "
                     f"| {s['lsd']:.2f} dB |")
    lines.append("")
    ours = summaries.get("ours")
    if ours:
        exact = sum(1 for v in ours["outside"] if v)
        speed = ours["sound"] / ours["process"] if ours["process"] > 0 else float("nan")
        lines.append(f"Ours outside the intervals and their 10 ms ramps: bit-exact in {exact} of "
                     f"{len(ours['outside'])} PCM cases. Processing time of ours: {ours['process']:.2f} s of "
                     f"`tqovix process` for {ours['sound']:.0f} s of sound ({speed:.0f}x real time, whole jobs"
                     " including reading and writing the movies).")
        lines.append("")
    goals, passed = goals_of(summaries, methods)
    lines.append("Goals for ours:")
    lines.append("")
    for ok, text in goals:
        lines.append(f"- {'PASS' if ok else 'FAIL'}: {text}")
    lines.append("")
    lines.append("Per case: SI-SDR of the noisy input in its motor intervals, then each method's SI-SDR change"
                 " (mean over the case's motor intervals); ours' log-spectral distance beside the input's, its"
                 " motor-free interval, whether it is bit-exact outside, and its job time.")
    lines.append("")
    head = ["case", "input SI-SDR"] + methods + ["ours LSD (input)", "ours no motor", "ours outside", "ours job"]
    lines.append("| " + " | ".join(head) + " |")
    lines.append("|" + "---|" * len(head))
    for e in entries:
        row = [e["name"], _db(float(np.mean(e["input"]["sisdr"])), False)]
        for m in methods:
            r = e["methods"].get(m, {})
            row.append("error" if "error" in r else _db(float(np.mean(r["sisdr_change"]))))
        r = e["methods"].get("ours", {})
        if "error" in r or not r:
            row += [r.get("error", "n/a").replace("|", "/")[:60], "", "", ""]
        else:
            row.append(f"{np.mean(r['lsd']):.2f} ({np.mean(e['input']['lsd']):.2f})")
            row.append(", ".join(_db(q, False) for q in r["quiet"]) or "none")
            row.append("n/a (AAC)" if e["codec"] == "aac" else ("bit-exact" if r.get("outside_bit_exact") else "CHANGED"))
            row.append(f"{r['process_seconds']:.2f} s")
        lines.append("| " + " | ".join(row) + " |")
    errors = sorted({f"{m}: {e['methods'][m]['error']}" for e in entries for m in methods
                     if "error" in e["methods"].get(m, {})})
    if errors:
        lines.append("")
        lines.append("Failures: " + "; ".join(errors[:8]) + ".")
    return "\n".join(lines) + "\n", passed


def goals_of(summaries, methods):
    ours = summaries.get("ours")
    if ours is None:
        return [(False, "ours produced no result")], False
    others = [m for m in methods if m not in ("ours", "irm") and summaries.get(m)]
    blind = [m for m in BLIND if m in methods and summaries.get(m)]
    best_other = max((summaries[m]["mean"] for m in others), default=float("-inf"))
    lsd_bar = min([summaries["input"]["lsd"]] + [summaries[m]["lsd"] for m in blind])
    quiet_ok = all(v == float("inf") or v >= 35 for v in ours["quiet_pcm"])
    goals = [
        (ours["failed"] == 0, f"every case processed ({ours['cases']} of {ours['cases'] + ours['failed']})"),
        (ours["mean"] >= 7 and ours["mean"] >= best_other + 1,
         f"mean SI-SDR change >= +7 dB and >= 1 dB ahead of every anchor but the ideal mask "
         f"(ours {_db(ours['mean'])}, best anchor {_db(best_other)})"),
        (ours["worst"] >= 0, f"worst interval >= 0 dB, PCM (ours {_worst_text(ours)})"),
        (quiet_ok, f"intervals without motor noise bit-exact or >= 35 dB, PCM (ours: {_quiet_text(ours)})"),
        (ours["lsd"] < lsd_bar, f"log-spectral distance below the noisy input's and every blind anchor's "
                                f"(ours {ours['lsd']:.2f} dB, lowest of those {lsd_bar:.2f} dB)"),
        (all(ours["outside"]), "bit-exact outside the intervals and ramps in every PCM case"),
    ]
    return goals, all(ok for ok, _ in goals)


def replace_section(path, text):
    """Replaces the section `text` heads (up to the next heading of its level or above), or appends it."""
    heading = text.splitlines()[0]
    old = open(path).read() if os.path.exists(path) else "# Benchmark results\n"
    lines = old.splitlines(keepends=True)
    start = next((i for i, l in enumerate(lines) if l.rstrip() == heading), None)
    if start is None:
        body = old.rstrip("\n") + "\n\n" + text
    else:
        end = next((i for i in range(start + 1, len(lines)) if re.match(r"#{1,2} ", lines[i])), len(lines))
        body = "".join(lines[:start]) + text + ("\n" + "".join(lines[end:]) if end < len(lines) else "")
    with open(path, "w") as f:
        f.write(body)
