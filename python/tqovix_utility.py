"""Remove autofocus noise from the sound of camera movies, through libTqOVIXUtility.

    import tqovix_utility
    verdict = tqovix_utility.check("clip.mov")       # Verdict(code=0, message='success')
    tqovix_utility.process("clip.mov", "out.mov", progress=lambda percent: True)

process() raises tqovix_utility.Error (with .code, the library's exported result code, and
.message) when a job is refused, fails or is aborted; the destination's path is then left as
it was. The library runs one job per process, so calls from several threads take turns.

The library is looked for, in this order: the file named by $TQOVIX_UTILITY_LIBRARY; beside
this module and in the library folder of the prefix it is installed in; the newest
unsanitized build under the source tree's build folder; the system's loader.
"""

import ctypes
import ctypes.util
import glob
import os
import threading
import time
from typing import Callable, NamedTuple, Optional

__all__ = ["Error", "Verdict", "check", "process", "describe", "library_path"]

_SONAME = "libTqOVIXUtility.so.0"
_POLL_SECONDS = 0.005

_MESSAGES = {
    0: "success",
    7: "the processing library cannot use its AF information",
    8: "no AF information, or not a camera movie the library accepts",
    9: "the processing library cannot use its AF information",
    20: "already processed",
    100: "out of memory",
    110: "file not found",
    111: "destination directory not found",
    120: "access to the file denied",
    121: "access to the destination denied",
    130: "not enough free space on the destination volume",
    131: "the destination file system cannot hold a file that large",
    190: "not a movie file or an internal error",
    200: "aborted",
}

ABORTED = 200


def describe(code: int) -> str:
    """The tool's wording for an exported result code."""
    return _MESSAGES.get(code, "unexpected result %d" % code)


class Error(Exception):
    """A job or query that did not succeed: .code is the exported result code."""

    def __init__(self, code: int, path: str = ""):
        self.code = code
        self.message = describe(code)
        self.path = path
        super().__init__("%s: %s (%d)" % (path, self.message, code) if path else "%s (%d)" % (self.message, code))


class Verdict(NamedTuple):
    """The property query's answer: code 0 means a job on the movie will start."""

    code: int
    message: str

    @property
    def processable(self) -> bool:
        return self.code == 0


_PROGRESS = ctypes.CFUNCTYPE(ctypes.c_int, ctypes.c_int, ctypes.c_int)


def _sanitized(build: str) -> bool:
    # A sanitizer's runtime cannot be loaded into an uninstrumented interpreter: it stops it.
    try:
        with open(os.path.join(build, "CMakeCache.txt"), encoding="utf-8", errors="replace") as cache:
            return any(line.startswith("TQOVIX_SANITIZE:") and line.strip().split("=", 1)[1] for line in cache)
    except OSError:
        return True


def _candidates():
    named = os.environ.get("TQOVIX_UTILITY_LIBRARY")
    if named:
        yield named
        return
    here = os.path.dirname(os.path.abspath(__file__))
    # Installed: <prefix>/lib/python3/dist-packages, the library in <prefix>/lib.
    for folder in (here, os.path.join(here, "..", "..")):
        yield os.path.join(folder, _SONAME)
    root = os.path.dirname(here)
    built = []
    patterns = (os.path.join(root, "build*", "lib", _SONAME), os.path.join(root, "build*", "*", "lib", _SONAME))
    for library in (found for pattern in patterns for found in glob.glob(pattern)):
        build = os.path.dirname(os.path.dirname(library))
        if not _sanitized(build):
            built.append((os.path.getmtime(library), library))
    for _, library in sorted(built, reverse=True):
        yield library
    yield ctypes.util.find_library("TqOVIXUtility") or _SONAME


def _load():
    tried = []
    for candidate in _candidates():
        if os.sep in candidate and not os.path.exists(candidate):
            tried.append(candidate)
            continue
        try:
            return ctypes.CDLL(candidate), os.path.normpath(candidate) if os.sep in candidate else candidate
        except OSError as error:
            tried.append("%s (%s)" % (candidate, error))
    raise OSError("libTqOVIXUtility not found; set TQOVIX_UTILITY_LIBRARY. Tried: " + ", ".join(tried))


_lock = threading.Lock()
_library = None
_library_path = None


def _api():
    global _library, _library_path
    if _library is None:
        library, path = _load()
        for name, result, arguments in (
            ("TqInitializeOVIX", ctypes.c_int, []),
            ("TqCloseOVIX", None, []),
            ("TqGetPropertyOVIX", ctypes.c_int, [ctypes.c_char_p]),
            ("TqSetCallBackNotifyProgressOVIX", ctypes.c_int, [_PROGRESS]),
            ("TqExecuteOVIX", ctypes.c_int, [ctypes.c_char_p, ctypes.c_char_p]),
            ("TqIsFinishedOVIX", ctypes.c_int, []),
            ("TqAbortOVIX", None, []),
            ("TqGetProgressOVIX", ctypes.c_int, [ctypes.POINTER(ctypes.c_int), ctypes.POINTER(ctypes.c_int)]),
        ):
            function = getattr(library, name)
            function.restype = result
            function.argtypes = arguments
        _library, _library_path = library, path
    return _library


def library_path() -> str:
    """The file the module loaded."""
    with _lock:
        _api()
        return _library_path


def _encode(path) -> bytes:
    return os.fsencode(path)


class _Session:
    """One initialised engine, closed on leaving; closing stops a job still running."""

    def __init__(self):
        self.api = _api()

    def __enter__(self):
        code = self.api.TqInitializeOVIX()
        if code != 0:
            raise Error(code)
        return self.api

    def __exit__(self, *exc):
        self.api.TqCloseOVIX()
        return False


def check(path) -> Verdict:
    """Whether a job on the movie at path will start, and if not, why."""
    with _lock, _Session() as api:
        code = api.TqGetPropertyOVIX(_encode(path))
    return Verdict(code, describe(code))


def process(source, destination, progress: Optional[Callable[[int], object]] = None) -> None:
    """Run one job to its end, writing destination (replacing a file there).

    progress(percent) is called on the library's thread whenever the whole percentage
    grows; returning False aborts the job (Error with code 200). An exception raised by
    progress aborts the job too and is raised again here.
    """
    state = {"last": -1, "raised": None}

    def notify(done: int, total: int) -> int:
        # Frame counts come as unsigned 32-bit values in ints.
        done &= 0xFFFFFFFF
        total &= 0xFFFFFFFF
        percent = min(100, done * 100 // total) if total else 0
        if percent <= state["last"]:
            return 0
        state["last"] = percent
        try:
            return 0 if progress(percent) is not False else ABORTED
        except BaseException as error:
            state["raised"] = error
            return ABORTED

    callback = _PROGRESS(notify)  # kept alive until the engine is closed
    with _lock, _Session() as api:
        if progress is not None:
            api.TqSetCallBackNotifyProgressOVIX(callback)
        code = api.TqExecuteOVIX(_encode(source), _encode(destination))
        try:
            while code == 0:
                code = api.TqIsFinishedOVIX()
                if code == 0:
                    time.sleep(_POLL_SECONDS)
        except BaseException:
            # Ctrl-C while waiting: closing the session below stops the job and drops its file.
            api.TqAbortOVIX()
            raise
    if state["raised"] is not None:
        raise state["raised"]
    if code != 1:
        path = destination if code in (111, 121, 130, 131) else source
        raise Error(code, os.fsdecode(path))
    if progress is not None and state["last"] < 100:
        progress(100)
