"""Writes the descriptors of all messages into one file, from which krutil/schema.py makes the classes.

    make_schema.py OUTPUT

A set of descriptors is the same for every version of protoc and of Python's protobuf package. Generated Python code is
not: it runs only with the version of the package that its protoc was made for. Besides, that code would need packages
of its own beside krutil, because the schema's names begin with those of other components.
"""

import glob
import os
import subprocess
import sys

ROOT = os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "..")
DIRECTORIES = [os.path.join(ROOT, "src", "qvm_services", "krutil_protobuf", "proto"),
               os.path.join(ROOT, "platform", "proto")]


def main(output: str) -> None:
    command = ["protoc", f"--descriptor_set_out={output}"]
    for directory in DIRECTORIES:
        command += [f"-I{directory}"]
    for directory in DIRECTORIES:
        command += sorted(glob.glob(os.path.join(directory, "*.proto")))
    # protoc notes imports and syntax lines that the schema leaves out by design; they matter only when it fails.
    done = subprocess.run(command, stderr=subprocess.PIPE, text=True, check=False)
    if done.returncode != 0:
        sys.exit(f"{done.stderr}make_schema.py: protoc failed with exit code {done.returncode}")


if __name__ == "__main__":
    main(sys.argv[1])
