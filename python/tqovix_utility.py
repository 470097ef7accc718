"""Remove autofocus noise from the sound of camera movies, through libTqOVIXUtility.

    import tqovix_utility
    verdict = tqovix_utility.check("clip.mov")       # Verdict(code=0, message='success')
    tqovix_utility.process("clip.mov", "out.mov", progress=lambda percent: True)

process() raises tqovix_utility.Error when a job is refused, fails or is aborted, with the
tool's reason: .reason (its stable key, as in the tool's JSON), .message (its words) and
.code (the exported code the reason stands for); the destination's path is then left as it
was. It never replaces a file at the destination, not even one that appears while the job
runs (DestinationExists, a FileExistsError), unless called with overwrite=True. Paths are str,
bytes or os.PathLike; one with a NUL character raises ValueError. The library runs one job
per process, so calls from several threads take turns.

The library is looked for, in this order: the file named by $TQOVIX_UTILITY_LIBRARY; beside
this module and in the library folder of the prefix it is installed in; the newest
unsanitized build under the source tree's build folder; the system's loader. The reasons
(libTqOVIXReasons.so.0, the tool's own) are looked for in the file named by
$TQOVIX_REASONS_LIBRARY, then beside the library that was loaded, then as the library is.
"""

import ctypes
import ctypes.util
import errno
import glob
import itertools
import os
import threading
import time
from typing import Callable, NamedTuple, Optional

__all__ = ["Error", "DestinationExists", "Verdict", "check", "process", "describe", "library_path"]

_SONAME = "libTqOVIXUtility.so.0"
_REASONS_SONAME = "libTqOVIXReasons.so.0"
# Keys, words and paths the reasons may hold are short; longer words are cut, never overrun.
_KEY_BYTES = 64
_TEXT_BYTES = 2048
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
_PARTIAL_SUFFIX = b".tqovix-partial"
# Of a long destination name, what the hidden name keeps: room is left for its own suffix and
# for the one the library adds where it writes under a hidden name itself (255 bytes in all).
_KEPT_NAME_BYTES = 160
_AT_FDCWD = -100
_RENAME_NOREPLACE = 1


def describe(code: int) -> str:
    """What an exported result code means in general; an Error's .message says why."""
    return _MESSAGES.get(code, "unexpected result %d" % code)


class Error(Exception):
    """A job or query that did not succeed: .reason is the tool's key for why (None only when
    the library did not start), .message its words, .code the exported code the reason stands
    for, .path the file it is about (the source, or the destination for its problems)."""

    def __init__(self, code: Optional[int], path: str = "", message: Optional[str] = None,
                 reason: Optional[str] = None):
        self.code = code
        self.reason = reason
        self.message = describe(code) if message is None else message
        self.path = path
        told = self.message if code is None else "%s (%d)" % (self.message, code)
        super().__init__("%s: %s" % (path, told) if path else told)


class DestinationExists(Error, FileExistsError):
    """process() without overwrite=True found a file at the destination, before or after the
    job; it is left as it was. .code is None: the library was not asked or said success."""

    def __init__(self, path: str, detail: Optional[str] = None):
        words = _reason_words("destination-exists")
        message = words + ": " + detail if detail else words + " (use overwrite=True to replace it)"
        super().__init__(None, path, message, "destination-exists")


class _VerdictFields(NamedTuple):
    code: int
    message: str


class Verdict(_VerdictFields):
    """The property query's answer: code 0 means a job on the movie will start. .reason is the
    tool's key for why not ("none" when it will); compared as the pair (code, message)."""

    def __new__(cls, code: int, message: str, reason: str = "none"):
        verdict = super().__new__(cls, code, message)
        verdict.reason = reason
        return verdict

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


def _candidates(soname: str = _SONAME, variable: str = "TQOVIX_UTILITY_LIBRARY", name: str = "TqOVIXUtility"):
    named = os.environ.get(variable)
    if named:
        yield named
        return
    here = os.path.dirname(os.path.abspath(__file__))
    # Installed: <prefix>/lib/python3/dist-packages, the library in <prefix>/lib.
    for folder in (here, os.path.join(here, "..", "..")):
        yield os.path.join(folder, soname)
    root = os.path.dirname(here)
    built = []
    patterns = (os.path.join(root, "build*", "lib", soname), os.path.join(root, "build*", "*", "lib", soname))
    for library in (found for pattern in patterns for found in glob.glob(pattern)):
        build = os.path.dirname(os.path.dirname(library))
        if not _sanitized(build):
            built.append((os.path.getmtime(library), library))
    for _, library in sorted(built, reverse=True):
        yield library
    yield ctypes.util.find_library(name) or soname


