"""A Jupyter kernel: notebooks whose code runs in `krutil-qvm`.

    python3 -m krutil.kernel install

makes it known to Jupyter. It needs ipykernel (`apt-get install python3-ipykernel`), which nothing else of this package
needs.
"""

import argparse
import importlib.util
import json
import os
import shlex
import shutil
import sys
import tempfile
from typing import Sequence


def install(arguments: Sequence[str]) -> None:
    """Makes the kernel known to Jupyter."""
    parser = argparse.ArgumentParser(prog="python3 -m krutil.kernel install", description=install.__doc__)
    parser.add_argument("--engine", metavar="COMMAND",
                        help="what runs the engine, such as 'ssh somewhere krutil-qvm --stdio'; otherwise krutil-qvm "
                             "from the PATH, with the packages of the virtual environment that is active")
    parser.add_argument("--prefix", help="below which directory; otherwise for this user alone")
    parser.add_argument("--name", default="krutil", help="by which programs name the kernel (%(default)s)")
    parser.add_argument("--display-name", default="Python (krutil)", help="which a page shows (%(default)s)")
    options = parser.parse_args(arguments)

    from jupyter_client.kernelspec import KernelSpecManager

    package = os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
    # Whoever starts Jupyter may have neither this PATH nor this PYTHONPATH, and modules that lie beside a notebook are
    # for its code alone. The option -X spares warnings of a debugger that ipykernel loads.
    words = [sys.executable, "-P", "-Xfrozen_modules=off", "-c",
             f"import sys; sys.path.insert(0, {package!r}); from krutil.kernel import main; main()",
             "--engine", options.engine or shlex.join(_local_engine(parser)), "-f", "{connection_file}"]
    with tempfile.TemporaryDirectory() as directory:
        with open(os.path.join(directory, "kernel.json"), "w", encoding="utf-8") as file:
            json.dump({"argv": words, "display_name": options.display_name, "language": "python",
                       "interrupt_mode": "message"}, file, indent=1)
        place = KernelSpecManager().install_kernel_spec(directory, options.name, user=options.prefix is None,
                                                        prefix=options.prefix)
    print(f"The kernel '{options.name}' is in {place}")


def _local_engine(parser: argparse.ArgumentParser) -> list[str]:
    program = shutil.which("krutil-qvm")
    if program is None:
        parser.error("there is no program krutil-qvm: put its directory into PATH, or give --engine COMMAND")
    environment = os.environ.get("VIRTUAL_ENV")
    return [os.path.abspath(program), "--stdio",
            *(["--python", os.path.join(environment, "bin", "python3")] if environment else [])]


def main() -> None:
    """Installs the kernel, or is one: Jupyter names the file that says where to listen."""
    if importlib.util.find_spec("ipykernel") is None:
        sys.exit("krutil.kernel: a notebook kernel needs ipykernel, which is not installed: "
                 "apt-get install python3-ipykernel")
    if sys.argv[1:2] == ["install"]:
        install(sys.argv[2:])
        return
    from ipykernel.kernelapp import IPKernelApp

    from .notebook import EngineKernel

    parser = argparse.ArgumentParser(prog="python3 -m krutil.kernel", epilog="Others are those of ipykernel.")
    parser.add_argument("--engine", type=shlex.split, help="the command that runs the engine")
    options, rest = parser.parse_known_args()
    EngineKernel.command = options.engine
    IPKernelApp.launch_instance(rest, kernel_class=EngineKernel)


if __name__ == "__main__":
    main()
