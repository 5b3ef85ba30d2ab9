"""A scripted client of the daemon: it exports the callback object and writes down what comes."""
import time

import gi

gi.require_version("Gio", "2.0")
from gi.repository import Gio, GLib  # noqa: E402

NAME = INTERFACE = "org.orvane.Quarn"
PATH = "/org/orvane/Quarn/GDBus"
DEADLINE = 60

CALLBACKS = """
<node><interface name='org.orvane.Quarn'>
%s
</interface></node>""" % "".join(
    "<method name='%s'>%s<arg type='i' direction='out'/></method>" %
    (name, "".join("<arg type='%s' direction='in'/>" % letter for letter in types))
    for name, types in (("restore_enable_cb", "isu"), ("get_app_list_cb", "isu"),
                        ("manual_backup_status", "iiu"), ("manual_backup_cancel_result", "iu"),
                        ("app_data_backup_complete", "isu"),
                        ("app_data_restore_complete", "isu")))


def request(number):
    """Arguments of what takes the request's number alone."""
    return GLib.Variant("(u)", (number,))


def integer(number):
    return GLib.Variant("(i)", (number,))


class Call:
    """A call under way: `reply` or `error` is set when it is `done`."""

    def __init__(self):
        self.done = False
        self.reply = None
        self.error = None


class Client:
    """Everything runs on the caller's thread, in `until`."""

    def __init__(self, address, with_object=True):
        self.connection = Gio.DBusConnection.new_for_address_sync(
            address, Gio.DBusConnectionFlags.AUTHENTICATION_CLIENT |
            Gio.DBusConnectionFlags.MESSAGE_BUS_CONNECTION, None, None)
        self.name = self.connection.get_unique_name()
        #: Callbacks and replies in the order in which they came, as (name, arguments).
        self.events = []
        #: Whether a callback is left unanswered; its invocation then waits in `held`.
        self.hold = lambda method, arguments: False
        self.held = []
        if with_object:
            node = Gio.DBusNodeInfo.new_for_xml(CALLBACKS)
            self.connection.register_object(PATH, node.interfaces[0], self._on_call, None, None)

    def _on_call(self, _connection, _sender, _path, _interface, method, parameters, invocation):
        arguments = parameters.unpack()
        self.events.append((method, arguments))
        if self.hold(method, arguments):
            self.held.append(invocation)
        else:
            invocation.return_value(GLib.Variant("(i)", (0,)))

    def release(self):
        """Answer what was held back, and everything from now on."""
        self.hold = lambda method, arguments: False
        for invocation in self.held:
            invocation.return_value(GLib.Variant("(i)", (0,)))
        self.held = []

    def until(self, condition, what, deadline=DEADLINE):
        """Serve the bus until `condition()` is true."""
        end = time.monotonic() + deadline
        context = GLib.MainContext.default()
        tick = GLib.timeout_add(20, lambda: True)
        try:
            while not condition():
                if time.monotonic() > end:
                    raise AssertionError("did not happen in %d s: %s; events: %s" %
                                         (deadline, what, self.events))
                context.iteration(True)
        finally:
            GLib.source_remove(tick)

    def start(self, method, arguments=None, destination=NAME, path=PATH, interface=INTERFACE):
        call = Call()

        def finished(connection, result):
            try:
                call.reply = connection.call_finish(result).unpack()
            except GLib.Error as error:
                call.error = error.message
            call.done = True
            if destination == NAME:
                self.events.append(("reply of " + method, call.reply))

        self.connection.call(destination, path, interface, method, arguments, None,
                             Gio.DBusCallFlags.NONE, DEADLINE * 1000, None, finished)
        return call

    def call(self, method, arguments=None, **where):
        """The reply's values; an error raises."""
        call = self.start(method, arguments, **where)
        self.until(lambda: call.done, method)
        if call.error:
            raise AssertionError("%s: %s" % (method, call.error))
        return call.reply

    def error_of(self, method, arguments=None, **where):
        """D-Bus name and text of the error that the call ends with."""
        call = self.start(method, arguments, **where)
        self.until(lambda: call.done, method)
        if not call.error:
            raise AssertionError("%s was answered %s" % (method, call.reply))
        prefix, name, text = call.error.split(":", 2)
        if prefix != "GDBus.Error":
            raise AssertionError(call.error)
        return name, text.strip()

    def bus(self, method, arguments):
        return self.call(method, arguments, destination="org.freedesktop.DBus",
                         path="/org/freedesktop/DBus", interface="org.freedesktop.DBus")

    def owner(self):
        """Unique name of the daemon's connection, None when nobody owns its name."""
        if not self.bus("NameHasOwner", GLib.Variant("(s)", (NAME,)))[0]:
            return None
        return self.bus("GetNameOwner", GLib.Variant("(s)", (NAME,)))[0]

    def callbacks(self, method=None):
        return [event for event in self.events
                if not event[0].startswith("reply of ") and method in (None, event[0])]

    def close(self):
        self.connection.close_sync(None)
