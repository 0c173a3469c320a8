"""Engines behind ssh, relays and socket activation: docs/deployment.md with the real programs."""

import glob
import os
import re
import shutil
import subprocess
import unittest

from deployment import EXAMPLES, PATIENCE, RemoteTest, block

PASSPHRASE = "open sesame"


class SshTest(RemoteTest):
    def setUp(self):
        super().setUp()
        if os.geteuid() == 0:
            os.makedirs("/run/sshd", mode=0o755, exist_ok=True)
        for name, phrase in (("host", ""), ("user", ""), ("locked", PASSPHRASE)):
            subprocess.run(["ssh-keygen", "-q", "-t", "ed25519", "-N", phrase, "-f", self.path(name)], check=True)
        with open(self.path("keys"), "w", encoding="utf-8") as keys:
            for name in "user", "locked":
                with open(self.path(name + ".pub"), encoding="utf-8") as key:
                    keys.write(key.read())
        self.serve_ssh()
        with open(self.path("host.pub"), encoding="utf-8") as key:
            self.write("known", "somewhere " + key.read())
        self.use_key("user")

    def serve_ssh(self, *more):
        self.write("sshd_config", "\n".join([
            f"HostKey {self.path('host')}", f"AuthorizedKeysFile {self.path('keys')}", "StrictModes no", "UsePAM no",
            "PidFile none", "PasswordAuthentication no", f"SetEnv PATH={os.environ['PATH']}", *more]) + "\n")

    def use_key(self, name):
        # No port: the server is a child of each client.
        self.write("ssh_config", "\n".join([
            "Host somewhere", "HostKeyAlias somewhere", "LogLevel ERROR",
            f"ProxyCommand /usr/sbin/sshd -i -f {self.path('sshd_config')}",
            f"UserKnownHostsFile {self.path('known')}", f"IdentityFile {self.path(name)}", "IdentitiesOnly yes"]) + "\n")
        self.write("ssh", f"#!/bin/sh\nexec {shutil.which('ssh', path='/usr/bin')} -F {self.path('ssh_config')} \"$@\"\n",
                   0o700)
        self.environment["PATH"] = f"{self.directory}:{os.environ['PATH']}"

    def test_command_of_the_document(self):
        self.assert_runs(block("krutil eval --engine 'ssh"), f"{os.uname().nodename!r}\n")

    def test_passphrase_is_asked_for_on_the_terminal(self):
        self.use_key("locked")
        terminal = self.repl("ssh somewhere krutil-qvm --stdio")
        terminal.expect("Enter passphrase for key")
        terminal.expect(": ")
        terminal.type(PASSPHRASE + "\r")
        terminal.expect(">>> ")
        self.assertNotIn(PASSPHRASE, terminal.sent)
        self.assert_survives_ctrl_c(terminal)

    def test_ctrl_c_at_the_passphrase_ends_the_client(self):
        self.use_key("locked")
        terminal = self.repl("ssh somewhere krutil-qvm --stdio")
        terminal.expect("Enter passphrase for key")
        terminal.await_reader()
        terminal.type("\x03")
        terminal.expect("krutil: cancelled\r\n")
        self.assertEqual(terminal.exit_code(), 6)

    def test_ctrl_c_in_a_session_leaves_ssh_alone(self):
        terminal = self.repl("ssh somewhere krutil-qvm --stdio")
        terminal.expect(">>> ")
        self.assert_survives_ctrl_c(terminal)

    def test_text_of_a_start_up_script_is_recognised(self):
        self.serve_ssh("ForceCommand echo 'Have a nice day.'; exec $SSH_ORIGINAL_COMMAND")
        done = self.run_shell(block("krutil eval --engine 'ssh"))
        self.assertEqual(done.stderr, 'krutil: the command of --engine printed "Have a nice day.\\n" before the session '
                         "began. Perhaps a start-up script of the shell there, such as .bashrc, prints on standard "
                         "output: let it do so in interactive shells only, or on standard error\n")
        self.assertEqual(done.returncode, 4)

    def test_socket_that_ssh_brings_here_shares_no_memory(self):
        engine = self.serve()
        self.assertEqual(self.features("--connect", engine).get("SHM"), "descriptors")
        command = block("ssh -nNT").replace("/run/krutil/engine", engine).replace("ssh ", "exec ssh ", 1)
        self.start("/bin/sh", "-c", command)
        self.await_file(self.path(".krutil-somewhere"))
        self.assert_runs(block('krutil eval --connect "$HOME'), "42\n")
        self.assertNotIn("SHM", self.features("--connect", self.path(".krutil-somewhere")))


