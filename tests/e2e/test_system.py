"""Preferences, summaries and orientation, on real files and a real bus."""
import itertools
import json
import re
import select

from harness import *


class PreferencesTest(DaemonTest):
    def setUp(self):
        self.d = self.daemon(config="[preferences]\nsettle_ms = 20\n")
        self.file = f"{self.d.folder}/etc/preferences/com.quorvel.sonik.toml"
        os.makedirs(os.path.dirname(self.file), exist_ok=True)
        self.c = self.d.client()

    def assert_switched(self, off):
        want = {"domain": "com.quorvel.audio.reporting", "code": 1} if off else None
        self.d.wait_until(lambda: self.c.call(SEND, {"a": 1}, 3, 1, []) == want, f"reporting is {'off' if off else 'on'}")

    def test_switching_off_and_on_however_the_file_is_edited(self):
        with open(self.file, "w") as f:
            f.write("disable_reporting = true\n")
        self.assert_switched(off=True)
        subprocess.run(["sed", "-i", "s/true/false/", self.file], check=True)
        self.assert_switched(off=False)
        replace(self.file, "disable_reporting = true\n")
        self.assert_switched(off=True)
        replace(self.file, "disable_reporting = = false\n")  # a broken file leaves the last good values
        self.d.wait_until(lambda: re.search(r"com.quorvel.sonik.toml:1:\d+", self.d.log()), "line and column are logged")
        self.assert_switched(off=True)
        os.remove(self.file)
        self.assert_switched(off=False)

    def test_defaults_reach_sessions_and_verbose_keys_take_effect(self):
        self.assertNotIn("creating session for reporter", self.d.log())
        self.c.call(CREATE, 1)
        replace(self.file, "device_name = 'Pocket'\nreporting_server_verbose = true\n")
        # The keys are told to the sessions before a verbose line can appear.
        self.d.wait_until(lambda: self.c.call(CREATE, 2) and "creating session for reporter 2" in self.d.log(),
                          "verbose lines appear")
        self.c.post(START, 1)
        self.c.call(STOP, 1)
        self.assertEqual(self.d.stop(), 0)
        ((info,),) = self.d.rows("SELECT user_info FROM relay_sessions WHERE session_id = 1")
        info = json.loads(info)
        self.assertEqual((info["device_name"], info["disable_reporting"]), ("Pocket", 0))


class SummaryTest(DaemonTest):
    def test_file_and_event(self):
        d = self.daemon(config=INTERNAL)
        c = d.client()
        message = {"a b": 1, "text": "ü\n\"", "nested": {"x": [1, 2.5, True]}}
        c.session(3, {"HostApplicationDisplayID": "com.example.phone"}, message)
        (path,) = d.summaries()
        self.assertRegex(os.path.basename(path), r"^\d{8}-\d{6}[+-]\d{4}-sonik-com\.example\.phone-telephony\.json$")
        with open(path) as f:
            first, second, *_, last = json.load(f)
        self.assertEqual(first, {"HostApplicationDisplayID": "com.example.phone"})
        message["a_b"] = message.pop("a b")
        self.assertEqual(second, {"Playback_Start_1": message})
        self.assertEqual(last["Undefined_Unknown_1"]["VX_Session_Summary_Event"], "2")
        self.assertEqual(os.stat(os.path.dirname(path)).st_mode & 0o777, 0o777)
        # Names that would lead elsewhere name a file of this folder all the same.
        hostile = ["../../x", "", "x" * 4096, "nul\0byte"]
        for reporter, application in enumerate(hostile, 10):
            c.session(reporter, {"HostApplicationDisplayID": application})
        found = [os.path.relpath(p, f"{d.folder}/log") for p, _, names in os.walk(f"{d.folder}/log") for _ in names]
        self.assertEqual(found, ["Audio/Reporting"] * (len(hostile) + 1))
        shutil.rmtree(f"{d.folder}/log")
        os.symlink("/proc/self", f"{d.folder}/log")  # nobody makes a folder or a file there, root included
        c.session(20)
        for said in ("can't create logging directory at", "jsonOutput writeToURL:"):
            self.assertEqual(d.log().count(said), 1)
        os.remove(f"{d.folder}/log")
        c.session(21)
        self.assertEqual(len(d.summaries()), 1)
        self.assertEqual(d.stop(), 0)
        ((category, payload),) = d.rows("SELECT category, payload FROM relay_messages WHERE id = (SELECT max(m.id) FROM"
                                        " relay_messages m JOIN relay_sessions s ON s.id = relay_session WHERE session_id = 3)")
        self.assertEqual((category, json.loads(payload)), (0xFFFF, last["Undefined_Unknown_1"]))


