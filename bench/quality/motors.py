"""Lens-motor noise models.

A clip has one lens: `Lens(kind, rate, seed)` draws the lens' parameters once, and
`lens.drive(frames, rng)` renders the motor's sound for one AF interval with small
variations (speed, travel, level), so all intervals of a clip sound like the same motor.

- stepper: a stepping motor's whine.  The step rate follows a trapezoidal speed profile
  (accelerate, cruise, decelerate), fundamental between ~150 and ~2000 Hz, a lens-specific
  set of harmonics and a little speed jitter.
- clicks: micro-stepping ticks, periodic short resonant transients (a few kHz, ~2 ms) at
  a rate of tens per second with jittered timing and level.
- hiss: a voice-coil actuator's hiss, band-limited noise gated on and off as the coil is
  driven in short bursts.
- gear: low rumble of a geared drive: low-passed noise, a gear-mesh tone with harmonics
  wobbling with the rotation, and a faint tooth tick.
- mix: stepper whine, micro-step clicks and hiss of one lens together.
Every drive starts and stops with a click (a damped resonance with a broadband edge).
Stereo: the second microphone hears the same motor through a slightly different path.
"""
import numpy as np
from scipy import signal

KINDS = ["stepper", "clicks", "hiss", "gear", "mix"]
# Motors the suppressor was never tuned on (--holdout): a check that it learns the lens in front
# of it rather than the five above.
HOLDOUT_KINDS = ["squeal", "brushed", "hunting", "buzz", "whir"]


def _click(rate, rng, centre, ms, level):
    n = int(rate * ms / 1000)
    t = np.arange(n) / rate
    ring = np.sin(2 * np.pi * centre * t) * np.exp(-t / (ms / 5000))
    edge = rng.standard_normal(n) * np.exp(-t / 0.0003) * 0.5
    return (ring + edge) * level


def _speed_profile(frames, accel_frac, rng):
    """0..1 speed: ramps up over accel_frac of the travel, cruises, ramps down."""
    up = max(int(frames * accel_frac * rng.uniform(0.8, 1.2)), 1)
    down = max(int(frames * accel_frac * rng.uniform(0.8, 1.2)), 1)
    s = np.ones(frames)
    s[:up] = np.linspace(0, 1, up) ** 0.7
    s[frames - down:] = np.minimum(s[frames - down:], np.linspace(1, 0, down) ** 0.7)
    return s


