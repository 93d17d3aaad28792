"""Preferences, summaries and orientation, on real files and a real bus."""
import json

from harness import *


class PreferencesTest(DaemonTest):
    def test_edits_reach_messages_sessions_and_the_log(self):
        d = self.daemon(config="[preferences]\nsettle_ms = 20\n")
        prefer = lambda text: d.replace_file("etc/preferences/com.quorvel.sonik.toml", text)
        c = d.client()
        sent = lambda: c.call(SEND, {"a": 1}, 3, 1, [])
        c.call(CREATE, 1)
        prefer("device_name = 'Pocket'\ndisable_reporting = true\nreporting_server_verbose = true\n")
        d.wait_until(lambda: sent() == {"domain": "com.quorvel.audio.reporting", "code": 1}, "reporting is off")
        d.wait_until(lambda: c.call(CREATE, 2) and "creating session for reporter 2" in d.log(), "verbose lines appear")
        self.assertNotIn("creating session for reporter 1", d.log())
        prefer("disable_reporting = = false\n")  # a broken file leaves the last good values
        d.wait_until(lambda: "com.quorvel.sonik.toml:1:" in d.log(), "the line is logged")
        self.assertIsNotNone(sent())
        prefer("device_name = 'Pocket'\n")
        d.wait_until(lambda: sent() is None, "reporting is on")
        c.post(START, 1)
        c.call(STOP, 1)
        self.assertEqual(d.stop(), 0)
        ((info,),) = d.rows("SELECT user_info FROM relay_sessions WHERE session_id = 1")
        self.assertEqual(json.loads(info)["device_name"], "Pocket")


class SummaryTest(DaemonTest):
    def test_file_and_event(self):
        d = self.daemon(config=INTERNAL)
        c = d.client()
        message = {"a b": 1, "text": "ü\n\"", "nested": {"x": [1, 2.5, True]}}
        c.session(3, {"HostApplicationDisplayID": "com.example.phone"}, message)
        (path,) = d.summaries()
        self.assertRegex(os.path.basename(path), r"^\d{8}-\d{6}[+-]\d{4}-sonik-com\.example\.phone-telephony\.json$")
        first, second, *_, last = json.loads(pathlib.Path(path).read_text())
        self.assertEqual(first, {"HostApplicationDisplayID": "com.example.phone"})
        message["a_b"] = message.pop("a b")
        self.assertEqual(second, {"Playback_Start_1": message})
        self.assertEqual(last["Undefined_Unknown_1"]["VX_Session_Summary_Event"], "2")
        self.assertEqual(d.stop(), 0)
        ((category, payload),) = d.rows("SELECT category, payload FROM relay_messages ORDER BY id DESC LIMIT 1")
        self.assertEqual((category, json.loads(payload)), (0xFFFF, last["Undefined_Unknown_1"]))


class Sensor:
    def __init__(self, address, refusals=0):
        script = os.path.join(os.path.dirname(os.path.abspath(__file__)), "fake_sensor.py")
        self.process = subprocess.Popen(["timeout", str(PATIENCE), "/usr/bin/python3", script, address, str(refusals)], text=True,
                                        bufsize=1, stdin=subprocess.PIPE, stdout=subprocess.PIPE, stderr=subprocess.DEVNULL)

    def answers(self, n):
        """The next n lines that it says, empty ones when it says no more."""
        return [self.process.stdout.readline().strip() for _ in range(n)]

    def turn(self, *words):
        """Turns the device, and waits until the daemon knows."""
        for word in words:
            self.process.stdin.write(word + "\n")
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

    def summary(self):
        """Stops the session, and what it was told."""
        self.c.call(SEND, {"a": 1}, 3, 1, [1])
        self.c.call(STOP, 1)
        return list(json.loads(pathlib.Path(self.d.summaries()[-1]).read_text())[-1].values())[0]

    def test_bus_that_comes_late_and_dies_and_sensor_that_wakes_up_and_comes_back(self):
        self.d.replace_file("run/interface/orientation", "portrait\n")
        self.c.started(1, 7)
        self.d.wait_until(lambda: "device orientation is off for now" in self.d.log(), "the bus is looked for")
        bus = self.start_bus()
        sensor = self.sensor(refusals=2)
        self.assertEqual(sensor.turn("normal", "left-up"), ["told"] * 2)
        self.d.replace_file("run/interface/orientation", "landscape-left\n")  # the thread of the sensor's words sees it
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
        told = self.summary()
        self.assertEqual(told["ui_orientation"], "landscape-left")
        words = told["device_orientation"].split(",")
        self.assertEqual(words[:4], ["normal", "left-up", "undefined", "right-up"])
        self.assertEqual(words[-1], "bottom-up")
        self.assertEqual(self.d.log().count("device orientation is off for now"), 1)  # nothing is said of what lasts
        self.assertEqual(self.d.stop(), 0)


AGENT = os.environ.get("VXORIENTATIONAGENT", "")


@unittest.skipUnless(AGENT and shutil.which("phoc") and shutil.which("wlr-randr"),
                     "libwayland-dev, phoc and wlr-randr are not installed")
class OrientationAgentTest(DaemonTest):
    def start(self, *command):
        log = open(self.folder + "/" + os.path.basename(command[0]) + ".log", "w+")
        process = subprocess.Popen(command, env=self.environment, stdin=subprocess.DEVNULL, stdout=log, stderr=log)
        self.addCleanup(lambda: (process.kill(), process.wait(), log.close()))
        return process

    def test_words_of_a_turned_output_reach_the_session(self):
        self.folder = tempfile.mkdtemp(prefix="vx")
        d = self.daemon(config=INTERNAL, folder=self.folder)
        os.mkdir(self.folder + "/run/interface")
        self.environment = {"PATH": os.environ["PATH"], "XDG_RUNTIME_DIR": self.folder, "WAYLAND_DISPLAY": "wayland-0",
                            "GSETTINGS_BACKEND": "memory", "WLR_BACKENDS": "headless", "WLR_RENDERER": "pixman",
                            "WLR_LIBINPUT_NO_DEVICES": "1"}
        compositor = self.start("phoc")
        d.wait_until(lambda: os.path.exists(self.folder + "/wayland-0"), "there is a compositor")
        turn = lambda *how: subprocess.run(["wlr-randr", "--output", "HEADLESS-1", *how], env=self.environment, check=True)
        turn("--custom-mode", "720x1280")
        file = self.folder + "/run/interface/orientation"
        agent = self.start(AGENT, file)
        c = d.client()
        c.started(1)
        words = ["portrait", "landscape-left", "portrait-upside-down", "landscape-right", "portrait"]
        for transform, word in zip(("normal", "90", "flipped-180", "270", "normal"), words):
            turn("--transform", transform)
            d.wait_until(lambda: os.path.exists(file) and pathlib.Path(file).read_text() == word + "\n", f"it is {word}")
        turn("--custom-mode", "1280x720")  # a panel that is wide as it is built
        d.wait_until(lambda: pathlib.Path(file).read_text() == "landscape-left\n", "it is wide")
        c.call(SEND, {"a": 1}, 3, 1, [1])
        c.call(STOP, 1)
        told = list(json.loads(pathlib.Path(d.summaries()[-1]).read_text())[-1].values())[0]["ui_orientation"]
        self.assertTrue(set(told.split(",")) <= set(words) and told.endswith("landscape-left"), told)
        compositor.kill()
        self.assertEqual(agent.wait(PATIENCE), 1)  # the service manager starts it again
