"""What the measurements of the whole stack share: the daemons in a root of their own, processes and
what they cost, and a corpus that is the same wherever it is made."""

import ctypes
import json
import os
import pathlib
import random
import shutil
import signal
import socket
import struct
import subprocess
import sys
import tempfile
import threading
import time

DAEMONS = ("kavoelasticd", "kavocontentextractd", "evnotifyd", "fileindexd")
PATIENCE = 600.0  # Seconds: what takes longer has failed.
_TICK = os.sysconf("SC_CLK_TCK")


class Failure(Exception):
    """The measurement cannot go on; the text says why."""


def await_true(condition, what, seconds=PATIENCE, pause=0.02):
    """Asks until it is so, and gives what was answered."""
    until = time.monotonic() + seconds
    while True:
        answer = condition()
        if answer:
            return answer
        if time.monotonic() > until:
            raise Failure(f"{what}: not within {seconds:.0f} s")
        time.sleep(pause)


def percentile(values, percent):
    """The least of the values that no less than `percent` of them do not exceed."""
    ordered = sorted(values)
    return ordered[max(0, -(-len(ordered) * percent // 100) - 1)]


def load():
    with open("/proc/loadavg", encoding="ascii") as file:
        return file.read().split()[0]


class Report:
    """What a measurement says: text for people, or with `as_json` an object a line for each figure
    (the text goes to standard error then). A figure is judged by its ratio to the baseline where it
    has one; `aim` is the most that it may be."""

    def __init__(self, as_json, judges=True):
        self._as_json = as_json
        self._judges = judges

    def say(self, text):
        print(text, file=sys.stderr if self._as_json else sys.stdout, flush=True)

    def figure(self, case, value, unit, baseline=None, aim=None):
        ratio = value / baseline if baseline else None
        judged = value if ratio is None else ratio
        met = judged <= aim if aim is not None and self._judges else None
        if self._as_json:
            line = {
                "case": case,
                "value": value,
                "unit": unit,
                "baseline": baseline,
                "ratio": ratio,
                "aim": aim,
                "met": met,
            }
            print(json.dumps(line), flush=True)
            return
        text = f"  {case:40} {value:10.3f} {unit}"
        if ratio is not None:
            text += f", baseline {baseline:.3f}, ratio {ratio:.2f}"
        if aim is not None:
            text += f", aim {aim:g}" + ("" if met is None else ": met" if met else ": missed")
        print(text, flush=True)


# Processes


def take_session():
    """Goes on in a session of its own: where the kernel schedules by sessions, a lower priority
    then counts among the processes that are measured, not beside whatever else runs. From now on
    a signal that is to end the program raises SystemExit."""

    def end(number, _):
        raise SystemExit(128 + number)

    # Daemons and folders are cleared away then, also in a shell's background, where SIGINT is off.
    for number in (signal.SIGINT, signal.SIGTERM, signal.SIGHUP):
        signal.signal(number, end)
    if os.getpid() == os.getpgrp():  # Which the kernel gives no session of its own.
        child = os.fork()
        while child != 0:
            try:
                _, status = os.waitpid(child, 0)
                code = os.waitstatus_to_exitcode(status)
                os._exit(code if code >= 0 else 128 - code)
            except SystemExit:
                os.kill(child, signal.SIGTERM)
    os.setsid()


def adopt_orphans():
    """What a program started and left to itself becomes a child of this process, not of init."""
    set_child_subreaper = 36
    if ctypes.CDLL(None, use_errno=True).prctl(set_child_subreaper, 1, 0, 0, 0) != 0:
        raise Failure(os.strerror(ctypes.get_errno()))


def _fields(pid):
    """The fields of /proc/PID/stat from the third on; the name before them may hold anything."""
    with open(f"/proc/{pid}/stat", encoding="latin-1") as file:
        return file.read().rpartition(")")[2].split()


def descendants(pids):
    """The processes with all that they started, as far as these are still alive."""
    children = {}
    for name in os.listdir("/proc"):
        if name.isdigit():
            try:
                children.setdefault(int(_fields(name)[1]), []).append(int(name))
            except (OSError, IndexError):
                pass
    found = list(pids)
    for pid in found:
        found.extend(children.get(pid, ()))
    return found


def cpu_seconds(pid):
    """Of the process and of its children that have ended and were waited for."""
    try:
        return sum(int(field) for field in _fields(pid)[11:15]) / _TICK
    except (OSError, IndexError):
        return 0.0


def tree_cpu_seconds(pid):
    return sum(cpu_seconds(each) for each in descendants([pid]))


def memory(pid):
    """(PSS, RSS) in bytes; zeros when the process has gone."""
    sizes = {"Pss:": 0, "Rss:": 0}
    try:
        with open(f"/proc/{pid}/smaps_rollup", encoding="ascii", errors="replace") as file:
            for line in file:
                words = line.split()
                if words[0] in sizes:
                    sizes[words[0]] = int(words[1]) * 1024
    except OSError:
        pass
    return sizes["Pss:"], sizes["Rss:"]


def io_counters(pid):
    """Calls that read and write, and bytes that the disk was asked for."""
    with open(f"/proc/{pid}/io", encoding="ascii") as file:
        values = {name.strip(): int(value) for name, value in (line.split(":") for line in file)}
    return {name: values[name] for name in ("syscr", "syscw", "read_bytes", "write_bytes")}


class MemoryWatch:
    """Samples the memory of process trees, and of all of them together, until it is left. Each is
    given by its root, or by a function that lists its processes."""

    def __init__(self, trees, interval=0.1):
        self._trees = dict(trees)
        self._interval = interval
        self._end = threading.Event()
        self._thread = threading.Thread(target=self._run)
        self.peaks = {name: (0, 0) for name in self._trees}
        self.peak = 0  # PSS of all together.

    def __enter__(self):
        self._thread.start()
        return self

    def __exit__(self, *_):
        self._end.set()
        self._thread.join()

    def _run(self):
        while True:
            total = 0
            for name, pid in self._trees.items():
                sizes = [memory(each) for each in (pid() if callable(pid) else descendants([pid]))]
                pss, rss = (sum(size[i] for size in sizes) for i in (0, 1))
                self.peaks[name] = (max(self.peaks[name][0], pss), max(self.peaks[name][1], rss))
                total += pss
            self.peak = max(self.peak, total)
            if self._end.wait(self._interval):
                return


# The stack


class Stack:
    """The four daemons of a build in a root of their own. Everything ends with close()."""

    FOLDERS = (
        "etc/kavo",
        "tmp",
        "var/run",
        "var/lib/kavo/fileindex/queue",
        "var/lib/kavo/fileindex/db",
        "var/lib/kavo/evnotify",
        "var/lib/kavo/extract",
        "var/packages/Vexlo/etc",
        "var/packages/Vexlo/var",
        "var/packages/Vexlo/target",
    )

    def __init__(self, programs, folder=None):
        self.programs = pathlib.Path(programs).resolve()
        for name in DAEMONS + ("fileindex",):
            if not os.access(self.programs / name, os.X_OK):
                raise Failure(f"there is no program {self.programs / name}: build it first")
        self.base = pathlib.Path(tempfile.mkdtemp(prefix="stack-", dir=folder))
        self.root = self.base / "root"
        self._processes = {}
        for folder in self.FOLDERS:
            (self.root / folder).mkdir(parents=True, exist_ok=True)
        self._environment = dict(os.environ, FILEINDEX_ROOT=str(self.root))
        # A build without a root would work on the system's own files.
        if str(self.root) not in self._run("share", "list").stderr:
            self.close()
            raise Failure(
                f"the programs in {self.programs} take no root from the environment: "
                "configure a build with -DFILEINDEX_ROOT=FOLDER"
            )

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()

    def close(self):
        self.stop()
        shutil.rmtree(self.base, ignore_errors=True)

    def pids(self):
        return {name: process.pid for name, process in self._processes.items()}

    def start(self):
        for name in DAEMONS:
            (self.root / f"var/run/{name}.sock").unlink(missing_ok=True)
            with open(self.base / f"{name}.log", "ab") as log:
                self._processes[name] = subprocess.Popen(
                    [self.programs / name],
                    stdin=subprocess.DEVNULL,
                    stdout=log,
                    stderr=log,
                    env=self._environment,
                )
        for name in DAEMONS:
            await_true((self.root / f"var/run/{name}.sock").exists, f"{name} answers", 30, 0.005)

    def stop(self):
        """The daemons end from the last to the first, as they need each other."""
        for process in reversed(self._processes.values()):
            process.send_signal(signal.SIGTERM)
            try:
                process.wait(30)
            except subprocess.TimeoutExpired:
                process.kill()
                process.wait()
        self._processes.clear()

    def _run(self, *arguments):
        return subprocess.run(
            [self.programs / "fileindex", *arguments],
            env=self._environment,
            capture_output=True,
            text=True,
            errors="replace",
            check=False,
        )

    def tool(self, *arguments):
        """The output of the program fileindex, which may find nothing but must not fail."""
        result = self._run(*arguments)
        if result.returncode > 1:
            raise Failure(f"fileindex {' '.join(arguments)}: {result.stderr.strip()}")
        return result.stdout

    def ask(self, daemon, request):
        """One request and its reply, each a length of eight bytes and so many bytes of JSON."""
        text = json.dumps(request).encode()
        with socket.socket(socket.AF_UNIX) as connection:
            connection.connect(str(self.root / f"var/run/{daemon}.sock"))
            connection.sendall(struct.pack("=Q", len(text)) + text)
            reply = b""
            while len(reply) < 8 or len(reply) < 8 + struct.unpack("=Q", reply[:8])[0]:
                part = connection.recv(1 << 20)
                if not part:
                    raise Failure(f"{daemon} closed the connection without a reply")
                reply += part
        return json.loads(reply[8:])

    def search(self, **data):
        reply = self.ask("kavoelasticd", {"command": "search", "data": data})
        if not reply.get("success"):
            raise Failure(f"the search failed: {reply}")
        return reply

    def count(self, **data):
        """How many files and folders a search finds; none while an index is still to be made."""
        try:
            return self.search(size=1, **data)["total"]
        except Failure:
            return -1

    def add_folder(self, path, *options):
        self.tool("folder", "add", str(path), *options)

    def is_at_rest(self):
        """Whether all that was queued is done, and the kernel reports whatever comes."""
        queues = self.ask("evnotifyd", {"command": "stats"})["queues"]
        shares = self.ask("fileindexd", {"type": "stats", "data": None})["shares"]
        return (
            len(shares) > 0
            and len(queues) > 0
            and all(queue["state"] == "live" for queue in queues)
            and all(share["state"] == "idle" and share["queue_bytes"] == 0 for share in shares)
        )

    def files_sent(self):
        """How many documents the engine has been given since the start."""
        shares = self.ask("fileindexd", {"type": "stats", "data": None})["shares"]
        return sum(share["files"] for share in shares)

    def await_files(self, folder, count, before):
        """Until a search finds that many text files below the folder, with `before` sent when it
        was empty. A search that finds so many costs the engine more than it costs to ask the daemon
        that fills it, so that one is asked until it has come so far."""
        await_true(
            lambda: self.files_sent() >= before + count,
            "all files are sent to the engine",
            pause=0.05,
        )
        await_true(
            lambda: self.count(below=str(folder), types=["txt"]) == count,
            "all files are found",
            pause=0.05,
        )

    def operations(self):
        """How many have been carried out since the start."""
        shares = self.ask("fileindexd", {"type": "stats", "data": None})["shares"]
        return sum(share["operations"] for share in shares)

    def await_rest(self):
        """Rest that lasts for longer than a queue takes to be seen."""

        def rests():
            if not self.is_at_rest():
                return False
            time.sleep(0.2)
            return self.is_at_rest()

        await_true(rests, "the daemons come to rest")

    def cpu(self):
        return {name: tree_cpu_seconds(pid) for name, pid in self.pids().items()}

    def index_bytes(self):
        folder = self.root / "var/lib/kavo/fileindex/db"
        return sum(file.stat().st_size for file in folder.rglob("*") if file.is_file())


# The corpus

NEW_WORD = "burstword"  # In no file until the burst.
BLOCKS = ("north", "east", "south", "west")  # A quarter of the folders each.
_SYLLABLES = (
    "ba be bi bo bu da de di do du fa fe fi ga ge gi go ha he hi ka ke ki ko la le li lo "
    "ma me mi mo mu na ne ni no pa pe pi po ra re ri ro ru sa se si so ta te ti to tu va "
    "ve vi vo wa we wi za zo"
).split()


def word_list(count=20000, seed=1):
    source = random.Random(seed)
    words = set()
    while len(words) < count:
        words.add("".join(source.choice(_SYLLABLES) for _ in range(source.randint(2, 5))))
    words = sorted(words)
    source.shuffle(words)
    return words


def make_corpus(top, files=20000, folders=400, seed=1):
    """Text files of 1 to 4 KB; a word's frequency goes with 1/rank, as in a language. Gives their
    paths."""
    source = random.Random(seed)
    words = word_list(seed=seed)
    weights = [1 / (rank + 10) for rank in range(len(words))]
    top = pathlib.Path(top)
    names = [top / BLOCKS[i * len(BLOCKS) // folders] / f"{words[i]}-{i}" for i in range(folders)]
    for name in names:
        name.mkdir(parents=True)
    paths = []
    for i in range(files):
        size = source.randint(1000, 4000)
        chosen = source.choices(words, weights, k=size // 5)
        lines = [" ".join(chosen[at : at + 12]) for at in range(0, len(chosen), 12)]
        text = "\n".join(lines)[: size - 1] + "\n"
        path = names[i % folders] / f"{chosen[0]}-{chosen[1]}-{i}.txt"
        path.write_text(text, encoding="ascii")
        paths.append(path)
    return paths


def change(corpus, paths, sizes):
    """The burst; gives what `counts` must say when all of it is reflected."""
    changed, deleted = sizes
    quarter = {
        block: [path for path in paths if path.parts[0] == block] for block in BLOCKS
    }
    for path in (quarter["north"] + quarter["east"])[:changed]:
        with open(corpus / path, "a", encoding="ascii") as file:
            file.write(f"{NEW_WORD}\n")
    for path in quarter["south"][:deleted]:
        (corpus / path).unlink()
    os.rename(corpus / "west", corpus / "moved")
    return changed, 0, len(quarter["west"]), len(paths) - deleted


def make_small_files(top, files, folder_size=1000):
    """Short texts in folders of so many: a tree whose size is in its names."""
    top = pathlib.Path(top)
    for i in range(files):
        folder = top / f"folder-{i // folder_size:04d}"
        if i % folder_size == 0:
            folder.mkdir(parents=True)
        with open(folder / f"note-{i:07d}.txt", "w", encoding="ascii") as file:
            file.write(f"note number {i} of word{i % 977}\n")
