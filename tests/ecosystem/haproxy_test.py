"""Clients with certificates, a real HAProxy, and several engines: the configuration of docs/deployment.md."""

import filecmp
import os
import shlex
import signal
import socket
import subprocess
import sys
import tempfile
import time
import unittest

import numpy

from deployment import PATIENCE, block

ENGINES = "first", "second", "third"

# A client and a server that do nothing but pass the bytes of a file there and back.
PLAIN = """
import mmap, os, socket, ssl, sys
if sys.argv[1] == "serve":
    listening = socket.socket(socket.AF_UNIX)
    listening.bind(sys.argv[2])
    os.chmod(sys.argv[2], 0o666)
    listening.listen()
    print("ready", flush=True)
    connection, _ = listening.accept()
    size = int.from_bytes(connection.recv(8, socket.MSG_WAITALL), "little")
    content = memoryview(bytearray(size))
    got = 0
    while got < size:
        got += connection.recv_into(content[got:])
    connection.sendall(content)
else:
    context = ssl.create_default_context(cafile="authority.pem")
    context.load_cert_chain("alice.pem", "alice.key")
    with socket.create_connection(("127.0.0.1", int(sys.argv[2]))) as network:
        connection = context.wrap_socket(network, server_hostname="localhost")
        with open("there.npy", "rb") as file:
            content = mmap.mmap(file.fileno(), 0, access=mmap.ACCESS_READ)
        connection.sendall(len(content).to_bytes(8, "little"))
        connection.sendall(content)
        back = memoryview(bytearray(len(content)))
        got = 0
        while got < len(back):
            got += connection.recv_into(back[got:])
    with open("back.npy", "wb") as file:
        file.write(back)
"""


def openssl(*arguments):
    subprocess.run(["openssl", *arguments], check=True, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)


class HAProxyTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        directory = tempfile.TemporaryDirectory()
        cls.addClassCleanup(directory.cleanup)
        cls.directory = directory.name
        # The proxy's user passes through it.
        os.chmod(cls.directory, 0o711)
        openssl("req", "-x509", "-newkey", "rsa:2048", "-nodes", "-days", "1", "-subj", "/CN=authority",
                "-keyout", cls.path("authority.key"), "-out", cls.path("authority.pem"))
        # Her name, but her own authority.
        openssl("req", "-x509", "-newkey", "rsa:2048", "-nodes", "-days", "1", "-subj", "/CN=alice",
                "-keyout", cls.path("stranger.key"), "-out", cls.path("stranger.pem"))
        for name in "proxy", "alice", "mallory", "expired":
            subject = "alice" if name == "expired" else name
            openssl("req", "-newkey", "rsa:2048", "-nodes", "-subj", f"/CN={subject}", "-keyout", cls.path(name + ".key"),
                    "-out", cls.path("request"))
            with open(cls.path("extensions"), "w", encoding="utf-8") as file:
                file.write("subjectAltName=DNS:localhost\n" if name == "proxy" else f"subjectAltName=DNS:{name}\n")
            openssl("x509", "-req", "-days", "-1" if name == "expired" else "1", "-in", cls.path("request"), "-CA", cls.path("authority.pem"),
                    "-CAkey", cls.path("authority.key"), "-CAcreateserial", "-extfile", cls.path("extensions"),
                    "-out", cls.path(name + ".pem"))
        with open(cls.path("proxy.pem"), "a", encoding="utf-8") as both:
            with open(cls.path("proxy.key"), encoding="utf-8") as key:
                both.write(key.read())
        with open(cls.path("clients"), "w", encoding="utf-8") as file:
            file.write("alice\n")

    @classmethod
    def path(cls, name):
        return os.path.join(cls.directory, name)

    def setUp(self):
        command = shlex.split(block("krutil-qvm --listen"))
        self.engines = {}
        for name in ENGINES:
            path = self.path(f"{name}/socket")
            arguments = [word.replace("/var/lib/haproxy/first/socket", path) for word in command]
            engine = self.start(*arguments, stderr=subprocess.PIPE)
            self.assertEqual(engine.stderr.readline(), f"krutil-qvm: serving {path}\n")
            self.engines[name] = engine
        # No port that is taken: the proxy inherits its sockets.
        listening, plain = (socket.create_server(("127.0.0.1", 0)) for _ in range(2))
        self.addCleanup(listening.close)
        self.addCleanup(plain.close)
        self.port, self.plain_port = listening.getsockname()[1], plain.getsockname()[1]
        text = block("global\n")
        frontend = text[text.index("frontend krutil"):text.index("\nbackend engines")] + "\n"
        text += "\n" + frontend.replace("krutil\n", "plain\n", 1).replace("engines", "plain")
        text = text.replace("bind :4433", f"bind fd@{listening.fileno()}", 1)
        text = text.replace("bind :4433", f"bind fd@{plain.fileno()}", 1)
        text += "backend plain\n    server plain unix@/plain\n"
        text = text.replace("/var/lib/haproxy", self.directory).replace("/etc/haproxy/krutil", self.directory)
        if os.geteuid() != 0:
            # Without rights it stays in its own place.
            text = text.replace(f"    chroot {self.directory}\n    user haproxy\n    group haproxy\n", "")
            text = text.replace("unix@/", f"unix@{self.directory}/")
        with open(self.path("haproxy.cfg"), "w", encoding="utf-8") as file:
            file.write(text)
        command = ["haproxy", "-db", "-q", "-f", self.path("haproxy.cfg")]
        sockets = [listening.fileno(), plain.fileno()]
        subprocess.run([*command, "-c"], check=True, pass_fds=sockets)
        self.start(*command, pass_fds=sockets, stderr=subprocess.DEVNULL)

    def start(self, *arguments, **options):
        process = subprocess.Popen(arguments, text=True, cwd=self.directory, **options)
        for stream in process.stdin, process.stdout, process.stderr:
            if stream:
                self.addCleanup(stream.close)
        self.addCleanup(process.wait)
        self.addCleanup(process.kill)
        return process

    def options(self, name="alice"):
        words = shlex.split(block("krutil eval --connect tls"))[2:-1]
        return [word.replace("4433", str(self.port)).replace("alice", name) for word in words]

    def run_client(self, *arguments):
        return subprocess.run(["krutil", *arguments], cwd=self.directory, timeout=PATIENCE, text=True,
                              stdout=subprocess.PIPE, stderr=subprocess.PIPE)

    def repl(self):
        """A client with a session, as its answer shows."""
        client = self.start("krutil", "repl", *self.options(), "--handshake-timeout", str(PATIENCE),
                            stdin=subprocess.PIPE, stdout=subprocess.PIPE, stderr=subprocess.PIPE)
        return client

    def ask(self, client, code):
        client.stdin.write(code + "\n")
        client.stdin.flush()
        return client.stdout.readline()

    def test_command_of_the_document(self):
        done = self.run_client("eval", *self.options(), "6 * 7")
        self.assertEqual((done.stderr, done.stdout, done.returncode), ("", "42\n", 0))

    def test_a_client_waits_until_an_engine_is_free(self):
        clients = [self.repl() for _ in ENGINES]
        processes = {self.ask(client, "import os; os.getppid()") for client in clients}
        self.assertEqual(processes, {f"{engine.pid}\n" for engine in self.engines.values()})
        done = self.run_client("eval", *self.options(), "--handshake-timeout", "1", "1")
        self.assertEqual(done.returncode, 3)
        self.assertIn("krutil: the handshake timed out after 1000 milliseconds: 0 of 16 bytes", done.stderr)
        fourth = self.repl()
        fourth.stdin.write("import os; os.getppid()\n")
        fourth.stdin.flush()
        clients[1].stdin.close()
        self.assertEqual(clients[1].wait(PATIENCE), 0)
        self.assertIn(fourth.stdout.readline(), processes)

    def test_a_cancel_passes(self):
        client = self.start("krutil", "eval", *self.options(), "print('ready', flush=True)\nwhile True: pass",
                            stdout=subprocess.PIPE, stderr=subprocess.PIPE)
        self.assertEqual(client.stdout.readline(), "ready\n")
        client.send_signal(signal.SIGINT)
        self.assertEqual(client.stderr.read(), "krutil: cancelled\n")
        self.assertEqual(client.wait(PATIENCE), 6)

    # Prints how long that takes beside programs that only pass its bytes there and back through the same proxy.
    def test_a_large_array_arrives_unchanged(self):
        numpy.save(self.path("there.npy"), numpy.random.default_rng(1).random(2**27))
        with open(self.path("plain.py"), "w", encoding="utf-8") as file:
            file.write(PLAIN)
        plain = [sys.executable, "-B", self.path("plain.py")]
        serve = self.start(*plain, "serve", self.path("plain"), stdout=subprocess.PIPE)
        self.assertEqual(serve.stdout.readline(), "ready\n")
        begin = time.monotonic()
        done = self.run_client("call", *self.options(), "-o", self.path("back.npy"), "numpy.asarray",
                               "@" + self.path("there.npy"))
        took = time.monotonic() - begin
        self.assertEqual((done.stderr, done.returncode), ("", 0))
        self.assertTrue(filecmp.cmp(self.path("there.npy"), self.path("back.npy"), shallow=False))
        begin = time.monotonic()
        subprocess.run([*plain, "call", str(self.plain_port)], cwd=self.directory, check=True, timeout=PATIENCE)
        beside = time.monotonic() - begin
        self.assertTrue(filecmp.cmp(self.path("there.npy"), self.path("back.npy"), shallow=False))
        print(f"1 GiB there and back: {took:.2f} s, plain TLS {beside:.2f} s, ratio {beside / took:.2f} ... ",
              end="", file=sys.stderr, flush=True)

    def test_an_engine_that_is_killed_is_lost_for_its_own_client(self):
        clients = [self.repl() for _ in ENGINES]
        processes = [int(self.ask(client, "import os; os.getpid()")) for client in clients]
        os.kill(processes[0], signal.SIGKILL)
        self.assertEqual(clients[0].wait(PATIENCE), 3)
        self.assertEqual(clients[0].stderr.read(), "krutil: the engine was lost while it was idle: the stream ended "
                         "between two messages, before the engine's shutdown event\n")
        for client in clients[1:]:
            self.assertEqual(self.ask(client, "6 * 7"), "42\n")

    def refusal(self, *options):
        done = self.run_client("eval", *options, "1")
        self.assertEqual(done.returncode, 3, done.stderr)
        return done.stderr

    def test_clients_that_are_not_meant_are_refused(self):
        address, authority = self.options()[:2], self.options()[-2:]
        refused = "krutil: the TLS connection to the engine failed before the session began: "
        self.assertEqual(self.refusal(*address, *authority), refused + "tlsv13 alert certificate required\n")
        self.assertEqual(self.refusal(*self.options("stranger")), refused + "tlsv1 alert unknown ca\n")
        self.assertEqual(self.refusal(*self.options("expired")), refused + "sslv3 alert certificate expired\n")
        self.assertIn(" before the session began: ", self.refusal(*self.options("mallory")))
        # An engine would say that somebody has connected.
        for engine in self.engines.values():
            engine.terminate()
            self.assertEqual(engine.stderr.read(), "")

    def test_a_proxy_that_is_not_meant_is_refused(self):
        address = self.options()[:2]
        self.assertEqual(self.refusal(*address, "--ca", self.path("mallory.pem")),
                         "krutil: the TLS connection to the engine failed before the session began: the certificate there "
                         "is not accepted: unable to get local issuer certificate\n")
        by_number = ["--connect", f"tls://127.0.0.1:{self.port}", *self.options()[2:]]
        self.assertEqual(self.refusal(*by_number),
                         "krutil: the TLS connection to the engine failed before the session began: the certificate there "
                         "is not accepted: IP address mismatch\n")


if __name__ == "__main__":
    unittest.main()
