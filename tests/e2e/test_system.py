"""Preferences, summaries and orientation, on real files and a real bus."""
import json
import os
import re
import resource
import shutil
import subprocess
import time
import unittest

from harness import *

PREFERENCES = "com.quorvel.sonik.toml"
INTERNAL = "[device]\ninternal_build = true\n[preferences]\nsettle_ms = 20\n"


class PreferencesTest(DaemonTest):
    def setUp(self):
        self.d = self.daemon(config="[preferences]\nsettle_ms = 20\n")
        self.file = f"{self.d.folder}/etc/preferences/{PREFERENCES}"
        os.makedirs(os.path.dirname(self.file), exist_ok=True)
        self.c = self.d.client()

    def write(self, text):
        with open(self.file, "w") as f:
            f.write(text)

    def send(self):
        return self.c.call(SEND, {"a": 1}, 3, 1, [])

    def assert_switched(self, off):
        want = {"domain": "com.quorvel.audio.reporting", "code": 1} if off else None
        self.d.wait_until(lambda: self.send() == want, f"reporting is {'off' if off else 'on'}")

    def test_switching_off_and_on_however_the_file_is_edited(self):
        self.write("disable_reporting = true\n")
        self.assert_switched(off=True)
        subprocess.run(["sed", "-i", "s/true/false/", self.file], check=True)
        self.assert_switched(off=False)
        with open(self.file + ".new", "w") as f:
            f.write("disable_reporting = true\n")
        os.rename(self.file + ".new", self.file)
        self.assert_switched(off=True)
        os.rename(self.file, self.file + "~")
        self.write("device_name = 'x'\n")
        self.assert_switched(off=False)
        self.write("disable_reporting = true\n")
        self.assert_switched(off=True)
        os.remove(self.file)
        self.assert_switched(off=False)

    def test_defaults_reach_sessions_and_verbose_keys_take_effect(self):
        self.assertNotIn("creating session for reporter", self.d.log())
        self.c.call(CREATE, 1)
        self.write("device_name = 'Pocket'\nreporting_server_verbose = true\n")
        self.d.wait_until(lambda: "re-reading sonik defaults" in self.d.log(), "the preferences are read")
        self.c.call(CREATE, 2)
        self.d.wait_until(lambda: "creating session for reporter 2" in self.d.log(), "verbose lines appear")
        self.c.post(START, 1)
        self.c.call(STOP, 1)
        self.assertEqual(self.d.stop(), 0)
        ((info,),) = self.d.rows("SELECT user_info FROM relay_sessions WHERE session_id = 1")
        self.assertEqual(json.loads(info)["device_name"], "Pocket")
        self.assertEqual(json.loads(info)["disable_reporting"], 0)

    def test_a_broken_file_keeps_the_last_good_values(self):
        self.write("disable_reporting = true\n")
        self.assert_switched(off=True)
        self.write("disable_reporting = = false\n")
        self.d.wait_until(lambda: re.search(PREFERENCES + r":1:\d+", self.d.log()), "line and column are logged")
        self.assert_switched(off=True)
        os.remove(self.file)
        os.mkfifo(self.file)
        self.d.wait_until(lambda: self.d.log().count("re-reading sonik defaults") >= 3, "the change is seen")
        self.assert_switched(off=True)
        os.remove(self.file)
        self.assert_switched(off=False)


