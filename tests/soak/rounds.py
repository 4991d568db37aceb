"""One round: programs, what disturbs them, and the books of afterwards."""

import json
import os
import resource
import shutil
import signal
import subprocess
import time

from books import ACCEPTED, FIRST_NUMBER, NEVER, REFUSED, Book, Pacer
from intruder import become_another, intrude
from stage import Failure

STEADY, WILD, INTRUDERS = 3, 4, 3
STALL_SECONDS = 20  # of waiting for a steady program after its time
# An event may be lost with the moment that a fault takes. Before the moment: what its session has batched, or is on its
# way; sessions live for some times their mean at most. After it: a session that came meanwhile goes on without what was
# refused to it.
SECONDS_BEFORE, SESSIONS_BEFORE, SECONDS_AFTER = 3, 3, 5
SANITIZED_SLOWNESS = 3  # a daemon with a sanitizer has as much on its way for longer
# Counters of events that were taken and will not arrive.
DROPS = ("not-configured", "no-storebag", "no-back-ends", "category-or-type-missing", "event-filtered",
         "not-for-this-back-end", "batch-full", "user-batches-full", "event-dropped-by-state", "batch-discarded",
         "batched-event-filtered", "post-without-url", "post-without-poster", "post-without-client-id", "post-failed",
         "post-refused", "post-redirected", "post-displaced", "post-without-room", "post-cancelled")


