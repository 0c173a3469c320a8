# The Debian packages that this project needs, and what scripts share. To be sourced by bash.

# Kept apart although building needs both: a machine that only runs an installed tree needs the first list.
runtime_packages=(
    libprotobuf32           # messages
    libicu72                # text
    libpython3.11           # the engine
    libedit2                # lines that are typed into the client
    libssl3                 # connections of the client through TLS
    python3 python3-numpy libopenblas0-pthread
)
build_packages=(
    g++ cmake ninja-build pkg-config
    protobuf-compiler libprotobuf-dev
    libboost-dev libicu-dev
    python3-dev pybind11-dev
    libcli11-dev nlohmann-json3-dev libedit-dev libssl-dev
)
test_packages=(
    libgtest-dev libgmock-dev libbenchmark-dev valgrind
    python3-protobuf                                    # the client for Python
    mypy python3-pip python3-setuptools python3-wheel   # its types and its wheel
    python3-matplotlib                                  # figures, which an engine shows
    mandoc man-db zsh fish                              # manual pages and completions
    clang                                               # users of the installed tree have it or g++
    abigail-tools                                       # whether the libraries' ABI has changed
    python3-jsonschema                                  # what --json prints
    libsixel-bin                                        # pictures as sixels
)
# What draws the pictures of benchmarks.
bench_packages=(python3-matplotlib)
# What benchmarks compare with when they are asked to; nothing else needs these.
peer_packages=(
    libcapnp-dev capnproto
    libflatbuffers-dev flatbuffers-compiler
    libmsgpack-dev
    libzmq3-dev
    libgrpc++-dev protobuf-compiler-grpc
    python3-ipykernel python3-jupyter-client
)
# What ./scripts/ecosystem tests this system with; nothing else needs these.
ecosystem_packages=(
    python3-ipykernel python3-jupyter-client python3-nbclient jupyter-notebook  # notebooks
    chromium chromium-driver python3-selenium                                   # the page of a notebook
    python3-pandas                                                              # frames, whose columns are completed
    python3-distributed                                                         # clusters
    python3-matplotlib
    tshark                                                                      # recordings of sessions
    slurmctld slurmd slurm-client munge                                         # a cluster with a queue
    openssh-client openssh-server socat systemd haproxy openssl                 # engines elsewhere
)
# The conformance vectors' reader in JavaScript; not asked for where a Node.js from elsewhere has both programs.
javascript_packages=(nodejs npm)
# What ./scripts/debian-packages needs besides.
debian_packages=(debhelper dh-python dpkg-dev python3-all python3-setuptools lintian)
clang_packages=(libclang-rt-14-dev)
coverage_packages=(llvm-14)
tidy_packages=(clang-tidy)
reference_packages=(doxygen)

# say TEXT...: a heading.
say() {
    if [ -t 1 ]; then
        printf '\n\033[1m==> %s\033[0m\n' "$*"
    else
        printf '\n==> %s\n' "$*"
    fi
}

# ensurePackages NAME...: installs those that are missing, as root or with sudo. Without a missing one it only asks dpkg,
# so it needs neither network nor rights then.
ensurePackages() {
    local missing=() package
    for package in "$@"; do
        if [ "$(dpkg-query -W -f='${db:Status-Status}' "$package" 2>/dev/null)" != installed ]; then
            missing+=("$package")
        fi
    done
    if [ ${#missing[@]} -eq 0 ]; then
        echo "All $# packages are installed already."
        return
    fi
    local as_root=()
    if [ "$(id -u)" -ne 0 ]; then
        if ! command -v sudo >/dev/null; then
            echo "Missing packages: ${missing[*]}" >&2
            echo "Install them as root, or install sudo and run this again." >&2
            return 1
        fi
        as_root=(sudo)
    fi
    echo "Installing: ${missing[*]}"
    "${as_root[@]}" env DEBIAN_FRONTEND=noninteractive apt-get -qq update
    "${as_root[@]}" env DEBIAN_FRONTEND=noninteractive apt-get -qq -y --no-install-recommends \
        -o Dpkg::Use-Pty=0 install "${missing[@]}"
}