def _load(candidates=None):
    tried = []
    for candidate in _candidates() if candidates is None else candidates:
        if os.sep in candidate and not os.path.exists(candidate):
            tried.append(candidate)
            continue
        try:
            return ctypes.CDLL(candidate), os.path.normpath(candidate) if os.sep in candidate else candidate
        except OSError as error:
            tried.append("%s (%s)" % (candidate, error))
    what = "libTqOVIXUtility not found; set TQOVIX_UTILITY_LIBRARY" if candidates is None else \
        "libTqOVIXReasons not found; set TQOVIX_REASONS_LIBRARY"
    raise OSError(what + ". Tried: " + ", ".join(tried))


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


_reasons = None


def _reasons_candidates():
    if os.environ.get("TQOVIX_REASONS_LIBRARY"):
        yield os.environ["TQOVIX_REASONS_LIBRARY"]
        return
    # The one built or installed with the library loaded: their reasons and codes agree.
    _api()
    if os.sep in _library_path:
        yield os.path.join(os.path.dirname(_library_path), _REASONS_SONAME)
    yield from _candidates(_REASONS_SONAME, "TQOVIX_REASONS_LIBRARY", "TqOVIXReasons")


def _reasons_api():
    global _reasons
    if _reasons is None:
        library, _ = _load(_reasons_candidates())
        words = [ctypes.c_char_p, ctypes.c_size_t, ctypes.c_char_p, ctypes.c_size_t]
        for name, arguments in (
            ("TqovixExplain", [ctypes.c_int, ctypes.c_char_p, ctypes.c_char_p] + words),
            ("TqovixCheckDestination", [ctypes.c_char_p, ctypes.c_char_p, ctypes.c_int] + words),
            ("TqovixReasonWords", [ctypes.c_char_p, ctypes.c_char_p, ctypes.c_size_t]),
            ("TqovixAboutDestination", [ctypes.c_char_p]),
        ):
            function = getattr(library, name)
            function.restype = ctypes.c_int
            function.argtypes = arguments
        _reasons = library
    return _reasons


def _asked(function, *arguments):
    """(code, key, words) from one of the reasons' functions that fill a key and words."""
    key = ctypes.create_string_buffer(_KEY_BYTES)
    text = ctypes.create_string_buffer(_TEXT_BYTES)
    code = function(*arguments, key, _KEY_BYTES, text, _TEXT_BYTES)
    return code, key.value.decode("utf-8", "replace"), text.value.decode("utf-8", "replace")


def _failure(code: int, source: bytes, destination: Optional[bytes]) -> Error:
    """The library's answer code for a job (destination None: a query) as the tool explains it."""
    reasons = _reasons_api()
    result, key, words = _asked(reasons.TqovixExplain, code, source, destination)
    about = destination is not None and reasons.TqovixAboutDestination(key.encode()) == 1
    return Error(result, os.fsdecode(destination if about else source), words, key)


def _reason_words(key: str) -> str:
    text = ctypes.create_string_buffer(_TEXT_BYTES)
    _reasons_api().TqovixReasonWords(key.encode(), text, _TEXT_BYTES)
    return text.value.decode("utf-8", "replace")


def library_path() -> str:
    """The file the module loaded."""
    with _lock:
        _api()
        return _library_path


def _encode(path) -> bytes:
    encoded = os.fsencode(path)
    # C would read only up to the NUL: another file than the one named.
    if b"\0" in encoded:
        raise ValueError("embedded null byte")
    return encoded


_libc = ctypes.CDLL(None, use_errno=True)
_renameat2 = getattr(_libc, "renameat2", None)
if _renameat2 is not None:
    _renameat2.restype = ctypes.c_int
    _renameat2.argtypes = [ctypes.c_int, ctypes.c_char_p, ctypes.c_int, ctypes.c_char_p, ctypes.c_uint]
