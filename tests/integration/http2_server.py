"""A server that speaks HTTP/2 over TLS and nothing else, on a free port of this host.

Usage: http2_server.py CERTIFICATE KEY. The port stands on the first line of the output; each line that follows
tells the connection and the path of a request. The program ends with its standard input. What a path asks for:

  /together/N  no answer until N requests wait on one connection; the last one that came is answered first
  /reset       the stream is ended with an error instead of an answer
  /refused     the same, with the error which says that nothing was done with it
  /http11      the same, with the error which asks for HTTP/1.1
  /goaway      the connection is ended with a frame which says that nothing was done with this request
  /gone        the connection is ended without a word
  any other    an answer at once, with the status that follows "?status=", else 202

An answer says which connection it came on and repeats the request's body.
"""
import socket
import ssl
import sys
import threading

import h2.config
import h2.connection
import h2.errors
import h2.events


RESETS = {
    "/reset": h2.errors.ErrorCodes.INTERNAL_ERROR,
    "/refused": h2.errors.ErrorCodes.REFUSED_STREAM,
    "/http11": h2.errors.ErrorCodes.HTTP_1_1_REQUIRED,
}


class Connection:
    def __init__(self, stream, number):
        self.stream = stream
        self.number = number
        config = h2.config.H2Configuration(client_side=False, header_encoding="utf-8")
        self.h2 = h2.connection.H2Connection(config)
        self.requests = {}  # stream to (path, body)
        self.waiting = []  # streams

    def run(self):
        self.h2.initiate_connection()
        self.flush()
        while received := self.stream.recv(65536):
            for event in self.h2.receive_data(received):
                self.take(event)
            self.flush()

    def flush(self):
        self.stream.sendall(self.h2.data_to_send())

    def take(self, event):
        if isinstance(event, h2.events.RequestReceived):
            self.requests[event.stream_id] = (dict(event.headers)[":path"], bytearray())
        elif isinstance(event, h2.events.DataReceived):
            self.requests[event.stream_id][1].extend(event.data)
            self.h2.acknowledge_received_data(event.flow_controlled_length, event.stream_id)
        elif isinstance(event, h2.events.StreamEnded):
            self.request_ended(event.stream_id)

    def request_ended(self, stream):
        path, _, _ = self.requests[stream][0].partition("?")
        print(self.number, path, flush=True)
        if path in RESETS:
            self.h2.reset_stream(stream, RESETS[path])
        elif path == "/goaway":
            self.h2.close_connection(last_stream_id=stream - 2)
            self.flush()
            raise ConnectionAbortedError
        elif path == "/gone":
            raise ConnectionAbortedError
        elif path.startswith("/together/"):
            self.waiting.append(stream)
            if len(self.waiting) == int(path.rsplit("/", 1)[1]):
                while self.waiting:
                    self.answer(self.waiting.pop())
        else:
            self.answer(stream)

    def answer(self, stream):
        path, sent = self.requests.pop(stream)
        body = b"answer to " + sent
        status = path.partition("?status=")[2] or "202"
        self.h2.send_headers(stream, [(":status", status), ("x-connection", str(self.number))])
        size = self.h2.max_outbound_frame_size
        for start in range(0, len(body), size):
            self.h2.send_data(stream, body[start : start + size])
        self.h2.end_stream(stream)


def serve(context, accepted, number):
    try:
        with context.wrap_socket(accepted, server_side=True) as stream:
            Connection(stream, number).run()
    except OSError:
        pass  # the client is gone


def main():
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
    context.load_cert_chain(sys.argv[1], sys.argv[2])
    context.set_alpn_protocols(["h2"])
    listener = socket.create_server(("127.0.0.1", 0))
    print(listener.getsockname()[1], flush=True)

    def accept():
        number = 0
        while True:
            number += 1
            accepted, _ = listener.accept()
            threading.Thread(target=serve, args=(context, accepted, number), daemon=True).start()

    threading.Thread(target=accept, daemon=True).start()
    sys.stdin.read()


if __name__ == "__main__":
    main()