class Round:
    """Its kind: "load", without faults of the daemon itself; "fail", system calls of the daemon fail; "end" and "kill", the
    daemon is ended in order, or killed, and started again. A sharp one has no wild programs, and daemons of its own,
    which are ended in order when nothing is in motion: so their counters are about steady programs alone."""

    def __init__(self, stage, number, draw, kind, sharp, options):
        self.stage, self.number, self.draw, self.kind, self.sharp = stage, number, draw, kind, sharp
        self.seconds, self.pace = options.seconds, options.pace
        self.slowness = SANITIZED_SLOWNESS if options.sanitized else 1
        self.steady, self.wild, self.intruders = [], [], []
        self.problems = []
        self.moments = []  # of faults: from, to
        self.last_arrival = (None, 0.0)  # how many had arrived then
        self.failed_calls = {}
        self.counted = 0  # events that daemons which ended in order have dropped, as they count
        self.summary = {"accepted": 0, "arrived": 0, "lost": 0, "missing": 0, "p99": 0.0, "worst": 0.0, "before": 0.0,
                        "after": 0.0, "wild": 0}

    def start_client(self, kind, index, other_user=None):
        nonce = f"{kind}-{self.number}-{index}"
        book = Book(self.stage.path(f"{nonce}.book"))
        output = open(self.stage.path(f"{kind}-{index}.out"), "w+")
        process = subprocess.Popen(
            [self.stage.program("kyt_soak_client"), kind, self.stage.socket, nonce, str(self.draw.getrandbits(32)),
             str(self.seconds), str(self.pace), book.path], stdin=subprocess.DEVNULL, stdout=output,
            stderr=subprocess.STDOUT, preexec_fn=None if other_user is None else lambda: become_another(other_user))
        return nonce, process, output, book

    def start_intruder(self):
        seed = self.draw.getrandbits(32)
        child = os.fork()
        if child == 0:
            try:
                resource.setrlimit(resource.RLIMIT_NOFILE, (4096, 4096))
                become_another()
                intrude(self.stage.socket, seed, self.seconds)
            finally:
                os._exit(0)
        return child

    def run(self):
        stage, draw = self.stage, self.draw
        if self.sharp:
            self.end_daemon(signal.SIGTERM)
            stage.start_daemon()
            self.counted = 0
        used = [stage.processor_seconds(stage.daemon), stage.processor_seconds(stage.sink.process)]
        begin = time.monotonic()
        self.steady = [self.start_client("steady", index) for index in range(STEADY)]
        if not self.sharp:
            self.wild = [self.start_client("wild", index, index % 2) for index in range(WILD)]
        self.intruders = [self.start_intruder() for _ in range(INTRUDERS)]
        pacer = Pacer(stage.sink, [book for _, _, _, book in self.steady])
        pacer.start()
        ends = {"end": 1, "kill": 2}.get(self.kind, 0)
        ends_at = sorted(begin + self.seconds * draw.uniform(0.2, 0.8) for _ in range(ends))
        while time.monotonic() < begin + self.seconds:
            time.sleep(draw.uniform(0.1, min(1, self.seconds / 10)))
            self.look_at_daemon()
            if ends_at and time.monotonic() > ends_at[0]:
                ends_at.pop(0)
                self.restart(signal.SIGTERM if self.kind == "end" else signal.SIGKILL)
            for _ in range(3 if self.kind == "fail" else 0):
                self.fail()
            self.disturb()
        seconds = time.monotonic() - begin
        self.mend()
        self.wait_for_steady()
        pacer.end()
        # Daemons that have ended meanwhile took their figures with them.
        self.load = None if ends else tuple(
            (stage.processor_seconds(process) - before) / seconds
            for process, before in zip((stage.daemon, stage.sink.process), used))
        self.close_books()
        return self.problems, self.summary

    def look_at_daemon(self):
        if self.stage.daemon.poll() is not None:
            raise Failure(f"the daemon ended by itself with {self.stage.daemon.returncode}:\n" +
                          "".join(self.stage.reader.last))

    def restart(self, number):
        self.stage.device()  # a daemon that starts reads once whether its device is an internal one
        begin = time.monotonic()
        self.end_daemon(number)
        self.stage.start_daemon()
        self.moments.append((begin, time.monotonic()))

    def end_daemon(self, number):
        """Ends it; in order: with its counters compared."""
        stage = self.stage
        stage.stop_daemon(number)
        if number != signal.SIGTERM:
            return
        self.counted += sum(stage.reader.counters.get(reason, 0) for reason in DROPS)
        if stage.reader.requests is None:
            self.problems.append("the daemon's counters are not in its log")
            return
        started, completed, failed = stage.reader.requests
        heard = stage.heard() - stage.heard_before
        if started != completed + failed or completed > heard:
            self.problems.append(f"of {started} requests {completed} completed and {failed} failed; servers heard {heard}")

    def fail(self):
        begin = time.monotonic()
        name = self.stage.failing.arm(self.draw)
        time.sleep(self.draw.uniform(0, 0.3))
        count = self.stage.failing.disarm()
        self.failed_calls[name] = self.failed_calls.get(name, 0) + count
        if count:
            self.moments.append((begin, time.monotonic()))
            self.stage.reader.write(f"soak: {name} failed {count} times in the last {time.monotonic() - begin:.3f} s\n")

    def disturb(self):
        stage, draw = self.stage, self.draw
        choice = draw.randrange(11)
        if choice == 0 and self.wild:
            for _, process, _, _ in draw.sample(self.wild, 1):
                process.send_signal(draw.choice([signal.SIGSTOP, signal.SIGCONT, signal.SIGCONT]))
        elif choice == 1 and self.wild and draw.randrange(3) == 0:
            which = draw.randrange(len(self.wild))
            self.wild[which][1].send_signal(signal.SIGKILL)
        elif choice == 2:
            stage.write("etc/kytreportingd/entitlements.d/other.toml", draw.choice(["", "[[grant", "x = 1\n"]))
        elif choice == 3:
            stage.run(stage.program("kytctl"), "--root", stage.folder, "consent", draw.choice(["grant", "withdraw"]))
        elif choice == 4:
            logs = stage.path("var/mobile/Library/Logs/Faultbin/Retired")
            shutil.rmtree(logs, ignore_errors=True)
            if draw.randrange(2) == 0:
                try:
                    os.close(os.open(logs, os.O_CREAT | os.O_EXCL))
                except OSError:
                    pass  # the daemon has made its folder again
        elif choice == 5:
            stage.device(draw.choice(["", "x =\n", 'ProductVersion = "1"\n']))
        elif choice == 6:
            name = draw.choice(["torvel", "brisca", "cadmor", "dulvek", "emrit"])
            stage.put_wild_bag(name, draw.choice([None, lambda bag: bag[: len(bag) // 2], lambda bag: b"",
                                                  lambda bag: bag.replace(b"A", b"B", 5)]))
        elif choice == 7:
            stage.server.cut()
        elif choice == 8 and draw.randrange(3) == 0:
            stage.reader.reads.clear()
        elif choice == 9:
            stage.reader.reads.set()
        elif choice == 10 and draw.randrange(4) == 0:
            stage.daemon.send_signal(signal.SIGHUP)

    def mend(self):
        stage = self.stage
        stage.reader.reads.set()
        stage.device()
        logs = stage.path("var/mobile/Library/Logs/Faultbin/Retired")
        if os.path.isfile(logs):
            os.unlink(logs)
        stage.write("etc/kytreportingd/entitlements.d/other.toml", "")

    def wait_for_steady(self):
        """They end soon after their time, unless the daemon leaves one of them without an answer."""
        begin, told = time.monotonic(), False
        for nonce, process, _, _ in self.steady:
            while process.poll() is None and time.monotonic() < begin + STALL_SECONDS:
                time.sleep(0.05)
            if process.poll() is None and not told:
                told = True
                self.stage.note_stall(STALL_SECONDS)
            self.wait(nonce, process, 300)

    def kill(self):
        """Whatever of it still runs, where it broke off."""
        for _, process, _, _ in self.steady + self.wild:
            process.kill()
        for child in self.intruders:
            os.kill(child, signal.SIGKILL)

    @staticmethod
    def wait(nonce, process, patience):
        try:
            process.wait(patience)
        except subprocess.TimeoutExpired:
            process.kill()
            raise Failure(f"{nonce} does not end") from None

    def close_books(self):
        for _, process, _, _ in self.wild:
            process.send_signal(signal.SIGCONT)
        for nonce, process, output, book in self.wild:
            self.wait(nonce, process, 120)
            output.close()
            book.close()
        while self.intruders:
            os.waitpid(self.intruders.pop(), 0)
        for program in self.steady:
            self.close_steady(*program)
        if self.sharp:
            self.look_at_daemon()
            self.end_daemon(signal.SIGTERM)
            self.stage.start_daemon()
        self.compare_counters()
        for nonce, _, _, book in self.wild:
            self.compare_wild(nonce, book)
        if self.stage.reader.reports:
            self.problems.append("a sanitizer says:\n" + "".join(self.stage.reader.reports))

    def close_steady(self, nonce, process, output, book):
        output.seek(0)
        text = output.read()
        output.close()
        try:
            told = json.loads(text.strip().splitlines()[-1])
        except (ValueError, IndexError):
            raise Failure(f"{nonce} ended with {process.returncode}: {text}") from None
        book.close()
        lost = told["lost"] + told["dropped"]
        arrivals = self.wait_for(nonce, told["accepted"] - lost)
        missing, doubled, unsent = [], 0, 0
        for number in range(FIRST_NUMBER, max(len(book.entries), len(arrivals))):
            times = arrivals[number] if number < len(arrivals) else 0
            became = book.became(number)
            if times == 0 and became == ACCEPTED:
                missing.append(book.seconds(number))
            doubled += times > 1
            unsent += times > 0 and became in (NEVER, REFUSED)
        summary = self.summary
        summary["accepted"] += told["accepted"]
        summary["arrived"] += told["accepted"] - len(missing)
        summary["missing"] += len(missing)
        summary["lost"] += lost
        summary["p99"] = max(summary["p99"], told["p99"])
        summary["worst"] = max(summary["worst"], told["worst"])
        faulty = doubled or unsent or "no answer" in told["problems"]
        if self.kind == "load":
            faulty = faulty or missing or lost or told["reconnected"] or told["problems"]
        before = SECONDS_BEFORE * self.slowness + SESSIONS_BEFORE * self.seconds / told["sessions"]
        elsewhere = sum(1 for when in missing if not self.is_of_a_fault(when, before))
        if faulty or elsewhere:
            self.problems.append(f"{nonce}: of {told['accepted']} events {len(missing)} are missing, {elsewhere} of them "
                                 f"not of a fault's moment, {doubled} doubled, {unsent} never sent; {told}")

    def is_of_a_fault(self, when, before):
        """Whether an event of that time may be lost; notes how far from the nearest fault's moment it is."""
        nearest = min(((begin - when, when - end) for begin, end in self.moments), key=max, default=None)
        if nearest is None:
            return False
        self.summary["before"] = max(self.summary["before"], nearest[0])
        self.summary["after"] = max(self.summary["after"], nearest[1])
        return nearest[0] <= before and nearest[1] <= SECONDS_AFTER

    def compare_counters(self):
        """What the daemons took and did not deliver, they have counted: all but those that were killed."""
        summary = self.summary
        uncounted = summary["missing"] - summary["lost"] - self.counted
        if self.kind == "kill" or not (self.sharp or self.kind == "end"):
            return
        if uncounted > 0:
            self.problems.append(f"{summary['missing']} events are missing, the programs' library counts {summary['lost']} "
                                 f"as lost, the daemon {self.counted} as dropped: {uncounted} are in no book")

    def compare_wild(self, nonce, book):
        doubled = unsent = 0
        for (_, number), times in self.stage.server.events_of(nonce).items():
            self.summary["wild"] += times
            doubled += times > 1
            unsent += book.became(number) in (NEVER, REFUSED)
        if doubled or unsent:
            self.problems.append(f"{nonce}: {doubled} events came twice to one back end, {unsent} were never sent")
        self.stage.server.forget([nonce])

    def wait_for(self, nonce, expected):
        """That program's events, once all have arrived, or for a while nobody's do any more."""
        patience = 90 if self.kind == "load" else 20
        while True:
            arrivals = self.stage.sink.book(nonce)
            events, now = self.stage.sink.figures()["events"], time.monotonic()
            if events != self.last_arrival[0]:
                self.last_arrival = (events, now)
            if len(arrivals) - arrivals.count(0) >= expected or now > self.last_arrival[1] + patience:
                return arrivals
            time.sleep(0.1)
