"""The folder that stands for the file system's root, the daemon in it, and what makes its system calls fail."""

import errno
import json
import mmap
import os
import re
import shutil
import signal
import socket
import struct
import subprocess
import tempfile
import threading
import time

from intruder import OTHER_USERS
from servers import FailingServer, Sink


class Failure(Exception):
    pass


class LogReader(threading.Thread):
    """Reads what the daemon writes to standard error; stops reading when told, as a hanging terminal does."""

    SANITIZER = re.compile(r"Sanitizer|runtime error:")

    def __init__(self, stream, path):
        super().__init__(daemon=True)
        self.stream = stream
        self.reads = threading.Event()
        self.reads.set()
        self.last, self.reports = [], []
        self.counters, self.requests = {}, None
        self.started = threading.Event()
        self.begin = time.monotonic()
        self.lock = threading.Lock()
        self.file = open(path, "a", errors="replace")

    def run(self):
        for line in self.stream:
            self.reads.wait()
            self.last = (self.last + [line])[-50:]
            if self.SANITIZER.search(line) or self.reports:
                self.reports = (self.reports + [line])[:200]
            if "main: Listener resumes" in line:
                self.started.set()
            if "shutDown: " in line:
                self.read_figure(line)
            self.write(line)
        with self.lock:
            self.file.close()

    def write(self, line):
        """To the file, behind the seconds since the daemon's start at which it was read, or came from elsewhere."""
        with self.lock:
            if not self.file.closed and self.file.tell() < 1 << 28:
                self.file.write(f"{time.monotonic() - self.begin:9.3f} {line}")

    def read_figure(self, line):
        """One of the lines in which a daemon that ends says what it has done."""
        requests = re.search(r"shutDown: (\d+) requests started, (\d+) completed, (\d+) failed", line)
        if requests:
            self.requests = tuple(int(count) for count in requests.groups())
        counter = re.search(r"shutDown: ([a-z0-9-]+): (\d+)$", line)
        if counter:
            self.counters[counter[1]] = int(counter[2])


class FailingCalls:
    """Makes calls of the daemon fail, through the library that is loaded into it and shares a file with this."""

    TESTS = os.path.join(os.path.dirname(os.path.realpath(__file__)), "..")
    ARMED, LAYOUT = struct.Struct("@i"), struct.Struct("@7i")

    def __init__(self, library, path):
        self.environment = {"LD_PRELOAD": os.path.realpath(library), "KYT_FAILING_CALLS": path}
        with open(path, "w+b") as file:
            file.write(bytes(self.LAYOUT.size))
            file.flush()
            self.control = mmap.mmap(file.fileno(), 0)
        # The names in their order are the calls' numbers; what may become of each stands with the tests of each.
        header = open(os.path.join(self.TESTS, "support/failing/FailingCalls.h")).read()
        names = re.findall(r"\bX\((\w+)\)", header)
        table = open(os.path.join(self.TESTS, "integration/FailedCalls_test.cpp")).read()
        table = table[table.index("kFailures[]"): table.index("};", table.index("kFailures[]"))]
        self.pairs = [(names.index(call), getattr(errno, error), f"{call} {error}")
                      for call, error in re.findall(r"KYT_FAILURE\((\w+), (\w+)\)", table)]

    def arm(self, draw):
        """A few calls of one kind fail from a random one on. Returns what they are."""
        call, error, name = draw.choice(self.pairs)
        self.disarm()
        self.LAYOUT.pack_into(self.control, 0, 0, call, draw.randrange(1, 20), draw.randrange(1, 4), error, 0, 0)
        self.ARMED.pack_into(self.control, 0, 1)
        return name

    def disarm(self):
        """Returns how many calls have failed since arm()."""
        self.ARMED.pack_into(self.control, 0, 0)
        return self.LAYOUT.unpack_from(self.control, 0)[6]


