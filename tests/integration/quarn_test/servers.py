"""Servers on loopback, at a port that the system chooses."""
import http.server
import socket
import threading


class AnsweringServer:
    """An HTTP server on loopback that gives every request one answer.

    `content_type` is that of `body`; `context` makes the server one of TLS. `seen` is called with
    the headers of each request before it is answered; what it returns, if anything, is said instead
    of `reason` and `body`. `asked` has the methods of the requests.
    """

    def __init__(self, status, reason, context=None, body="", content_type=None, seen=None):
        self.asked = asked = []

        class Handler(http.server.BaseHTTPRequestHandler):
            protocol_version = "HTTP/1.1"

            def answer(self):
                asked.append(self.command)
                self.rfile.read(int(self.headers.get("Content-Length", 0)))
                said = seen(self.headers) if seen else None
                text = (said or body).encode()
                self.send_response(status, said or reason)
                if content_type:
                    self.send_header("Content-Type", content_type)
                self.send_header("Content-Length", str(len(text)))
                self.end_headers()
                if self.command != "HEAD":
                    self.wfile.write(text)

            def __getattr__(self, name):
                if name.startswith("do_"):
                    return self.answer
                raise AttributeError(name)

            def log_message(self, *arguments):
                pass

        self.server = http.server.ThreadingHTTPServer(("127.0.0.1", 0), Handler)
        self.port = self.server.server_address[1]
        if context:
            self.server.socket = context.wrap_socket(self.server.socket, server_side=True)
        self.thread = threading.Thread(target=self.server.serve_forever, args=(0.02,))
        self.thread.start()

    def __enter__(self):
        return self

    def __exit__(self, *_exception):
        self.server.shutdown()
        self.thread.join()
        self.server.server_close()


def free_ports(count):
    """Ports for servers that have to be told theirs. On each a connection has just ended, first from
    the side of the port: for a minute the system gives it to nobody who asks for any, and only a
    server that names it gets it (SO_REUSEADDR, which servers set, see socket(7))."""
    ports = []
    for _ in range(count):
        with socket.create_server(("127.0.0.1", 0)) as listener:
            with socket.create_connection(listener.getsockname()) as client:
                listener.accept()[0].close()
                client.recv(1)
            ports.append(listener.getsockname()[1])
    return ports


def silent_server():
    """A socket that takes connections and never answers; to be closed by who asked for it."""
    return socket.create_server(("127.0.0.1", 0), backlog=128)
