#!/usr/bin/python3
"""The admin's view of a real daemon: `qnreport stats` from the start, `qnreport top` on a
pseudo-terminal and in plain lines, and the --metrics-file read by Prometheus's own parser.

Usage: admin_view_test.py QNREPORTINGD QNREPORT
"""
import json
import os
import re
import select
import subprocess
import sys
import tempfile
import termios
import time

from prometheus_client.parser import text_string_to_metric_families

DAEMON, QNREPORT = sys.argv[1], sys.argv[2]
PATIENCE = 30  # seconds; only ends a hung test


def until(condition, what):
    deadline = time.monotonic() + PATIENCE
    while time.monotonic() < deadline:
        if condition():
            return
        time.sleep(0.05)
    raise AssertionError("timed out waiting for " + what)


def qnreport(home, *args):
    return subprocess.run([QNREPORT, "--home", home, *args], capture_output=True, text=True,
                          timeout=PATIENCE)


def metrics(path):
    """{(sample name, labels): value}, checking the families' types on the way."""
    samples = {}
    with open(path) as f:
        for family in text_string_to_metric_families(f.read()):
            assert family.type in ("counter", "gauge", "untyped"), family
            for s in family.samples:
                assert family.type != "counter" or s.name.endswith("_total"), s
                samples[(s.name, tuple(sorted(s.labels.items())))] = s.value
    return samples


def sender(home):
    """A client that keeps sending messages (about 1,000 a second) until it is killed."""
    with open(home + "/load.txt", "w") as f:
        f.write("create 7\nstart 7\n" + ('send {"a":1} 5 1 7\n' * 100 + "sleep 0.1\n") * 600)
    with open(home + "/load.txt") as script:
        return subprocess.Popen([QNREPORT, "--home", home, "shell"], stdin=script,
                                stdout=subprocess.DEVNULL)


def read_some(fd):
    """What the terminal shows next (nothing after a second of quiet)."""
    ready, _, _ = select.select([fd], [], [], 1)
    return os.read(fd, 65536) if ready else b""


def top_on_terminal(home):
    """Runs top on a pseudo-terminal until it shows messages flowing, then types q."""
    master, slave = os.openpty()
    before = termios.tcgetattr(slave)
    top = subprocess.Popen([QNREPORT, "--home", home, "top", "--interval", "0.5"], stdin=slave,
                           stdout=slave, stderr=slave, env=dict(os.environ, LANG="C.UTF-8"))
    screen = b""
    try:
        def busy():
            nonlocal screen
            screen += read_some(master)
            rates = re.findall(rb"messages/s +([0-9.]+)", screen)
            return rates and float(rates[-1]) > 0
        until(busy, "top to show a message rate")
        os.write(master, b"q")
        assert top.wait(PATIENCE) == 0
        while (more := read_some(master)):  # what it wrote last
            screen += more
        assert screen.startswith(b"\x1b[?1049h"), screen[:40]
        assert screen.endswith(b"\x1b[?7h\x1b[?25h\x1b[?1049l"), screen[-60:]
        assert termios.tcgetattr(slave) == before, "the terminal's settings were not restored"
    finally:
        top.kill()
        os.close(master)
        os.close(slave)


def main():
    with tempfile.TemporaryDirectory() as home:
        prom = home + "/qnreportingd.prom"
        daemon = subprocess.Popen([DAEMON, "--home", home, "--metrics-file", prom],
                                  stderr=subprocess.DEVNULL)
        load = None
        try:
            until(lambda: os.path.exists(home + "/run/reporting.sock"), "the daemon's socket")
            stats = qnreport(home, "stats", "--json")
            assert stats.returncode == 0, stats.stderr
            # Every number of the stats file is a sample (the pid is not).
            leaves = lambda d: sum(leaves(v) if isinstance(v, dict) else 1 for v in d.values())
            first = metrics(prom)
            assert len(first) == leaves(json.loads(stats.stdout)) - 1, first

            load = sender(home)
            top_on_terminal(home)

            lines = qnreport(home, "top", "--interval", "0.3", "--count", "3")
            assert lines.returncode == 0, lines.stderr
            assert re.fullmatch(r"(\d\d:\d\d:\d\d messages/s [0-9.]+ [^\x1b\n]*\n){3}",
                                lines.stdout), lines.stdout

            sends = ("qnreportingd_requests_total", (("op", "sendMessage"),))
            rows = ("qnreportingd_store_rows_committed_total", ())
            until(lambda: (m := metrics(prom))[sends] > first[sends] and m[rows] > first[rows],
                  "the counters to grow")
        finally:
            if load:
                load.kill()
                load.wait()
            daemon.terminate()
            try:
                daemon.wait(PATIENCE)
            finally:
                daemon.kill()
        stopped = qnreport(home, "stats")
        assert stopped.returncode == 1 and stopped.stdout == "", stopped
        assert re.fullmatch(r"qnreport: qnreportingd is not running \(.*\)\n", stopped.stderr), \
            stopped.stderr


if __name__ == "__main__":
    main()
    print("admin view: ok")