class Sensor:
    def __init__(self, address, refusals=0):
        script = os.path.join(os.path.dirname(os.path.abspath(__file__)), "fake_sensor.py")
        self.process = subprocess.Popen(["/usr/bin/python3", script, address, str(refusals)], stdin=subprocess.PIPE,
                                        stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, bufsize=0)
        self.said = b""

    def answers(self, n):
        """The next n lines that it says, fewer when it says no more."""
        while self.said.count(b"\n") < n and select.select([self.process.stdout], [], [], PATIENCE)[0]:
            said = self.process.stdout.read(4096)
            if not said:
                break
            self.said += said
        *lines, self.said = self.said.split(b"\n", n)
        return [line.decode() for line in lines]

    def turn(self, *words):
        """Turns the device, and waits until the daemon knows."""
        for word in words:
            self.process.stdin.write(f"{word}\n".encode())
        return self.answers(len(words))

    def leave(self):
        self.process.stdin.close()
        self.process.wait(PATIENCE)
        self.process.stdout.close()


@unittest.skipUnless(shutil.which("dbus-daemon") and subprocess.run(
    ["/usr/bin/python3", "-c", "import dbus, gi"], stderr=subprocess.DEVNULL).returncode == 0,
    "dbus-daemon, python3-dbus and python3-gi are not installed")
class OrientationTest(DaemonTest):
    def setUp(self):
        self.folder = tempfile.mkdtemp(prefix="vx")
        self.address = f"unix:path={self.folder}/bus"
        self.d = self.daemon(config=INTERNAL + "[orientation]\ndevice_sensor = true\n", folder=self.folder,
                             environment={"DBUS_SYSTEM_BUS_ADDRESS": self.address})
        self.c = self.d.client()

    def start_bus(self):
        bus = subprocess.Popen(["dbus-daemon", "--session", "--nofork", f"--address={self.address}", "--print-address"],
                               stdout=subprocess.PIPE)
        self.addCleanup(lambda: (bus.kill(), bus.wait(), bus.stdout.close()))
        bus.stdout.readline()  # printed once it listens
        return bus

    def sensor(self, refusals=0):
        sensor = Sensor(self.address, refusals)
        self.addCleanup(sensor.leave)
        # Once the daemon has asked for the present word, which is no change.
        self.assertEqual(sensor.answers(refusals + 1), ["refused"] * refusals + ["asked"])
        return sensor

    def words(self, key, reporter=1):
        """Stops the session, and what it was told."""
        self.c.call(SEND, {"a": 1}, 3, 1, [reporter])
        self.c.call(STOP, reporter)
        with open(self.d.summaries()[-1]) as f:
            return list(json.load(f)[-1].values())[0].get(key, "").split(",")

    def test_bus_that_comes_late_and_dies_and_sensor_that_wakes_up_and_comes_back(self):
        self.c.started(1, 7)
        self.d.wait_until(lambda: "device orientation is off for now" in self.d.log(), "the bus is looked for")
        bus = self.start_bus()
        sensor = self.sensor(refusals=2)
        self.assertEqual(sensor.turn("normal", "left-up"), ["told"] * 2)
        sensor.leave()
        sensor = self.sensor()
        self.assertEqual(sensor.turn("right-up"), ["told"])
        bus.kill()
        bus.wait()
        self.d.wait_until(lambda: "the system bus is gone" in self.d.log(), "the loss is noticed")
        self.assert_unharmed(self.d)
        os.remove(f"{self.folder}/bus")
        self.start_bus()
        self.assertEqual(self.sensor().turn("bottom-up"), ["told"])
        words = self.words("device_orientation")
        self.assertEqual(words[:4], ["normal", "left-up", "undefined", "right-up"])
        self.assertEqual(words[-1], "bottom-up")
        self.assertEqual(self.d.log().count("device orientation is off for now"), 1)  # nothing is said of what lasts
        self.assertEqual(self.d.stop(), 0)

    def test_interface_orientation_from_the_state_file(self):
        # Nobody sees when the file has been read: sessions of growing length, until one is told of the change.
        for reporter in itertools.count(1):
            self.c.started(reporter, 2, {"HostApplicationDisplayID": f"{reporter:04}"})
            for word in ("portrait", "landscape-left"):
                replace(f"{self.folder}/run/interface-orientation", word + "\n")
                time.sleep(0.05 * reporter)
            words = self.words("ui_orientation", reporter)
            self.assertLess(reporter, 20, words)
            if words[-1] == "landscape-left":
                break
