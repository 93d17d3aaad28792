"""The client printed in docs/protocol.md and the vxreport tool, each with the real daemon."""
import os
import pathlib
import re
import subprocess
import sys

from harness import Daemon, DaemonTest

VXREPORT = os.environ["VXREPORT"]
ROOT = pathlib.Path(__file__).resolve().parents[2]
PAGE = (ROOT / "docs/protocol.md").read_text()


def run(daemon, *command, stdin=""):
    return subprocess.run(command, input=stdin, capture_output=True, text=True, timeout=30,
                          env=dict(os.environ, VXREPORTING_SOCKET=daemon.socket_path))


class ClientsTest(DaemonTest):
    def test_the_client_of_the_protocol_page_works_as_printed(self):
        daemon = self.daemon()
        program = re.search(r"```python\n(.*?)```", PAGE, re.S).group(1)
        ended = run(daemon, sys.executable, "-c", program)
        self.assertEqual((ended.stdout.split(), ended.stderr), (["True", "True", "None", "True", "True"], ""))

    def test_the_programs_of_the_clients_page_report_the_same(self):
        page = (ROOT / "docs/clients.md").read_text()
        python = re.search(r"```python\n(.*?)```", page, re.S).group(1)
        frames = bytes.fromhex(re.search(r"```\n(03000000.*?)```", page, re.S).group(1))
        for program in (*([p] for p in os.environ["PAGE_CLIENTS"].split(":")), [sys.executable, "-c", python], None):
            daemon = self.daemon()
            if program:
                ended = run(daemon, *program)
                self.assertEqual((ended.returncode, ended.stdout, ended.stderr), (0, "", ""))
            else:
                client = daemon.client(hello=False)
                client.raw(frames)
                client.until_closed()
                self.assertEqual([client.answers[n][-1][2] for n in (1, 2, 3, 4, 5)], [True, True, True, None, True])
            self.assertEqual(daemon.stop(), 0)
            self.assertEqual(daemon.rows("SELECT session_id, service_type, category, type, payload FROM session_messages "
                                         "WHERE category = 5"), [(42, "longformaudio", 5, 1, '{"gain":0.5}')])

    def test_the_frames_printed_on_the_protocol_page_are_answered_as_printed(self):
        frames = {text: bytes.fromhex(code) for code, text in
                  re.findall(r"^ {4}((?:[0-9a-f]{2} +)+)(\[.*\])$", PAGE, re.M)}
        client = self.daemon().client()
        client.raw(frames["[1, 3, 2, 7, 42]"] + frames['[1, 4, 1, "x"]'] + frames["[4]"])
        client.until_closed()
        self.assertEqual(client.answers[3], [[2, 3, True]])
        self.assertEqual(client.answers[4][0][:3], [3, 4, 4])
        self.assertIn(client.answers[4][0][3][:44], PAGE)

    def test_a_program_in_c(self):
        daemon = self.daemon()
        ended = run(daemon, os.environ["C_CLIENT"])
        self.assertEqual((ended.returncode, ended.stderr), (0, ""))
        self.assertEqual(daemon.stop(), 0)
        self.assertEqual(daemon.rows("SELECT payload FROM session_messages WHERE session_id = 42 AND category = 3"),
                         [('{"frames":-3,"gain":0.5,"on":true,"at":"1970-01-01T00:00:00Z","inner":{"route":"Speaker"},'
                           '"ints":[1,-2],"doubles":[0.5],"names":["keyboard","game"]}',)])
        self.assertEqual(daemon.rows("SELECT payload FROM session_messages WHERE session_id = 6 AND category = 4"),
                         [('{"frames":-3,"peak":0.5,"on":true}',)])

    def test_sessions_of_a_program_in_c_outlive_the_service(self):
        for end in (Daemon.kill, Daemon.stop):
            daemon = self.daemon()
            with subprocess.Popen([os.environ["C_CLIENT"], "keep"], stdin=subprocess.PIPE, stdout=subprocess.PIPE, text=True,
                                  env=dict(os.environ, VXREPORTING_SOCKET=daemon.socket_path)) as program:
                self.assertEqual(program.stdout.readline(), "started\n")
                end(daemon)
                program.stdin.write("\n")
                program.stdin.flush()
                self.assertEqual(program.stdout.readline(), "sent\n")
                daemon.start()
                self.assertEqual(program.wait(30), 0)
            self.assertEqual(daemon.stop(), 0)
            self.assertEqual(daemon.rows("SELECT payload FROM session_messages WHERE session_id = 7 AND category = 3"),
                             [('{"sent":"while it was away"}',)])
            self.assertEqual(daemon.rows("SELECT count(*) FROM relay_sessions WHERE session_id = 7 AND service_name LIKE 'telephony%'"),
                             [(2,)])

    def test_the_c_library_exports_its_api_alone_and_needs_no_other(self):
        shown = subprocess.run(["readelf", "--wide", "--dyn-syms", "--dynamic", os.environ["LIBVXREPORTING"]],
                               capture_output=True, text=True, check=True).stdout
        defined = set(re.findall(r"(?:GLOBAL|WEAK|UNIQUE) +DEFAULT +(?!UND)\S+ (\S+)$", shown, re.M))
        declared = set(re.findall(r"VXR_API [\w *]*?(vxr_\w+)\(", (ROOT / "client/vxreporting.h").read_text()))
        self.assertEqual(defined, {"VXREPORTING_0"} | {name + "@@VXREPORTING_0" for name in declared})
        self.assertLessEqual(set(re.findall(r"NEEDED.*\[(\w+)", shown)), {"libstdc", "libgcc_s", "libc", "libm", "ld"})
        self.assertIn("[libvxreporting.so.0]", shown)

    def test_a_script_of_vxreport_holds_one_connection(self):
        daemon = self.daemon()
        script = ("create 7\ntype 7 2\nconfigure 7 HostApplicationDisplayID=org.example.shell\nstart 7\n"
                  "# a remark\nsend 0x08000005 1 gain=0.5 frames=3 on=true route=Speaker\nreporters\n"
                  "validate 7\nstop 7\n")
        ended = run(daemon, VXREPORT, "script", stdin=script)
        self.assertEqual(ended.stdout.splitlines(),
                         ["true", "true", "true", "started; answered when it stops", "taken", "7",
                          "reporterID=7 serviceType=2", "session 7: ended", "true"])
        self.assertEqual((ended.returncode, ended.stderr), (0, ""))
        self.assertEqual(daemon.stop(), 0)
        self.assertEqual(daemon.rows("SELECT payload FROM analytics_events WHERE name LIKE '%Session_Setup.Start'"),
                         [('{"gain":0.5,"frames":3,"on":true,"route":"Speaker",'
                           '"HostApplicationDisplayID":"org.example.shell"}',)])

    def test_vxreport_says_what_is_wrong(self):
        strict = self.daemon(config="[listener]\nkill_allowed_users = []\n")
        refused = run(strict, VXREPORT, "kill")
        self.assertEqual(refused.returncode, 1)
        self.assertIn("kill_allowed_users", refused.stderr)
        self.assertEqual(strict.stop(), 0)
        self.assertIn("not_permitted=1", strict.log())
        daemon = self.daemon()
        self.assertEqual(run(daemon, VXREPORT, "type", "7", "65536").returncode, 2)
        self.assertIn("cannot use: fly 7", run(daemon, VXREPORT, "script", stdin="fly 7\n").stderr)
        checked = run(daemon, VXREPORT, "check-config", daemon.folder + "/etc")
        self.assertEqual((checked.returncode, checked.stderr), (0, ""))
        daemon.replace_file("etc/platform.toml", "[store]\nmax_bytes = 1\n")
        checked = run(daemon, VXREPORT, "check-config", daemon.folder + "/etc")
        self.assertEqual((checked.returncode, checked.stdout), (1, ""))
        self.assertIn("etc/platform.toml:2: store.max_bytes: must be", checked.stderr)
        self.assertEqual(run(daemon, VXREPORT, "check-config", "/nonexistent").returncode, 1)
        self.assertEqual(run(daemon, VXREPORT, "kill").returncode, 0)
        self.assertEqual(daemon.process.wait(20), 2)
        away = run(daemon, VXREPORT, "reporters")
        self.assertEqual(away.returncode, 1)
        self.assertIn(daemon.socket_path, away.stderr)