class Stage:
    """The folder that stands for the file system's root, and the daemon in it."""

    def __init__(self, arguments):
        self.programs, self.share = arguments.programs, arguments.share
        self.folder = tempfile.mkdtemp(prefix="kyt-soak-")
        os.chmod(self.folder, 0o755)
        self.certificate = self.make_certificate()
        self.sink = Sink(self.program("kyt_soak_sink"), self.certificate)
        self.server = FailingServer(self.certificate, arguments.seed)
        self.server.start()
        self.server.ready.wait()
        self.lay_out()
        self.failing = FailingCalls(os.path.join(self.programs, "../lib/failing_calls.so"), self.path("failing"))
        self.daemon = self.reader = None
        self.heard_before = 0

    def path(self, *parts):
        return os.path.join(self.folder, *parts)

    def write(self, path, text, mode="w"):
        os.makedirs(os.path.dirname(self.path(path)), exist_ok=True)
        with open(self.path(path) + ".new", mode) as file:
            file.write(text)
        os.rename(self.path(path) + ".new", self.path(path))

    def run(self, *command):
        return subprocess.run(command, check=True, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)

    def make_certificate(self):
        certificate, key = self.path("certificate.pem"), self.path("key.pem")
        self.run("openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes",
                 "-keyout", key, "-out", certificate, "-days", "2", "-subj", "/CN=127.0.0.1",
                 "-addext", "subjectAltName=IP:127.0.0.1")
        return certificate, key

    def lay_out(self):
        shutil.copytree(os.path.join(self.share, "kytreporting"), self.path("usr/share/kytreporting"), symlinks=True)
        self.run(self.program("kytctl"), "keys", "make", self.path("keys"))
        key = self.path("usr/share/kytreporting/KYTReporting.bundle/publicKey.der")
        if os.path.lexists(key):
            os.unlink(key)
        shutil.copy(self.path("keys/publicKey.der"), key)
        base = self.server.plain
        os.makedirs(self.path("ca"))
        shutil.copy(self.certificate[0], self.path("ca/ca.pem"))
        self.write("etc/kytreportingd/kytreportingd.toml",
                   f'[storebag]\ninternal_host = "{base}"\npublic_host = "{base}"\n[tls]\n'
                   f'ca_file = "{self.path("ca/ca.pem")}"\n[log]\ntarget = "stderr"\n')
        self.device()
        grants = ""
        for user in {os.geteuid(), *OTHER_USERS}:
            grants += f'[[grant]]\nuser = {user}\n"com.vantu.private.kytreportingd" = true\n'
        self.write("etc/kytreportingd/entitlements.d/soak.toml", grants)
        self.put_bags()

    def device(self, extra=""):
        self.write("etc/kytreportingd/device.toml", f'ReleaseType = "Internal"\ncountry = "DE"\n{extra}')

    def program(self, name):
        return os.path.join(self.programs, name)

    def entry(self, client, url, threshold):
        return {"client": client, "locale_whitelist": ["DE"], "filters": [{"key": "field1", "action": "sha256"}],
                "sampling_threshold": 1.0, "event_threshold": threshold, "post_url": url, "override_dnu": 1}

    def put_bag(self, name, backends, spoilt=None):
        bag = self.path("bag.json")
        with open(bag, "w") as file:
            json.dump({"version": "1", "vantu_internal": backends}, file)
        self.run(self.program("kytctl"), "storebag", "sign", bag, "--key", self.path("keys/private.pem"), "-o",
                 self.path("signed"))
        with open(self.path("signed"), "rb") as file:
            document = file.read()
        self.server.bags["/storebags/tolvar/" + name] = spoilt(document) if spoilt else document

    def put_bags(self):
        sink = self.sink
        self.put_bag("gelmar", {"httppost": {"clients": [self.entry("steady", sink.plain + "/steady", 49),
                                                         self.entry("steadytls", sink.tls + "/steady", 20)]}})
        for name in ("torvel", "brisca", "cadmor", "dulvek", "emrit", "fosska", "hovit", "ismel", "nessim"):
            self.put_wild_bag(name)

    def put_wild_bag(self, name, spoilt=None):
        plain, tls = self.server.plain, self.server.tls

        def wild(backend):
            entry = dict(self.entry("", f"{plain}/faulty/{backend}", 3), realtime_post_url=f"{tls}/faulty/{backend}")
            del entry["client"], entry["override_dnu"]
            return {"clients": [entry]}

        self.put_bag(name, {"httppost": wild("httppost"), "qrs": wild("qrs"), "qdx": {}, "ampyx": {},
                            "uploadserver": {"post_url": plain + "/faulty/upload"},
                            "dashboard": {"ip": "127.0.0.1", "port": 9, "reliable": 10,
                                          "post_url": plain + "/faulty/log"}}, spoilt)

    @property
    def socket(self):
        return self.path("run/kytreportingd/com.vantu.kytreportingd")

    def start_daemon(self):
        # A daemon that does not end in its time leaves its threads as they are.
        options = os.environ.get("TSAN_OPTIONS", "") + " report_thread_leaks=0"
        self.daemon = subprocess.Popen([self.program("kytreportingd"), "--root", self.folder], text=True,
                                       stdin=subprocess.DEVNULL, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE,
                                       errors="replace", env=dict(os.environ, TZ="UTC", TSAN_OPTIONS=options,
                                                                **self.failing.environment))
        self.reader = LogReader(self.daemon.stderr, self.path("daemon.log"))
        self.reader.start()
        self.heard_before = self.heard()
        deadline = time.monotonic() + 60
        # Its socket is there before it has read what it reads at its start.
        while not (self.reader.started.is_set() and self.takes_connections()):
            if self.daemon.poll() is not None or time.monotonic() > deadline:
                raise Failure("the daemon does not start:\n" + "".join(self.reader.last))
            time.sleep(0.02)

    def takes_connections(self):
        with socket.socket(socket.AF_UNIX) as probe:
            try:
                probe.connect(self.socket)
            except OSError:
                return False
            return True

    def stop_daemon(self, number=signal.SIGTERM):
        self.reader.reads.set()
        helpers = self.helpers()
        self.daemon.send_signal(number)
        try:
            status = self.daemon.wait(60)
        except subprocess.TimeoutExpired:
            self.daemon.send_signal(signal.SIGABRT)
            raise Failure("the daemon does not end within a minute") from None
        if number == signal.SIGTERM and status != 0:
            raise Failure(f"the daemon ended with {status}:\n" + "".join(self.reader.last))
        deadline = time.monotonic() + 20
        while any(os.path.exists(f"/proc/{helper}") for helper in helpers):
            if time.monotonic() > deadline:
                raise Failure(f"the daemon has ended with signal {number}, and its helpers {helpers} have not")
            time.sleep(0.02)
        self.reader.join(60)

    def helpers(self):
        """The processes that the daemon has started."""
        found = []
        for task in os.listdir(f"/proc/{self.daemon.pid}/task"):
            try:
                with open(f"/proc/{self.daemon.pid}/task/{task}/children") as file:
                    found += file.read().split()
            except (FileNotFoundError, ProcessLookupError):
                pass  # a thread that has just ended; the first one, which starts them, has not
        return found

    def note_stall(self, seconds):
        """Where the daemon's threads are goes to its log, as far as there is a program that tells."""
        self.reader.write(f"soak: a steady program has not ended {seconds:.0f} s after its time\n")
        if shutil.which("gdb"):
            stacks = subprocess.run(["timeout", "60", "gdb", "-p", str(self.daemon.pid), "-batch", "-ex",
                                     "set pagination off", "-ex", "thread apply all backtrace 16"],
                                    stdin=subprocess.DEVNULL, capture_output=True, text=True, errors="replace")
            self.reader.write(stacks.stdout + "\n")

    def heard(self):
        """Requests that came whole to either server."""
        return self.server.heard + self.sink.figures()["posts"]

    def processor_seconds(self, process):
        with open(f"/proc/{process.pid}/stat") as file:
            fields = file.read().rsplit(")", 1)[1].split()
        return (int(fields[11]) + int(fields[12])) / os.sysconf("SC_CLK_TCK")

    def figures(self):
        """Anonymous memory in KiB, descriptors, threads."""
        process = f"/proc/{self.daemon.pid}"
        status = open(process + "/status").read()
        return (int(re.search(r"RssAnon:\s+(\d+)", status)[1]), len(os.listdir(process + "/fd")),
                int(re.search(r"Threads:\s+(\d+)", status)[1]))

    def close(self, keep):
        if self.daemon and self.daemon.poll() is None:
            self.daemon.kill()
        self.sink.close()
        if not keep:
            shutil.rmtree(self.folder, ignore_errors=True)
