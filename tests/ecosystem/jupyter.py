"""What tests of the notebook kernel share: the kernel installed for Jupyter, in a directory of their own."""

import os
import subprocess
import sys
import tempfile


def install(test):
    """Installs the kernel "krutil" and points Jupyter at it, until the test class is done. Returns the directory."""
    directory = tempfile.TemporaryDirectory()
    test.addClassCleanup(directory.cleanup)
    settings = {"JUPYTER_PATH": os.path.join(directory.name, "share", "jupyter")}
    for name in "JUPYTER_DATA_DIR", "JUPYTER_RUNTIME_DIR", "JUPYTER_CONFIG_DIR", "IPYTHONDIR", "HOME":
        settings[name] = os.path.join(directory.name, name.lower())
        os.mkdir(settings[name], 0o700)
    before = {name: os.environ.get(name) for name in settings}

    def restore():
        for name, value in before.items():
            if value is None:
                del os.environ[name]
            else:
                os.environ[name] = value

    os.environ.update(settings)
    test.addClassCleanup(restore)
    done = subprocess.run([sys.executable, "-m", "krutil.kernel", "install", "--prefix", directory.name],
                          stdout=subprocess.PIPE, text=True, check=True)
    place = os.path.join(directory.name, "share", "jupyter", "kernels", "krutil")
    assert done.stdout == f"The kernel 'krutil' is in {place}\n", done.stdout
    return directory.name
