"""16-bit PCM in and out: WAV files for the anchors, raw interleaved for ffmpeg."""
import numpy as np
from scipy.io import wavfile


def read_wav(path):
    rate, x = wavfile.read(path)
    if x.dtype == np.int16:
        x = x.astype(np.float64) / 32768.0
    elif x.dtype == np.int32:
        x = x.astype(np.float64) / 2147483648.0
    else:
        x = x.astype(np.float64)
    return rate, x.reshape(len(x), -1)


def to_int16(x):
    return np.clip(np.round(x * 32768.0), -32768, 32767).astype(np.int16)


def write_wav(path, rate, x):
    """float32 is written as IEEE float (unclipped); other floats as 16-bit PCM."""
    if x.dtype not in (np.int16, np.float32):
        x = to_int16(x)
    wavfile.write(path, rate, x)


def from_int16(x):
    return x.astype(np.float64) / 32768.0