class SummaryTest(DaemonTest):
    def run_session(self, d, application="com.example.phone", reporter=3, extra=None):
        c = d.client()
        c.started(reporter, 2, dict({"HostApplicationDisplayID": application} if application is not None else {},
                                    **(extra or {})))
        c.call(SEND, {"a b": 1, "text": "ü\n\"", "nested": {"x": [1, 2.5, True]}}, 3, 1, [reporter])
        c.call(SEND, {"a_b": 2}, 3, 1, [reporter])
        c.call(STOP, reporter)
        return c

    def files(self, d):
        folder = f"{d.folder}/log/Audio/Reporting"
        return sorted(f"{folder}/{n}" for n in os.listdir(folder)) if os.path.isdir(folder) else []

    def test_file_and_event(self):
        d = self.daemon(config=INTERNAL)
        self.run_session(d)
        (path,) = self.files(d)
        self.assertRegex(os.path.basename(path), r"^\d{8}-\d{6}[+-]\d{4}-sonik-com\.example\.phone-telephony\.json$")
        with open(path) as f:
            text = f.read()
        content = json.loads(text)
        self.assertGreater(text.count("\n"), 10)
        self.assertEqual(content[0], {"HostApplicationDisplayID": "com.example.phone"})
        self.assertEqual(content[1], {"Playback_Start_1": {"a_b": 1, "text": "ü\n\"", "nested": {"x": [1, 2.5, True]}}})
        self.assertEqual(content[2], {"Playback_Start_2": {"a_b": 2}})
        summary = content[-1]["Undefined_Unknown_1"]
        self.assertEqual(summary["VX_Session_Summary_Event"], "2")
        self.assertEqual(summary["a_b"], "1,2")
        self.assertEqual(os.stat(os.path.dirname(path)).st_mode & 0o777, 0o777)
        self.assertEqual([n for n in os.listdir(os.path.dirname(path)) if not n.endswith(".json")], [])
        self.assertEqual(d.stop(), 0)
        last = d.rows("SELECT category, type, payload FROM relay_messages ORDER BY id DESC LIMIT 1")[0]
        self.assertEqual((last[0], last[1], json.loads(last[2])), (0xFFFF, 0xFFFF, summary))

    def test_hostile_names_stay_in_the_directory(self):
        d = self.daemon(config=INTERNAL)
        names = ["../../x", "a/b", "", "x" * 4096, "..", "nul\0byte", "new\nline"]
        for i, name in enumerate(names):
            self.run_session(d, name, 10 + i)
        self.run_session(d, None, 30)
        self.assertEqual(len(self.files(d)), len(names) + 1)
        found = [os.path.relpath(os.path.join(p, n), d.folder + "/log")
                 for p, _, ns in os.walk(d.folder + "/log") for n in ns]
        self.assertTrue(all(os.path.dirname(f) == "Audio/Reporting" for f in found), found)
        self.assertEqual(sum("-sonik-unknown-telephony.json" in f for f in found), 1)

    def test_planted_links_and_missing_directories(self):
        d = self.daemon(config=INTERNAL)
        victim = d.folder + "/victim"
        os.mkdir(victim)
        os.symlink(victim, d.folder + "/log/Audio")
        self.run_session(d)
        self.assertEqual(os.listdir(victim), [])
        self.assertIn("can't create logging directory at", d.log())
        self.assertIn("jsonOutput writeToURL:", d.log())
        os.remove(d.folder + "/log/Audio")
        open(d.folder + "/log/Audio", "w").close()  # a file in the directory's place
        self.run_session(d, reporter=4)
        os.remove(d.folder + "/log/Audio")
        shutil.rmtree(d.folder + "/log")
        self.run_session(d, reporter=5)
        self.assertEqual(len(self.files(d)), 1)

    def test_full_and_unwritable_directories(self):
        d = self.daemon(config=INTERNAL)
        c = self.run_session(d)
        whole = self.files(d)
        c.started(4, 2)
        for i in range(50):
            c.call(SEND, {"text": "x" * 200}, 3, 1, [4])
        # No file of the daemon may grow any more: to the writer that is a full disk.
        resource.prlimit(d.process.pid, resource.RLIMIT_FSIZE, (4096, resource.RLIM_INFINITY))
        self.assertIs(c.call(STOP, 4), True)
        resource.prlimit(d.process.pid, resource.RLIMIT_FSIZE, (resource.RLIM_INFINITY, resource.RLIM_INFINITY))
        self.assertRegex(d.log(), r"jsonOutput writeToURL: .*[Ff]ile too large")
        self.assertEqual(self.files(d), whole)
        shutil.rmtree(d.folder + "/log")
        os.symlink("/proc/self", d.folder + "/log")  # nobody makes a folder or a file there, root included
        c.started(5, 2)
        c.call(SEND, {"a": 1}, 3, 1, [5])
        self.assertIs(c.call(STOP, 5), True)
        self.assertEqual(d.log().count("can't create logging directory at"), 1)
        self.assertEqual(d.log().count("jsonOutput writeToURL:"), 2)
        os.remove(d.folder + "/log")
        self.run_session(d, reporter=6)
        self.assertEqual(len(self.files(d)), 1)

    def test_two_stops_in_one_second_leave_the_later_file_whole(self):
        d = self.daemon(config=INTERNAL)
        c = d.client()
        for attempt in range(10):
            for n in (1, 2):
                c.started(n, 2)
                c.call(SEND, {"n": n, "attempt": attempt}, 3, 1, [n])
            c.answer([c.post(STOP, n) for n in (1, 2)][1])
            mine = [f for f in map(self.content, self.files(d)) if f[1]["Playback_Start_%d" % (attempt + 1)]["attempt"] == attempt]
            if len(mine) == 1:
                break
        self.assertEqual(mine[0][1]["Playback_Start_%d" % (attempt + 1)]["n"], 2)
        self.assertEqual(len(mine[0]), 3)

    def content(self, path):
        with open(path) as f:
            return json.load(f)

    def test_no_file_on_other_builds(self):
        d = self.daemon()
        self.run_session(d)
        self.assertEqual(os.listdir(d.folder + "/log"), [])


