"""A WebDAV server that holds objects, and says of some of them what it likes.

Every request is answered on a thread of its own. What a scripted answer is, tells `Script`."""
import http.server
import threading


class Script:
    """Answers a GET itself: `send(write)` is handed a function that sends bytes as they are, and
    `ended` is set once the other side has gone or everything was sent."""

    def __init__(self, send):
        self.send = send
        self.begun = threading.Event()
        self.ended = threading.Event()
        self.left = False
        self.sent = 0

    def run(self, connection):
        def write(data):
            connection.sendall(data)
            self.sent += len(data)

        self.begun.set()
        try:
            self.send(write)
        except OSError:
            self.left = True
        finally:
            self.ended.set()


class HostileCloud:
    def __init__(self):
        self.objects = {}   # path -> bytes, or a Script
        self.stopping = threading.Event()
        cloud = self

        class Handler(http.server.BaseHTTPRequestHandler):
            protocol_version = "HTTP/1.1"

            def answer(self, status, body=b"", **headers):
                self.send_response(status)
                self.send_header("Content-Length", str(len(body)))
                for name, value in headers.items():
                    self.send_header(name.replace("_", "-"), value)
                self.end_headers()
                if self.command != "HEAD":
                    self.wfile.write(body)

            def do_GET(self):
                found = cloud.objects.get(self.path)
                if found is None:
                    return self.answer(404)
                if isinstance(found, Script):
                    self.close_connection = True
                    return found.run(self.connection)
                return self.answer(200, found)

            def do_PROPFIND(self):
                self.rfile.read(int(self.headers.get("Content-Length") or 0))
                body = ('<multistatus xmlns="DAV:"><response><href>%s</href><propstat><prop>'
                        "<resourcetype><collection/></resourcetype></prop>"
                        "<status>HTTP/1.1 200 OK</status></propstat></response></multistatus>"
                        % self.path).encode()
                self.answer(207, body, Content_Type="application/xml")

            def log_message(self, *_):
                pass

        class Server(http.server.ThreadingHTTPServer):
            def handle_error(self, *_):
                """Whoever was sent too much has gone."""

        self.server = Server(("127.0.0.1", 0), Handler)
        self.server.daemon_threads = True
        self.url = "webdav+http://127.0.0.1:%d/dav" % self.server.server_port
        self.thread = threading.Thread(target=self.server.serve_forever, args=(0.02,))
        self.thread.start()

    def close(self):
        self.stopping.set()
        self.server.shutdown()
        self.thread.join()
        self.server.server_close()

    def put(self, path, content):
        self.objects["/dav" + path] = content

    def endless(self, byte=b"x"):
        """As much as is taken, as fast as it is taken, of no told length."""
        def send(write):
            write(b"HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n")
            piece = b"10000\r\n" + byte * 0x10000 + b"\r\n"
            while not self.stopping.is_set():
                write(piece)
        return Script(send)

    def announced(self, size):
        """A body of that length, all of it offered."""
        def send(write):
            write(b"HTTP/1.1 200 OK\r\nContent-Length: %d\r\n\r\n" % size)
            piece = b"x" * 0x10000
            for _ in range(size // len(piece)):
                write(piece)
        return Script(send)

    def trickle(self):
        """A byte a second, for as long as somebody listens."""
        def send(write):
            write(b"HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n")
            while not self.stopping.wait(1):
                write(b"1\r\nx\r\n")
        return Script(send)