_partials = itertools.count(1)


def _reserve_partial(destination: bytes) -> bytes:
    """A hidden name beside destination for the job to write, taken so no one else uses it.

    It has the form of the library's own partial files (".NAME.PID-N.tqovix-partial"), so
    that one left by a killed process is recognised and cleared like theirs."""
    folder, name = os.path.split(destination)
    if len(name) > _KEPT_NAME_BYTES:
        cut = _KEPT_NAME_BYTES
        while cut > 0 and name[cut] & 0xC0 == 0x80:
            cut -= 1  # not inside a UTF-8 character: FAT and exFAT refuse such names
        name = name[:cut]
    while True:
        hidden = os.path.join(folder, b".%s.%d-%d%s" % (name, os.getpid(), next(_partials), _PARTIAL_SUFFIX))
        try:
            os.close(os.open(hidden, os.O_CREAT | os.O_EXCL | os.O_WRONLY | os.O_CLOEXEC, 0o666))
            return hidden
        except FileExistsError:
            continue
        except OSError:
            return hidden  # the job fails on the folder too, and the library says why


def _publish_without_replacing(hidden: bytes, destination: bytes) -> None:
    """Gives the finished movie its name unless the name is taken (FileExistsError)."""
    if _renameat2 is not None:
        if _renameat2(_AT_FDCWD, hidden, _AT_FDCWD, destination, _RENAME_NOREPLACE) == 0:
            return
        number = ctypes.get_errno()
        if number not in (errno.EINVAL, errno.ENOSYS):
            raise OSError(number, os.strerror(number), destination)
    # No such rename on this file system: a hard link is refused on a taken name too.
    try:
        os.link(hidden, destination)
    except OSError as error:
        if error.errno not in (errno.EPERM, errno.EOPNOTSUPP, errno.ENOSYS):
            raise
        # Neither: the narrowest window left is a look just before the rename.
        if os.path.lexists(destination):
            raise FileExistsError(errno.EEXIST, os.strerror(errno.EEXIST), destination) from None
        os.rename(hidden, destination)
        return
    os.unlink(hidden)


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
    encoded = _encode(path)
    with _lock:
        with _Session() as api:
            code = api.TqGetPropertyOVIX(encoded)
        if code == 0:
            return Verdict(0, "success")
        error = _failure(code, encoded, None)
    return Verdict(code, error.message, error.reason)


def process(source, destination, progress: Optional[Callable[[int], object]] = None, *,
            overwrite: bool = False) -> None:
    """Run one job to its end, writing destination.

    A file at destination, or one that appears there while the job runs, is left as it was
    and raises DestinationExists, unless overwrite=True: then the finished movie replaces it.
    progress(percent) is called on the library's thread whenever the whole percentage
    grows; returning False aborts the job (Error with code 200). An exception raised by
    progress aborts the job too and is raised again here.
    """
    source_path, destination_path = _encode(source), _encode(destination)
    named = os.fsdecode(destination_path)
    with _lock:
        refused, key, words = _asked(_reasons_api().TqovixCheckDestination, source_path, destination_path,
                                     1 if overwrite else 0)
    if key == "destination-exists":
        raise DestinationExists(named)
    if key != "none":
        raise Error(refused, named, words, key)
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
    hidden = None
    try:
        with _lock:
            # The library's own publishing replaces a file that appeared meanwhile: when that
            # is not wanted, the job writes a hidden name, given its own name below only if free.
            if not overwrite:
                hidden = _reserve_partial(destination_path)
            with _Session() as api:
                if progress is not None:
                    api.TqSetCallBackNotifyProgressOVIX(callback)
                code = api.TqExecuteOVIX(source_path, destination_path if hidden is None else hidden)
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
                raise _failure(code, source_path, destination_path)
            if hidden is not None:
                try:
                    _publish_without_replacing(hidden, destination_path)
                except FileExistsError:
                    raise DestinationExists(named, "it appeared while the job ran") from None
                except OSError as error:
                    raise Error(190, named, _reason_words("write-failed") + ": " + error.strerror,
                                "write-failed") from None
                hidden = None
    finally:
        if hidden is not None:
            try:
                os.unlink(hidden)
            except OSError:
                pass
    if progress is not None and state["last"] < 100:
        progress(100)