HAVE_BUS = shutil.which("dbus-daemon") and subprocess.run(
    ["/usr/bin/python3", "-c", "import dbus, gi"], stderr=subprocess.DEVNULL).returncode == 0


class Sensor:
    def __init__(self, address, refusals=0):
        script = os.path.join(os.path.dirname(os.path.abspath(__file__)), "fake_sensor.py")
        self.process = subprocess.Popen(["/usr/bin/python3", script, address, str(refusals)], stdin=subprocess.PIPE,
                                        stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True)

    def answers(self, n):
        return [self.process.stdout.readline().strip() for _ in range(n)]

    def turn(self, word):
        self.process.stdin.write(word + "\n")
        self.process.stdin.flush()

    def leave(self):
        self.process.stdin.close()
        self.process.wait(PATIENCE)
        self.process.stdout.close()


@unittest.skipUnless(HAVE_BUS, "dbus-daemon, python3-dbus and python3-gi are not installed")
class SensorFaultsTest(DaemonTest):
    def setUp(self):
        self.folder = tempfile.mkdtemp(prefix="vx")
        self.address = f"unix:path={self.folder}/bus"
        self.d = self.daemon(config=INTERNAL, folder=self.folder, device_sensor=True,
                             environment={"DBUS_SYSTEM_BUS_ADDRESS": self.address})
        self.c = self.d.client()

    def start_bus(self):
        bus = subprocess.Popen(["dbus-daemon", "--session", "--nofork", f"--address={self.address}"],
                               stdout=subprocess.DEVNULL)
        self.addCleanup(lambda: (bus.kill(), bus.wait()))
        self.d.wait_until(lambda: os.path.exists(f"{self.folder}/bus"), "the bus listens")
        return bus

    def words(self):
        """Stops the session, and what it was told of the device."""
        self.c.call(SEND, {"a": 1}, 3, 1, [1])
        self.c.call(STOP, 1)
        (name,) = os.listdir(f"{self.folder}/log/Audio/Reporting")
        with open(f"{self.folder}/log/Audio/Reporting/{name}") as f:
            return list(json.load(f)[-1].values())[0]["device_orientation"].split(",")

    def turn_until_told(self, sensor, words):
        """The first word that is known is no change; those behind it are."""
        self.assertEqual(sensor.answers(1), ["claimed"])
        time.sleep(0.1)  # the question for the present word, right behind the claim
        for word in words:
            sensor.turn(word)
        time.sleep(0.1)

    def test_claim_refused_while_the_sensor_wakes_up_is_tried_again(self):
        self.start_bus()
        self.c.started(1, 7)
        sensor = Sensor(self.address, refusals=2)
        self.assertEqual(sensor.answers(2), ["refused", "refused"])
        self.turn_until_told(sensor, ["normal", "left-up"])
        self.assertEqual(self.words(), ["normal", "left-up"])
        sensor.leave()

    def test_sensor_that_vanishes_and_comes_back(self):
        self.start_bus()
        self.c.started(1, 7)
        sensor = Sensor(self.address)
        self.turn_until_told(sensor, ["normal"])
        sensor.leave()
        sensor = Sensor(self.address)
        self.turn_until_told(sensor, ["left-up"])
        self.assertEqual(self.words(), ["normal", "undefined", "left-up"])
        sensor.leave()

    def test_bus_that_dies_under_registered_handlers(self):
        bus = self.start_bus()
        self.c.started(1, 7)
        sensor = Sensor(self.address)
        self.turn_until_told(sensor, ["normal"])
        bus.kill()
        bus.wait()
        self.d.wait_until(lambda: "the system bus is gone" in self.d.log(), "the loss is noticed")
        self.assert_unharmed(self.d)
        os.remove(f"{self.folder}/bus")
        self.start_bus()
        sensor.leave()
        sensor = Sensor(self.address)
        self.turn_until_told(sensor, ["left-up"])
        self.assertEqual(self.words()[-1], "left-up")
        sensor.leave()
        self.assertEqual(self.d.stop(), 0)

    def test_nothing_to_watch_is_said_once(self):
        for i in range(3):
            self.c.started(i + 1, 7)
            self.d.wait_until(lambda: "device orientation is off for now" in self.d.log(), "the bus is looked for")
            time.sleep(0.1)  # the watcher of a later session looks in its own time
            self.c.call(STOP, i + 1)
        self.assertEqual(self.d.log().count("device orientation is off for now"), 1)


