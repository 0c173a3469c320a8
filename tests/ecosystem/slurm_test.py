"""An engine as a job of a real Slurm, which has this machine as its only node."""

import os
import re
import socket
import subprocess
import time
import unittest

from deployment import PATIENCE, RemoteTest, block


def free_port():
    with socket.socket() as probe:
        probe.bind(("127.0.0.1", 0))
        return probe.getsockname()[1]


@unittest.skipUnless(os.geteuid() == 0, "Slurm's daemons change users, which needs root")
class SlurmTest(RemoteTest):
    def setUp(self):
        super().setUp()
        os.chmod(self.directory, 0o755)
        for name in "state", "spool", "munge":
            os.mkdir(self.path(name), 0o755)
        with open(self.path("munge.key"), "wb") as key:
            os.chmod(key.fileno(), 0o600)
            key.write(os.urandom(1024))
        host = socket.gethostname().split(".")[0]
        self.environment["SLURM_CONF"] = self.write("slurm.conf", "\n".join([
            "ClusterName=test", f"SlurmctldHost={host}(127.0.0.1)", f"SlurmctldPort={free_port()}",
            f"SlurmdPort={free_port()}", "SlurmUser=root", "AuthType=auth/munge",
            f"AuthInfo=socket={self.path('munge/socket')}", "CryptoType=crypto/munge",
            f"StateSaveLocation={self.path('state')}", f"SlurmdSpoolDir={self.path('spool')}",
            f"SlurmctldPidFile={self.path('slurmctld.pid')}", f"SlurmdPidFile={self.path('slurmd.pid')}",
            "ProctrackType=proctrack/linuxproc", "TaskPlugin=task/none", "JobAcctGatherType=jobacct_gather/none",
            "SwitchType=switch/none", "MpiDefault=none", "ReturnToService=2", "SlurmdParameters=config_overrides",
            f"NodeName={host} NodeAddr=127.0.0.1 CPUs=2 State=UNKNOWN",
            "PartitionName=all Nodes=ALL Default=YES State=UP"]) + "\n", 0o644)
        with open(self.path("log"), "w", encoding="utf-8") as log:
            self.daemon(log, "munged", "--foreground", "--force", "--num-threads", "1",
                        "--key-file", self.path("munge.key"), "--socket", self.path("munge/socket"),
                        "--pid-file", self.path("munge/pid"), "--seed-file", self.path("munge/seed"),
                        "--log-file", self.path("munge/log"))
            self.await_file(self.path("munge/socket"))
            self.daemon(log, "slurmctld", "-D", "-c", "-i")
            self.daemon(log, "slurmd", "-D", "-N", host)
        end = time.monotonic() + PATIENCE
        while self.run_shell("sinfo -h -o %T").stdout != "idle\n":
            with open(self.path("log"), encoding="utf-8") as log:
                self.assertLess(time.monotonic(), end, log.read())
            time.sleep(0.1)

    def daemon(self, log, *arguments):
        process = subprocess.Popen(arguments, env=self.environment, stdout=log, stderr=log)
        self.addCleanup(process.wait)
        self.addCleanup(process.terminate)

    def test_session_is_a_job_and_outlives_ctrl_c(self):
        done = self.run_shell(block("krutil eval --engine 'srun"))
        self.assertEqual((done.stderr, done.returncode), ("", 0))
        self.assertRegex(done.stdout, r"^'\d+'\n$")
        command = re.search("'(srun.*?)'", block("krutil eval --engine 'srun"))[1]
        terminal = self.repl(command)
        terminal.expect(">>> ")
        self.assert_survives_ctrl_c(terminal)


if __name__ == "__main__":
    unittest.main()
