"""Jobs through the Python module, judged by ffprobe and by the command-line tool.

Run by ctest with TQOVIX_UTILITY_LIBRARY and TQOVIX_TOOL naming the built library and tool;
exits 77 (skipped) when the library is built with a sanitizer.
"""

import json
import os
import pathlib
import shutil
import subprocess
import sys
import tempfile
import unittest

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
import tqovix_utility  # noqa: E402

TOOL = os.environ.get("TQOVIX_TOOL", "tqovix")


def make_sample(path, *options):
    subprocess.run([TOOL, "make-sample", path, "--seconds", "3", *options], check=True, stdout=subprocess.DEVNULL)


def ffprobe_streams(path):
    probe = subprocess.run(["ffprobe", "-v", "error", "-show_entries", "stream=codec_type", "-of", "csv=p=0", path],
                           capture_output=True, text=True)
    return probe.returncode, probe.stdout.split(), probe.stderr


class ModuleTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.samples = tempfile.mkdtemp(prefix="tqovix-python-")
        cls.pcm = os.path.join(cls.samples, "pcm.mov")
        cls.aac = os.path.join(cls.samples, "aac.mov")
        make_sample(cls.pcm)
        make_sample(cls.aac, "--aac")

    @classmethod
    def tearDownClass(cls):
        shutil.rmtree(cls.samples)

    def setUp(self):
        self.folder = tempfile.mkdtemp(prefix="tqovix-python-job-")
        self.addCleanup(shutil.rmtree, self.folder)

    def path(self, name):
        return os.path.join(self.folder, name)

    def test_job_writes_a_movie_ffprobe_reads_and_reports_rising_progress(self):
        for source in (self.pcm, self.aac):
            with self.subTest(source=os.path.basename(source)):
                destination = self.path("out-" + os.path.basename(source))
                seen = []
                tqovix_utility.process(source, destination, progress=seen.append)
                code, streams, errors = ffprobe_streams(destination)
                self.assertEqual((code, streams, errors), (0, ["video", "audio"], ""))
                self.assertEqual(seen, sorted(set(seen)))
                self.assertEqual(seen[-1], 100)
                self.assertEqual(tqovix_utility.check(destination), (20, "already processed"))

    def test_check_answers_as_the_tool_does(self):
        # The tool's words for a refusal are DescribeResult's; the module must say the same.
        processed = self.path("processed.mov")
        tqovix_utility.process(self.pcm, processed)
        missing = self.path("missing.mov")
        self.assertEqual(tqovix_utility.check(self.pcm), (0, "success"))
        self.assertTrue(tqovix_utility.check(self.pcm).processable)
        for path, code in ((processed, 20), (missing, 110)):
            with self.subTest(code=code):
                verdict = tqovix_utility.check(path)
                self.assertEqual(verdict.code, code)
                told = subprocess.run([TOOL, "check", path], capture_output=True, text=True).stdout
                self.assertEqual(told.strip(), "%s: not processable: %s" % (path, verdict.message))

    def test_callback_answering_false_aborts_with_200_and_keeps_the_destination(self):
        destination = self.path("kept.mov")
        with open(destination, "wb") as kept:
            kept.write(b"earlier")
        calls = []

        def stop_at_thirty(percent):
            calls.append(percent)
            return percent < 30

        with self.assertRaises(tqovix_utility.Error) as raised:
            tqovix_utility.process(self.aac, destination, progress=stop_at_thirty, overwrite=True)
        self.assertEqual((raised.exception.code, raised.exception.message), (200, "aborted"))
        # Stopped mid-job, at the first answer of False: no call after it.
        self.assertGreater(len(calls), 1)
        self.assertEqual([percent >= 30 for percent in calls].index(True), len(calls) - 1)
        with open(destination, "rb") as kept:
            self.assertEqual(kept.read(), b"earlier")
        self.assertEqual(os.listdir(self.folder), ["kept.mov"])

    def test_exception_in_callback_aborts_and_reaches_the_caller(self):
        destination = self.path("raised.mov")

        def broken(percent):
            raise KeyError("from the callback")

        with self.assertRaises(KeyError):
            tqovix_utility.process(self.pcm, destination, progress=broken)
        self.assertFalse(os.path.exists(destination))
        # The engine was closed: the next job runs.
        tqovix_utility.process(self.pcm, destination)
        self.assertEqual(tqovix_utility.check(destination).code, 20)

    def test_a_file_at_the_destination_is_kept_unless_overwrite(self):
        # "late": made by the callback while the job runs, as a second program would.
        for when, overwrite in (("before", False), ("late", False), ("before", True), ("late", True)):
            with self.subTest(when=when, overwrite=overwrite):
                folder = tempfile.mkdtemp(dir=self.folder)
                destination = os.path.join(folder, "out.mov")
                if when == "before":
                    with open(destination, "wb") as theirs:
                        theirs.write(b"theirs")
                calls = []

                def make_theirs(percent):
                    if not calls and when == "late":
                        with open(destination, "xb") as theirs:
                            theirs.write(b"theirs")
                    calls.append(percent)
                    return True

                options = {"overwrite": True} if overwrite else {}
                if overwrite:
                    tqovix_utility.process(self.pcm, destination, make_theirs, **options)
                    self.assertEqual(tqovix_utility.check(destination).code, 20)
                else:
                    with self.assertRaises(tqovix_utility.DestinationExists) as raised:
                        tqovix_utility.process(self.pcm, destination, make_theirs, **options)
                    self.assertIsInstance(raised.exception, FileExistsError)
                    self.assertIsInstance(raised.exception, tqovix_utility.Error)
                    self.assertEqual(raised.exception.path, destination)
                    self.assertEqual(str(raised.exception), destination + ": " + raised.exception.message)
                    self.assertIn("the destination exists", raised.exception.message)
                    with open(destination, "rb") as theirs:
                        self.assertEqual(theirs.read(), b"theirs")
                    # Refused before the job: the library was never asked.
                    self.assertEqual(calls == [], when == "before")
                self.assertEqual(os.listdir(folder), ["out.mov"])

    def test_paths_as_str_bytes_and_path_like_and_never_with_a_nul(self):
        accepted = (
            ("str", self.path("str.mov")),
            ("longest name", self.path("\u00e9" * 123 + ".mov")),
            ("bytes", os.fsencode(self.path("bytes\xff.mov"))),
            ("PathLike", pathlib.Path(self.path("path.mov"))),
        )
        for name, destination in accepted:
            with self.subTest(name):
                tqovix_utility.process(destination.__class__(self.pcm) if name != "bytes" else os.fsencode(self.pcm),
                                       destination)
                self.assertEqual(tqovix_utility.check(destination).code, 20)
        with open(self.path("out.mov"), "wb") as kept:
            kept.write(b"kept")
        embedded = (
            ("check", lambda: tqovix_utility.check(self.pcm + "\x00.txt")),
            ("check bytes", lambda: tqovix_utility.check(os.fsencode(self.pcm) + b"\x00")),
            ("process source", lambda: tqovix_utility.process(self.pcm + "\x00.txt", self.path("new.mov"))),
            ("process destination", lambda: tqovix_utility.process(self.pcm, self.path("new.mov\x00.txt"))),
            ("process replacing", lambda: tqovix_utility.process(self.pcm, self.path("out.mov\x00.txt"), overwrite=True)),
            ("PathLike", lambda: tqovix_utility.process(self.pcm, pathlib.Path(self.path("new.mov\x00")))),
        )
        for name, call in embedded:
            with self.subTest(name):
                with self.assertRaises(ValueError):
                    call()
        self.assertFalse(os.path.exists(self.path("new.mov")))
        with open(self.path("out.mov"), "rb") as kept:
            self.assertEqual(kept.read(), b"kept")
        with self.assertRaises(TypeError):
            tqovix_utility.check(42)

    def test_destination_problems_name_the_destination(self):
        # Read-only places that root cannot write either.
        blocker = self.path("plain-file")
        with open(blocker, "w") as plain:
            plain.write("a file, not a folder\n")
        rows = (
            ("parent is a file", os.path.join(blocker, "out.mov")),
            ("under /proc", "/proc/tqovix-out.mov"),
            ("a folder", self.folder),
        )
        for name, destination in rows:
            with self.subTest(name):
                with self.assertRaises(tqovix_utility.Error) as raised:
                    tqovix_utility.process(self.pcm, destination)
                self.assertEqual(raised.exception.path, destination)
                self.assertTrue(str(raised.exception).startswith(destination + ": "), str(raised.exception))
                self.assertNotIn(self.pcm, str(raised.exception))
                self.assertIn(raised.exception.code, (111, 121, 130, 131, 190))
                self.assertNotEqual(raised.exception.message, tqovix_utility.describe(190))
        self.assertEqual(os.listdir(self.folder), ["plain-file"])
        with self.assertRaises(tqovix_utility.Error) as raised:
            tqovix_utility.process(self.pcm, self.pcm, overwrite=True)
        self.assertEqual(raised.exception.message, "source and destination are the same file")

    def tool_process_json(self, source, destination):
        told = subprocess.run([TOOL, "process", "--json", "-q", source, destination], capture_output=True, text=True)
        return json.loads(told.stdout)

    def test_every_reason_is_worded_as_the_tool_words_it(self):
        # Each row makes (source, destination) in a folder of its own; both hosts are asked about
        # the same files, and each leaves them as they were.
        def missing(folder):
            return os.path.join(folder, "missing.mov"), os.path.join(folder, "out.mov")

        def folder_source(folder):
            os.mkdir(os.path.join(folder, "clips.mov"))
            return os.path.join(folder, "clips.mov"), os.path.join(folder, "out.mov")

        def same_file(folder):
            shutil.copy(self.pcm, os.path.join(folder, "in.mov"))
            return os.path.join(folder, "in.mov"), os.path.join(folder, "in.mov")

        def folder_destination(folder):
            # The tool writes into a folder named as destination: this one holds a folder by
            # the source's name too, so that both hosts meet a folder.
            os.makedirs(os.path.join(folder, "out", os.path.basename(self.pcm)))
            return self.pcm, os.path.join(folder, "out")

        def no_directory(folder):
            return self.pcm, os.path.join(folder, "absent", "out.mov")

        def read_only(folder):
            os.mkdir(os.path.join(folder, "locked"), 0o500)
            return self.pcm, os.path.join(folder, "locked", "out.mov")

        def existing(folder):
            with open(os.path.join(folder, "out.mov"), "wb") as theirs:
                theirs.write(b"theirs")
            return self.pcm, os.path.join(folder, "out.mov")

        def written(name, content):
            def make(folder):
                with open(os.path.join(folder, name), "wb") as made:
                    made.write(content(folder))
                return os.path.join(folder, name), os.path.join(folder, "out.mov")
            return make

        def sample_bytes():
            with open(self.pcm, "rb") as sample:
                return bytearray(sample.read())

        def wrong_brand(folder):
            data = sample_bytes()
            self.assertEqual(data[4:8], b"ftyp")
            data[8:12] = b"isom"
            return bytes(data)

        def without_af(folder):
            data = sample_bytes()
            self.assertEqual(data.count(b"OP01"), 1)
            return bytes(data.replace(b"OP01", b"XP01"))

        def processed(folder):
            tqovix_utility.process(self.pcm, os.path.join(folder, "made.mov"))
            with open(os.path.join(folder, "made.mov"), "rb") as made:
                return made.read()

        rows = (
            ("missing source", missing, "source-missing", 110),
            ("folder source", folder_source, "source-is-directory", 190),
            ("same file", same_file, "same-file", 190),
            ("destination is a folder", folder_destination, "destination-is-directory", 190),
            ("destination directory missing", no_directory, "destination-directory-missing", 111),
            ("read-only destination", read_only, "destination-access-denied", 121),
            ("existing destination", existing, "destination-exists", None),
            ("not a movie", written("notes.mov", lambda folder: b"not a movie at all\n"), "not-a-movie", 8),
            ("wrong brand", written("isom.mov", wrong_brand), "wrong-brand", 8),
            ("truncated", written("cut.mov", lambda folder: bytes(sample_bytes()[:300000])), "truncated", 8),
            ("already processed", written("again.mov", processed), "already-processed", 20),
            ("no AF information", written("plain.mov", without_af), "no-af-information", 8),
        )
        for name, make, key, code in rows:
            with self.subTest(name):
                if key == "destination-access-denied" and os.geteuid() == 0:
                    self.skipTest("root writes a read-only folder")
                folder = tempfile.mkdtemp(dir=self.folder)
                source, destination = make(folder)
                before = sorted(os.listdir(folder))
                told = self.tool_process_json(source, destination)
                self.assertEqual((told["reason"], told["result"]), (key, code), told)
                with self.assertRaises(tqovix_utility.Error) as raised:
                    tqovix_utility.process(source, destination)
                error = raised.exception
                self.assertEqual((error.reason, error.code), (key, code))
                if key == "destination-exists":
                    # The words are one; each host names its own way of replacing.
                    self.assertIsInstance(error, FileExistsError)
                    self.assertEqual(error.message, told["message"].replace("--force", "overwrite=True"))
                else:
                    self.assertEqual(error.message, told["message"])
                about_destination = key.startswith("destination-") or key == "same-file"
                self.assertEqual(error.path, destination if about_destination else source)
                self.assertEqual(sorted(os.listdir(folder)), before)

    def test_check_gives_the_reason_with_its_words(self):
        with open(self.path("notes.mov"), "w") as notes:
            notes.write("not a movie\n")
        for path, code, key in ((self.pcm, 0, "none"), (self.path("notes.mov"), 8, "not-a-movie")):
            with self.subTest(key):
                verdict = tqovix_utility.check(path)
                self.assertEqual((verdict.code, verdict.reason), (code, key))
                told = subprocess.run([TOOL, "check", "--json", path], capture_output=True, text=True).stdout
                row = json.loads(told)["files"][0]
                self.assertEqual((row["code"], row["reason"]), (code, key))
                self.assertEqual(verdict.message, row["message"] or "success")


if __name__ == "__main__":
    if os.environ.get("TQOVIX_SANITIZE"):
        print("SKIPPED: python3 cannot load a library built with -fsanitize=" + os.environ["TQOVIX_SANITIZE"])
        sys.exit(77)
    unittest.main()