class OrientationTest(DaemonTest):
    def summary(self, d):
        (name,) = os.listdir(f"{d.folder}/log/Audio/Reporting")
        with open(f"{d.folder}/log/Audio/Reporting/{name}") as f:
            return list(json.load(f)[-1].values())[0]

    def test_interface_orientation_from_the_state_file(self):
        folder = tempfile.mkdtemp(prefix="vx")
        d = self.daemon(config=INTERNAL, folder=folder)
        state = folder + "/run/interface-orientation"
        with open(state, "w") as f:
            f.write("portrait\n")
        c = d.client()
        c.started(1, 2)
        time.sleep(0.1)  # the agent writes some time after the session began
        with open(state + ".new", "w") as f:
            f.write("landscape-left\n")
        os.rename(state + ".new", state)
        time.sleep(0.3)
        c.call(SEND, {"a": 1}, 3, 1, [1])
        c.call(STOP, 1)
        summary = self.summary(d)
        self.assertEqual(summary["ui_orientation"].split(",")[-1], "landscape-left")
        self.assertGreater(float(summary["ui_orientation_time"].split(",")[-1]), 0)

    @unittest.skipUnless(shutil.which("dbus-daemon") and subprocess.run(
        ["/usr/bin/python3", "-c", "import dbusmock"], stderr=subprocess.DEVNULL).returncode == 0,
        "dbus-daemon and python3-dbusmock are not installed")
    def test_device_orientation_from_the_sensor_proxy(self):
        bus = subprocess.Popen(["dbus-daemon", "--session", "--nofork", "--print-address=1"], stdout=subprocess.PIPE)
        self.addCleanup(lambda: (bus.kill(), bus.wait(), bus.stdout.close()))
        address = bus.stdout.readline().decode().strip()
        environment = dict(os.environ, DBUS_SYSTEM_BUS_ADDRESS=address, DBUS_SESSION_BUS_ADDRESS=address)
        d = self.daemon(config=INTERNAL, device_sensor=True, environment={"DBUS_SYSTEM_BUS_ADDRESS": address})
        c = d.client()
        c.started(1, 7)
        # The sensor appears after the session has begun.
        mock = subprocess.Popen(["/usr/bin/python3", "-m", "dbusmock", "--system", "--template", "iio-sensors-proxy"],
                                env=environment, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        self.addCleanup(lambda: (mock.kill(), mock.wait()))

        tool = os.path.join(os.path.dirname(os.path.abspath(__file__)), "../../tools/turn-device")

        def turn(word):
            return subprocess.run([tool, address, word], stderr=subprocess.DEVNULL).returncode == 0

        d.wait_until(lambda: turn("normal"), "the sensor answers")
        words = ["left-up", "right-up"]
        c.call(SEND, {"a": 1}, 3, 1, [1])
        # The claim follows the sensor's appearance in its own time; only changes after it are told.
        for i in range(8):
            turn(words[i % 2])
            time.sleep(0.2)
        c.call(STOP, 1)
        summary = self.summary(d)
        self.assertIn("device_orientation", summary, d.log()[-2000:])
        self.assertTrue({"left-up", "right-up"} & set(summary["device_orientation"].split(",")))


if __name__ == "__main__":
    unittest.main()