class SocatTest(RemoteTest):
    def test_command_of_the_document(self):
        self.assert_runs(block("krutil eval --engine 'socat").replace("/run/krutil/engine", self.serve()), "42\n")

    def test_ctrl_c_leaves_it_alone(self):
        terminal = self.repl(f"socat - UNIX-CONNECT:{self.serve()}")
        terminal.expect(">>> ")
        self.assert_survives_ctrl_c(terminal)

    def test_no_memory_is_shared_through_it(self):
        engine = self.serve()
        self.start("socat", f"UNIX-LISTEN:{self.path('relay')},fork,unlink-early", f"UNIX-CONNECT:{engine}")
        self.await_file(self.path("relay"))
        self.assertNotIn("SHM", self.features("--connect", self.path("relay")))

    def test_cut_of_an_idle_session_is_called_so(self):
        client = self.start("krutil", "repl", "--engine", f"socat -T 0.5 - UNIX-CONNECT:{self.serve()}",
                            stdin=subprocess.PIPE, stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        for stream in client.stdin, client.stdout, client.stderr:
            self.addCleanup(stream.close)
        client.stdin.write("6 * 7\n")
        client.stdin.flush()
        self.assertEqual(client.stdout.readline(), "42\n")
        self.assertEqual(client.stderr.read(), "krutil: the stream to the engine was cut while it was idle: the stream "
                         "ended between two messages, before the engine's shutdown event; the command of --engine exited "
                         "with code 0, as relays do\n")
        self.assertEqual(client.wait(PATIENCE), 3)

    def test_signs_of_life_keep_an_idle_session(self):
        # One that is on its way when the engine has ended makes socat complain.
        self.assert_runs(f"krutil eval --keep-alive 0.1 --engine 'socat -T 1 - UNIX-CONNECT:{self.serve()} 2>/dev/null' "
                         "'import time; time.sleep(3); 42'", "42\n")


class ServiceTest(RemoteTest):
    def test_units_are_well_formed(self):
        for source in glob.glob(os.path.join(EXAMPLES, "systemd", "*")):
            with open(source, encoding="utf-8") as file:
                text = file.read().replace("/usr/bin/krutil-qvm", shutil.which("krutil-qvm"))
            # Any account will do, as long as it is there.
            text = re.sub(r"(?m)^(User|SocketUser)=krutil$", r"\1=daemon", text)
            self.write(os.path.basename(source), text)
            self.write(os.path.basename(source).replace("@.", "@daemon."), text)
        units = sorted(unit for unit in glob.glob(self.path("krutil-*")) if "@." not in unit)
        self.assertEqual([os.path.basename(unit) for unit in units],
                         ["krutil-qvm@daemon.service", "krutil-qvm@daemon.socket", "krutil-session.socket",
                          "krutil-session@daemon.service"])
        done = self.verify(*units)
        self.assertEqual((done.stdout, done.returncode), ("", 0))
        # What is wrong would be seen.
        self.assertIn("Unknown key 'MemoryMox'",
                      self.verify(self.write("wrong.service", "[Service]\nExecStart=/bin/true\nMemoryMox=1\n")).stdout)

    def verify(self, *units):
        return subprocess.run(["systemd-analyze", "verify", "--man=no", *units], stdout=subprocess.PIPE,
                              stderr=subprocess.STDOUT, text=True, cwd=self.directory)

    def activate(self, *arguments):
        """Starts a service manager in miniature; returns the path of its socket."""
        path = self.path("socket")
        manager = self.start("systemd-socket-activate", "-l", path, *arguments, stderr=subprocess.PIPE, text=True)
        self.addCleanup(manager.stderr.close)
        self.assertEqual(manager.stderr.readline(), f"Listening on {path} as 3.\n")
        return path

    def test_listening_socket_is_handed_over(self):
        path = self.activate(shutil.which("krutil-qvm"), "--listen-fds")
        for _ in range(2):
            self.assert_runs(f"krutil eval --connect {path} '6 * 7'", "42\n")

    def test_connection_is_handed_over(self):
        path = self.activate("--accept", shutil.which("krutil-qvm"), "--listen-fds")
        for _ in range(2):
            self.assert_runs(f"krutil eval --connect {path} '6 * 7'", "42\n")

    def test_connection_is_standard_input_and_output(self):
        path = self.activate("--accept", "--inetd", shutil.which("krutil-qvm"), "--stdio")
        for _ in range(2):
            self.assert_runs(f"krutil eval --connect {path} '6 * 7'", "42\n")

    def test_service_manager_listens_as_root(self):
        # The kernel names root for such a socket, whoever the engine and its clients are.
        nobody = "setpriv --reuid=nobody --regid=nogroup --clear-groups"
        if self.run_shell(f"{nobody} krutil --version").returncode != 0:
            self.skipTest("needs to become another user, who may run these programs")
        path = self.activate(*nobody.split(), shutil.which("krutil-qvm"), "--listen-fds")
        os.chmod(self.directory, 0o711)
        os.chmod(path, 0o666)
        # The first client is there before the engine.
        for _ in range(2):
            self.assert_runs(f"{nobody} krutil eval --connect {path} 'import os; os.getuid()'", "65534\n")


if __name__ == "__main__":
    unittest.main()