class Lens:
    def __init__(self, kind, rate, seed):
        self.kind = kind
        self.rate = rate
        rng = np.random.default_rng(seed)
        self.f_low = rng.uniform(150, 400)                 # step rate at start and stop
        self.f_high = rng.uniform(700, 2000)               # cruising step rate
        self.harmonics = [1.0] + list(rng.uniform(0.15, 0.7, 5) * (0.7 ** np.arange(5)))
        self.accel = rng.uniform(0.15, 0.35)
        self.click_rate = rng.uniform(25, 90)
        self.click_centre = rng.uniform(2000, 6000)
        self.hiss_band = sorted(rng.uniform(1200, 9000, 2))
        if self.hiss_band[1] < self.hiss_band[0] * 1.6:
            self.hiss_band[1] = self.hiss_band[0] * 1.6
        self.hiss_burst = rng.uniform(0.05, 0.25)
        self.gear_hz = rng.uniform(60, 180)
        self.rumble_cut = rng.uniform(150, 350)
        self.edge_centre = rng.uniform(1500, 4500)
        self.squeal_hz = rng.uniform(5000, 12000)
        self.brush_poles = int(rng.integers(3, 8))
        self.rotation_hz = rng.uniform(40, 120)
        self.buzz_hz = rng.uniform(700, 3500)
        self.buzz_duty = rng.uniform(0.2, 0.45)
        self.whir_band = sorted(rng.uniform(70, 600, 2))
        if self.whir_band[1] < self.whir_band[0] * 1.5:
            self.whir_band[1] = self.whir_band[0] * 1.5
        # The second microphone's path: a short, different FIR and a level offset.
        self.path = np.array([rng.uniform(0.6, 0.9), rng.uniform(0.1, 0.3), rng.uniform(-0.15, 0.1)])

    # Each model returns motor-only sound for `frames` frames, mono, unnormalised.
    def _stepper(self, frames, rng):
        speed = _speed_profile(frames, self.accel, rng)
        f = self.f_low + (self.f_high * rng.uniform(0.9, 1.1) - self.f_low) * speed
        f *= 1 + 0.003 * signal.lfilter([1], [1, -0.999], rng.standard_normal(frames)) / 30
        phase = 2 * np.pi * np.cumsum(f) / self.rate
        out = np.zeros(frames)
        for k, a in enumerate(self.harmonics, start=1):
            alias = f * k < self.rate / 2 - 500
            out += a * np.sin(k * phase) * alias
        return out * (0.4 + 0.6 * speed)

    def _clicks(self, frames, rng):
        out = np.zeros(frames)
        period = self.rate / (self.click_rate * rng.uniform(0.9, 1.1))
        pos = rng.uniform(0, period)
        while pos < frames:
            c = _click(self.rate, rng, self.click_centre * rng.uniform(0.97, 1.03), 2.5, rng.uniform(0.7, 1.0))
            p = int(pos)
            n = min(len(c), frames - p)
            out[p:p + n] += c[:n]
            pos += period * rng.uniform(0.92, 1.08)
        return out

    def _hiss(self, frames, rng):
        noise = signal.sosfilt(signal.butter(4, self.hiss_band, "bandpass", fs=self.rate, output="sos"),
                               rng.standard_normal(frames))
        gate = np.zeros(frames)
        pos = 0
        while pos < frames:
            on = int(self.rate * self.hiss_burst * rng.uniform(0.6, 1.4))
            gate[pos:pos + on] = 1
            pos += on + int(self.rate * self.hiss_burst * rng.uniform(0.2, 0.8))
        ramp = int(self.rate * 0.005)
        gate = np.convolve(gate, np.ones(ramp) / ramp, mode="same")
        return noise * gate

    def _gear(self, frames, rng):
        t = np.arange(frames) / self.rate
        rumble = signal.sosfilt(signal.butter(4, self.rumble_cut, "lowpass", fs=self.rate, output="sos"),
                                rng.standard_normal(frames))
        rumble /= max(np.std(rumble), 1e-12)
        hz = self.gear_hz * rng.uniform(0.95, 1.05)
        wobble = 1 + 0.3 * np.sin(2 * np.pi * hz / 12 * t)
        mesh = sum(a * np.sin(2 * np.pi * hz * k * t) for k, a in ((1, 1.0), (2, 0.6), (3, 0.35), (4, 0.2)))
        ticks = np.zeros(frames)
        ticks[::max(int(self.rate / (hz / 3)), 1)] = 1
        ticks = signal.lfilter(*signal.butter(2, [800, 2500], "bandpass", fs=self.rate), ticks) * 4
        return rumble + 0.8 * mesh * wobble + ticks

    def _squeal(self, frames, rng):
        """An ultrasonic ring motor: nearly silent but for a friction squeal, a high narrow tone
        wandering a little, with its second partial and a faint rub."""
        t = np.arange(frames) / self.rate
        f = self.squeal_hz * (1 + 0.01 * np.sin(2 * np.pi * rng.uniform(2, 7) * t + rng.uniform(0, 6)))
        f = np.minimum(f, self.rate / 2 - 1500)
        phase = 2 * np.pi * np.cumsum(f) / self.rate
        tone = np.sin(phase) + 0.3 * np.sin(2 * phase) * (2 * f < self.rate / 2 - 500)
        swell = 0.6 + 0.4 * np.abs(np.sin(2 * np.pi * rng.uniform(1, 4) * t))
        rub = signal.sosfilt(signal.butter(2, [2000, 7000], "bandpass", fs=self.rate, output="sos"),
                             rng.standard_normal(frames))
        return tone * swell + 0.5 * rub / max(np.std(rub), 1e-12) * 0.3

    def _brushed(self, frames, rng):
        """A brushed DC motor: commutation at poles x rotation with many partials, brush noise
        modulated by it, speed rising and falling over the drive."""
        speed = 0.5 + 0.5 * _speed_profile(frames, 0.3, rng)
        f = self.rotation_hz * self.brush_poles * speed
        phase = 2 * np.pi * np.cumsum(f) / self.rate
        comb = np.zeros(frames)
        for k in range(1, 13):
            comb += np.sin(k * phase + k) / k ** 0.8 * (f * k < self.rate / 2 - 500)
        brush = signal.sosfilt(signal.butter(2, [300, 6000], "bandpass", fs=self.rate, output="sos"),
                               rng.standard_normal(frames))
        brush *= (1 + np.sin(phase)) / max(np.std(brush), 1e-12)
        return comb / max(np.std(comb), 1e-12) + 0.5 * brush

    def _hunting(self, frames, rng):
        """Focus hunting: short stepper moves back and forth with pauses, each at its own speed."""
        out = np.zeros(frames)
        pos = 0
        while pos < frames:
            n = int(self.rate * rng.uniform(0.08, 0.3))
            n = min(n, frames - pos)
            if n < 16:
                break
            speed = _speed_profile(n, 0.3, rng)
            f = self.f_low + (self.f_high * rng.uniform(0.6, 1.0) - self.f_low) * speed
            phase = 2 * np.pi * np.cumsum(f) / self.rate
            move = np.zeros(n)
            for k, a in enumerate(self.harmonics, start=1):
                move += a * np.sin(k * phase) * (f * k < self.rate / 2 - 500)
            out[pos:pos + n] = move * (0.3 + 0.7 * speed)
            pos += n + int(self.rate * rng.uniform(0.03, 0.15))
        return out

    def _buzz(self, frames, rng):
        """A PWM-driven coil: a steady pulse train (odd and even partials by its duty) with a
        little drift."""
        t = np.arange(frames) / self.rate
        f = self.buzz_hz * (1 + 0.002 * np.sin(2 * np.pi * 0.7 * t))
        phase = np.cumsum(f) / self.rate % 1.0
        pulse = (phase < self.buzz_duty).astype(float) - self.buzz_duty
        pulse = signal.sosfilt(signal.butter(4, min(self.rate / 2 - 2000, 14000), "lowpass", fs=self.rate,
                                             output="sos"), pulse)
        return pulse

    def _whir(self, frames, rng):
        """A zoom or aperture drive: a low band of noise swelling with its load."""
        t = np.arange(frames) / self.rate
        band = signal.sosfilt(signal.butter(3, self.whir_band, "bandpass", fs=self.rate, output="sos"),
                              rng.standard_normal(frames))
        load = 0.7 + 0.3 * np.sin(2 * np.pi * rng.uniform(3, 9) * t + rng.uniform(0, 6))
        return band * load

    def _norm(self, x):
        return x / max(np.sqrt(np.mean(x ** 2)), 1e-12)

    def drive(self, frames, channels, rng):
        if self.kind == "stepper":
            x = self._norm(self._stepper(frames, rng))
        elif self.kind == "clicks":
            x = self._norm(self._clicks(frames, rng))
        elif self.kind == "hiss":
            x = self._norm(self._hiss(frames, rng))
        elif self.kind == "gear":
            x = self._norm(self._gear(frames, rng))
        elif self.kind in HOLDOUT_KINDS:
            x = self._norm(getattr(self, "_" + self.kind)(frames, rng))
        else:
            x = (self._norm(self._stepper(frames, rng)) + 0.6 * self._norm(self._clicks(frames, rng)) +
                 0.4 * self._norm(self._hiss(frames, rng)))
        # Start-up and stop clicks, a few ms inside the drive (a ring motor starts without one).
        for at in [] if self.kind == "squeal" else (int(self.rate * rng.uniform(0.002, 0.01)), frames - int(self.rate * rng.uniform(0.015, 0.03))):
            c = _click(self.rate, rng, self.edge_centre, 6, rng.uniform(3, 5))
            n = min(len(c), frames - at)
            x[at:at + n] += c[:n]
        fade = int(self.rate * 0.002)
        x[:fade] *= np.linspace(0, 1, fade)
        x[-fade:] *= np.linspace(1, 0, fade)
        if channels == 1:
            return x[:, None]
        other = signal.lfilter(self.path, [1.0], x)
        return np.stack([x, other], axis=1)
