#!/usr/bin/python3
"""Hold a preview session on a recording while a function runs, and react to
the daemon's ExportingCompositionAVURLsChanged signal -- an app's use of
quorveld from Python, on PyGObject (Debian: python3-gi).

    /usr/bin/python3 examples/python/hold_preview.py [--bus-address ADDRESS] RECORDING

RECORDING is the recording's composed audio file (a path or a file URL). While
the preview is held, the example exports the same recording (preview and
export share a recording) and prints the exporting set each time the daemon
says it changed. It exits 0 once the export has been answered, the signal has
been seen and both sessions have been handed back.
"""
import argparse
import contextlib
import pathlib
import sys

from gi.repository import Gio, GLib

NAME = "org.quorvel.SavedRecordingService"
PATH = "/org/quorvel/SavedRecordingService"
INTERFACE = "org.quorvel.SavedRecordingService1"
NO_TIMEOUT = GLib.MAXINT  # prepare calls may wait behind a closing session


class SavedRecordingService:
    """The daemon's contract interface on one bus connection."""

    def __init__(self, bus):
        self.bus = bus
        self.proxy = Gio.DBusProxy.new_sync(
            bus, Gio.DBusProxyFlags.DO_NOT_LOAD_PROPERTIES, None, NAME, PATH, INTERFACE, None)

    def prepare(self, method, url, *extra):
        signature = "(s" + "".join(kind for kind, _ in extra) + ")"
        arguments = GLib.Variant(signature, (url, *(value for _, value in extra)))
        (token,) = self.proxy.call_sync(method, arguments, Gio.DBusCallFlags.NONE, NO_TIMEOUT,
                                        None).unpack()
        if token == ("", 0, "", ""):
            raise RuntimeError(f"{method} granted no access to {url}")
        return token

    def end(self, token):
        # EndAccessSession has no reply: it is sent without expecting one.
        message = Gio.DBusMessage.new_method_call(NAME, PATH, INTERFACE, "EndAccessSession")
        message.set_body(GLib.Variant("((siss))", (token,)))
        message.set_flags(Gio.DBusMessageFlags.NO_REPLY_EXPECTED)
        self.bus.send_message(message, Gio.DBusSendMessageFlags.NONE)
        self.bus.flush_sync(None)

    def exporting(self):
        (urls,) = self.proxy.call_sync("FetchExportingCompositionAVURLs", None,
                                       Gio.DBusCallFlags.NONE, -1, None).unpack()
        return urls

    @contextlib.contextmanager
    def preview(self, url):
        """A preview session for the duration of a `with` block."""
        token = self.prepare("PrepareToPreview", url)
        try:
            yield token
        finally:
            self.end(token)

    def on_exporting_changed(self, callback):
        """Calls `callback` (from the main loop) each time the exporting set may have changed."""
        return self.bus.signal_subscribe(
            NAME, INTERFACE, "ExportingCompositionAVURLsChanged", PATH, None,
            Gio.DBusSignalFlags.NONE, lambda *_: callback())


def main():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--bus-address", help="the daemon's bus (default: the session bus)")
    parser.add_argument("recording", help="the recording's composed audio file or file URL")
    options = parser.parse_args()
    url = options.recording
    if "://" not in url:
        url = pathlib.Path(url).resolve().as_uri()

    if options.bus_address:
        flags = (Gio.DBusConnectionFlags.AUTHENTICATION_CLIENT |
                 Gio.DBusConnectionFlags.MESSAGE_BUS_CONNECTION)
        bus = Gio.DBusConnection.new_for_address_sync(options.bus_address, flags, None, None)
    else:
        bus = Gio.bus_get_sync(Gio.BusType.SESSION, None)
    service = SavedRecordingService(bus)

    seen = []
    service.on_exporting_changed(lambda: seen.append(service.exporting()) or
                                 print(f"exporting set changed: {seen[-1]}", flush=True))

    loop = GLib.MainLoop()
    with service.preview(url) as preview:
        print(f"holding {preview[0]} of {preview[2]}", flush=True)

        def export_while_previewing():
            # The export is asked for asynchronously, so the main loop keeps
            # delivering the signals meanwhile.
            def answered(proxy, result):
                try:
                    (token,) = proxy.call_finish(result).unpack()
                    print(f"exported: {token[2]}", flush=True)
                    service.end(token)
                finally:
                    GLib.timeout_add(200, loop.quit)  # let the last signal arrive
            service.proxy.call("PrepareToExport", GLib.Variant("(sb)", (url, True)),
                               Gio.DBusCallFlags.NONE, NO_TIMEOUT, None, answered)
            return GLib.SOURCE_REMOVE

        GLib.idle_add(export_while_previewing)
        loop.run()
    print("handed the preview back", flush=True)
    if not seen:
        print("no ExportingCompositionAVURLsChanged signal was seen", file=sys.stderr)
        return 1
    return 0


if __name__ == "__main__":
    sys.exit(main())
