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
        else:
            x = (self._norm(self._stepper(frames, rng)) + 0.6 * self._norm(self._clicks(frames, rng)) +
                 0.4 * self._norm(self._hiss(frames, rng)))
        # Start-up and stop clicks, a few ms inside the drive.
        for at in (int(self.rate * rng.uniform(0.002, 0.01)), frames - int(self.rate * rng.uniform(0.015, 0.03))):
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
