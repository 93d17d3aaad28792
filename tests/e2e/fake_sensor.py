#!/usr/bin/python3
"""A sensor on a bus that does as it is told: fake_sensor.py BUS_ADDRESS REFUSALS.

Refuses the first REFUSALS claims, as a sensor that is still waking up does. Each line read turns the device; the end of
input takes the sensor off the bus. Prints "claimed" and "refused" as it answers.
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

    @dbus.service.method(NAME)
    def ClaimAccelerometer(self):
        if self.refusals:
            self.refusals -= 1
            print("refused", flush=True)
            raise dbus.exceptions.DBusException("not awake yet", name="org.freedesktop.DBus.Error.Failed")
        print("claimed", flush=True)

    @dbus.service.method("org.freedesktop.DBus.Properties", in_signature="ss", out_signature="v")
    def Get(self, interface, name):
        return self.word

    @dbus.service.signal("org.freedesktop.DBus.Properties", signature="sa{sv}as")
    def PropertiesChanged(self, interface, changed, invalidated):
        pass


loop = GLib.MainLoop()
dbus.mainloop.glib.DBusGMainLoop(set_as_default=True)
bus = dbus.bus.BusConnection(sys.argv[1])
sensor = Sensor(bus, "/net/hadess/SensorProxy")
name = dbus.service.BusName(NAME, bus)


def on_lines(source, condition):
    lines = os.read(0, 4096).decode().split()
    if not lines:
        loop.quit()
        return False
    for sensor.word in lines:
        sensor.PropertiesChanged(NAME, {"AccelerometerOrientation": sensor.word}, [])
    return True


GLib.io_add_watch(0, GLib.IO_IN | GLib.IO_HUP, on_lines)
loop.run()
