#!/usr/bin/python3
"""What the packages promise, on a minimal Debian 12 under a real systemd: ./check --system, as root.

One machine, one life: installed, used, mistreated, upgraded, removed, purged. Each step begins where the one before it ended.
"""
import argparse
import json
import pathlib
import re
import subprocess
import sys
import threading
import time

from machine import Machine

STORE = "/var/lib/vxreporting/telemetry.db"
SESSION = "create {0}\ntype {0} 2\nstart {0}\nsendto {0} 0x08000005 1 gain=0.5\n"


class Life:
    def __init__(self, machine, packages):
        self.m = machine
        self.packages = packages

    # --- what the steps look at

    def shown(self, name, unit="vxreporting.service"):
        return self.m.run(f"systemctl show --value --property={name} {unit}").stdout.strip()

    def pid(self):
        return int(self.shown("MainPID"))

    def report(self, user="outsider", check=True):
        return self.m.run("vxreport reporters", user=user, check=check)

    def rows(self, query, user="root"):
        """As an analyst asks: -readonly, so that root's look removes nothing."""
        return self.m.run(f"sqlite3 -readonly {STORE} \"{query}\"", user=user).stdout.split()

    def expect(self, wanted, query, **options):
        """Rows are committed at a session's end, but not before its stop is answered."""
        self.m.wait_until(lambda: self.rows(query, **options) == wanted,
                          lambda: f"{query} is {wanted}; it is {self.rows(query, **options)}", 20)

    def session(self, number):
        self.m.run("vxreport script", user="outsider", stdin=None, input=(SESSION + "stop {0}\n").format(number))

    def opened(self, number):
        """The client of an open session, whose first message is accepted."""
        client = self.m.start("vxreport script", "outsider")
        client.stdin.write(SESSION.format(number))
        client.stdin.flush()
        self.m.wait_until(lambda: "taken" in client.said(), "the message is accepted")
        return client

    # --- the life, in order

    def step_installing_starts_the_socket_alone(self):
        self.install(self.packages)
        self.m.run("useradd outsider; useradd -G vxreporting-read reader; useradd -G vxreporting-agents agent")
        assert self.shown("ActiveState", "vxreporting.socket") == "active"
        assert self.shown("UnitFileState", "vxreporting.socket") == "enabled"
        assert self.pid() == 0, "the service runs though nobody has called"

    def install(self, folder):
        self.m.run("rm -rf /debs && mkdir /debs")
        for package in folder.glob("*.deb"):
            (self.m.root / "debs" / package.name).write_bytes(package.read_bytes())
        self.m.run("apt-get install -y --no-install-recommends /debs/*.deb", timeout=300)

    def step_units_are_sound(self):
        self.m.run("systemd-analyze verify --man=no vxreporting.service vxreporting.socket")
        self.m.run("XDG_RUNTIME_DIR=/tmp systemd-analyze --user verify --man=no vxreporting-orientation-agent.service")
        self.m.run("systemd-analyze security --offline=true --threshold=10 vxreporting.service")  # an exposure of 1.0 at most

    def step_first_client_starts_the_service(self):
        self.report()
        assert (self.shown("ActiveState"), self.shown("Type")) == ("active", "notify")  # so it has said READY
        status = self.m.run(f"cat /proc/{self.pid()}/status").stdout
        assert re.search(r"^CapEff:\s+0+$", status, re.M) and re.search(r"^Seccomp:\s+2$", status, re.M), status
        niceness = self.m.run(f"cut -d' ' -f2,19 /proc/{self.pid()}/task/*/stat").stdout
        assert "(vx-store) 15" in niceness, niceness
        self.session(1)
        self.expect(["1"], "SELECT count(*) FROM session_messages WHERE session_id = 1 AND category = 5")

    def step_journal_has_the_fields(self):
        entry = lambda: self.m.run("journalctl -o json SYSLOG_IDENTIFIER=vxreporting --grep='session created' -n 1",
                                   check=False).stdout
        self.m.wait_until(entry, "the journal has the line")
        line = json.loads(entry())
        assert {"MESSAGE", "PRIORITY", "VX_SCOPE", "CODE_FILE", "CODE_LINE", "CODE_FUNC"} <= line.keys(), line
        assert line["_SYSTEMD_UNIT"] == "vxreporting.service", line

    def step_groups_and_outsiders(self):
        """Who may read the store, running and stopped, kill the service, post and say how the interface is oriented."""
        for state in ("running", "stopped"):
            assert self.rows("SELECT count(*) FROM relay_sessions", "reader") == ["1"], state
            assert self.m.run(f"sqlite3 {STORE} 'SELECT 1'", user="outsider", check=False).returncode != 0
            assert self.m.run(f"echo x >>{STORE}", user="reader", check=False).returncode != 0
            if state == "running":
                assert "kill_allowed_users" in self.m.run("vxreport kill", user="outsider", check=False).stderr
                self.m.run("systemctl stop vxreporting.service")
        for path in ("/run/vxreporting/interface/orientation", "/run/vxreporting/notify/com.quorvel.sonik.reporting",
                     "/run/vxreporting-drivers/x"):
            assert self.m.run(f"echo portrait >{path}", user="outsider", check=False).returncode != 0
            self.m.run(f"echo portrait >{path}", user="agent")
        self.report()
        owners = self.m.run("stat -c %U:%G:%a /run/vxreporting /run/vxreporting/notify /var/lib/vxreporting").stdout.split()
        assert owners == ["vxreporting:vxreporting-read:755", "vxreporting:vxreporting-agents:775",
                          "vxreporting:vxreporting-read:750"], owners

    def step_who_may_look_into_the_service(self):
        """Root and a member of the group see sessions and messages as they come; an outsider is told that he may not."""
        client = self.opened(6)
        for user in ("root", "reader"):
            status = json.loads(self.m.run("vxreport status --json", user=user).stdout)
            assert status["service"]["sessions_started"] == 1, status["service"]
            assert json.loads(self.m.run("vxreport sessions --json", user=user).stdout)["session"] == 6
            tail = self.m.start("vxreport tail --session 6 --count 1", user)

            def seen():
                client.stdin.write("sendto 6 5 2 tailed=1\n")
                client.stdin.flush()
                return "tailed" in tail.said()
            self.m.wait_until(seen, "the message is seen as it comes", 20)
            assert tail.wait(10) == 0
        for command in ("status", "sessions", "tail"):
            refused = self.m.run(f"vxreport {command}", user="outsider", check=False)
            assert refused.returncode == 1 and refused.stderr.count("\n") == 1, refused
        client.stdin.close()
        client.wait(30)

    def step_watchdog_ends_what_does_not_move(self):
        self.m.run("mkdir -p /run/systemd/system/vxreporting.service.d && printf '[Service]\\nWatchdogSec=2\\n' "
                   ">/run/systemd/system/vxreporting.service.d/test.conf && systemctl daemon-reload && "
                   "systemctl restart vxreporting.service")
        before = self.pid()
        self.m.run(f"kill -STOP {before}")
        self.m.wait_until(lambda: self.pid() not in (0, before), "the watchdog has restarted it")
        self.report()
        self.m.run("rm -r /run/systemd/system/vxreporting.service.d && systemctl daemon-reload && "
                   "systemctl restart vxreporting.service")

    def step_crash_loses_nothing(self):
        client = self.opened(2)
        before = self.pid()
        self.m.run(f"kill -SEGV {before}")
        self.report()  # waits in the socket
        assert self.pid() not in (0, before)
        client.stdin.close()
        client.wait(30)
        self.expect(["crashed"], "SELECT ended_how FROM relay_messages m JOIN relay_sessions s ON s.id = m.relay_session "
                                 "WHERE s.session_id = 2 AND category = 5")

    def step_kill_in_a_loop(self):
        """More often than a start limit would allow."""
        for _ in range(12):
            before = self.pid()
            self.m.run("vxreport kill")
            self.report()
            assert self.pid() not in (0, before)

    def step_stop_is_bounded(self):
        client = self.opened(3)
        began = time.monotonic()
        self.m.run("systemctl stop vxreporting.service")
        assert time.monotonic() - began < 10
        assert self.shown("Result") == "success"
        assert self.rows("SELECT ended_how FROM relay_sessions WHERE session_id = 3") == ["service_stopped"]
        client.stdin.close()
        client.wait(30)

    def step_upgrade_with_open_sessions(self):
        """What is sent all the time meanwhile is stored as far as it was accepted."""
        client = self.opened(4)
        keeping = [self.m.start(f"/clients/{name} {number}", "outsider") for number, name in enumerate(self.clients(), 11)]
        for process in keeping:
            self.hear(process)
        upgraded = threading.Event()

        def send():
            while not upgraded.wait(0.005):
                client.stdin.write("sendto 4 5 2 a=1\n")
                client.stdin.flush()
        sender = threading.Thread(target=send)
        sender.start()
        before = self.pid()
        try:
            self.install(self.newer())
        finally:
            upgraded.set()
            sender.join()
            client.stdin.close()
        assert self.pid() not in (0, before), "the upgrade has not restarted the service"
        assert "(deleted)" not in self.m.run(f"readlink /proc/{self.pid()}/exe").stdout
        client.wait(30)
        taken = client.said().count("taken")
        assert taken > 50, taken
        self.expect([f"service_stopped|{taken}"], "SELECT ended_how, count(*) FROM relay_messages m JOIN relay_sessions s "
                    "ON s.id = m.relay_session WHERE s.session_id = 4 AND category = 5 GROUP BY 1")
        for number, process in enumerate(keeping, 11):
            self.hear(process)
            process.stdin.close()
            assert process.wait(30) == 0, process.said()
            accepted = process.said().count("accepted")
            self.expect(["service_stopped", "stopped"], f"SELECT ended_how FROM relay_sessions WHERE session_id = {number}")
            self.expect([str(accepted)], "SELECT count(*) FROM relay_messages m JOIN relay_sessions s "
                        f"ON s.id = m.relay_session WHERE s.session_id = {number} AND category = 5")

    def clients(self):
        """Of each language, built against the packages by pkg-config alone."""
        subprocess.run(["cp", "-r", pathlib.Path(__file__).with_name("clients"), self.m.root], check=True)
        for build in ("cc -std=c11 client.c $(pkg-config --cflags --libs vxreporting) -o c",
                      "c++ -std=c++20 client.cpp $(pkg-config --cflags --libs vxreporting-cpp) -o cpp"):
            self.m.run("cd /clients && " + build.replace(" -std", " -Wall -Wextra -Wpedantic -Werror -std"))
        return "c", "cpp", "client.py"

    def hear(self, process):
        """Lets it send until five messages more are accepted: one that was under way when the service ended is not."""
        before = process.said().count("accepted")
        for _ in range(20):
            said = process.said().count("\n")
            process.stdin.write("\n")
            process.stdin.flush()
            self.m.wait_until(lambda: process.said().count("\n") > said, lambda: f"it goes on: {process.said()}")
            if process.said().count("accepted") == before + 5:
                return
        raise AssertionError(process.said())

    def newer(self):
        """The same packages under a higher version."""
        folder = self.packages / "newer"
        subprocess.run(["rm", "-rf", folder], check=True)
        folder.mkdir()
        for package in self.packages.glob("*.deb"):
            tree = folder / "tree"
            subprocess.run(["dpkg-deb", "-R", package, tree], check=True)
            control = tree / "DEBIAN/control"
            version = re.search(r"^Version: (.*)$", control.read_text(), re.M).group(1)
            control.write_text(control.read_text().replace(version, version + "+next"))
            subprocess.run(["dpkg-deb", "-b", "-Znone", tree, folder / package.name], check=True, stdout=subprocess.DEVNULL)
            subprocess.run(["rm", "-rf", tree], check=True)
        return folder

    def step_removal_keeps_and_purging_does_not(self):
        self.m.run("echo '# mine' >/etc/vxreporting/platform.toml")
        self.session(5)
        self.m.run("apt-get remove -y vxreporting", timeout=300)
        assert self.shown("ActiveState") == "inactive"
        assert self.m.run("test -S /run/vxreporting/service.socket || ls /proc/*/exe -l | grep vxreportingd",
                          check=False).returncode != 0
        assert self.rows("SELECT ended_how FROM relay_sessions WHERE session_id = 5") == ["stopped"]
        self.m.run("grep mine /etc/vxreporting/platform.toml")
        self.m.run("apt-get purge -y vxreporting", timeout=300)
        left = self.m.run("ls -d /var/lib/vxreporting /etc/vxreporting /var/log/vxreporting /run/vxreporting "
                          "/etc/systemd/system/sockets.target.wants/vxreporting.socket", check=False).stdout
        assert left == "", left


def main():
    arguments = argparse.ArgumentParser(description=__doc__)
    arguments.add_argument("--packages", type=pathlib.Path, required=True)
    arguments.add_argument("--folder", type=pathlib.Path, required=True, help="where the machine is made")
    options = arguments.parse_args()
    machine = Machine(options.folder.resolve())
    life = Life(machine, options.packages.resolve())
    began = time.monotonic()
    try:
        try:
            machine.boot()
        except AssertionError as failure:
            print(f"systemd-nspawn does not work here: {failure}")
            sys.exit(77)
        for name in [name for name in vars(Life) if name.startswith("step_")]:
            at = time.monotonic()
            try:
                getattr(life, name)()
            except BaseException:
                print(machine.run("journalctl --no-pager -n 15", check=False).stdout)
                raise
            print(f"ok {time.monotonic() - at:5.1f} s  {name.removeprefix('step_').replace('_', ' ')}", flush=True)
    finally:
        machine.power_off()
    print(f"The packages keep their promises ({time.monotonic() - began:.0f} s).")


if __name__ == "__main__":
    main()
