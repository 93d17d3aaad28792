#!/usr/bin/python3
"""A sensor on a bus that does as it is told: fake_sensor.py BUS_ADDRESS REFUSALS.

Refuses the first REFUSALS claims, as a sensor that is still waking up does. Each word read turns the device; the end of
input takes the sensor off the bus. Prints "refused", "asked" for its present word (a claim that was taken brings that
question), and "told" when the claimant has taken the turn in.
"""
import os
import sys

import dbus
import dbus.mainloop.glib
import dbus.service
from gi.repository import GLib

NAME = "net.hadess.SensorProxy"


class Sensor(dbus.service.Object):
    refusals = int(sys.argv[2])
    word = "undefined"
    claimant = None

    @dbus.service.method(NAME, sender_keyword="sender")
    def ClaimAccelerometer(self, sender):
        if self.refusals:
            self.refusals -= 1
            print("refused", flush=True)
            raise dbus.exceptions.DBusException("not awake yet", name="org.freedesktop.DBus.Error.Failed")
        self.claimant = sender

    @dbus.service.method("org.freedesktop.DBus.Properties", in_signature="ss", out_signature="v")
    def Get(self, interface, name):
        print("asked", flush=True)
        return self.word

    @dbus.service.signal("org.freedesktop.DBus.Properties", signature="sa{sv}as")
    def PropertiesChanged(self, interface, changed, invalidated):
        pass


loop = GLib.MainLoop()
dbus.mainloop.glib.DBusGMainLoop(set_as_default=True)
bus = dbus.bus.BusConnection(sys.argv[1])
sensor = Sensor(bus, "/net/hadess/SensorProxy")
name = dbus.service.BusName(NAME, bus)


def on_words(source, condition):
    words = os.read(0, 4096).decode().split()
    if not words:
        loop.quit()
        return False
    for sensor.word in words:
        sensor.PropertiesChanged(NAME, {"AccelerometerOrientation": sensor.word}, [])
        # Messages from one sender arrive in order: the answer to this one comes after the turn.
        bus.call_blocking(sensor.claimant, "/", "org.freedesktop.DBus.Peer", "Ping", "", ())
        print("told", flush=True)
    return True


GLib.io_add_watch(0, GLib.IO_IN | GLib.IO_HUP, on_words)
loop.run()
