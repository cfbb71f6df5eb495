# Shared by run.sh and test.sh: install what the build needs, then configure and build.

memspread_packages=(cmake g++ make libbsd-dev libgtest-dev libgmock-dev libbenchmark-dev util-linux python3)
# The Debian package (dpkg-shlibdeps; CPack's DEB generator runs file) and the checks of the man
# page and the bash completion.
memspread_packages+=(dpkg-dev file groff-base bash-completion)
# The fuzzers build with clang and its libFuzzer.
memspread_packages+=(clang libfuzzer-14-dev libclang-rt-14-dev)
# Snapshot files: a JSON parser, and zstd compression. The parser also judges the JSON strings
# fuzzer's output.
memspread_packages+=(nlohmann-json3-dev libzstd-dev)

# Installs the packages that are missing. apt-get runs only when something is missing, so a
# prepared machine builds without network or root.
install_missing_packages() {
    local missing=()
    for package in "${memspread_packages[@]}"; do
        dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q 'install ok installed' || missing+=("$package")
    done
    [ ${#missing[@]} -eq 0 ] && return 0
    echo "Installing: ${missing[*]}" >&2
    local sudo=()
    [ "$(id -u)" -ne 0 ] && sudo=(sudo)
    "${sudo[@]}" apt-get update -qq
    DEBIAN_FRONTEND=noninteractive "${sudo[@]}" apt-get install -y -qq "${missing[@]}" >/dev/null
}

# build_tree DIR [cmake options...]: configures DIR once and builds everything in it.
build_tree() {
    local dir=$1
    shift
    cmake -S "$memspread_root" -B "$dir" -DCMAKE_BUILD_TYPE=RelWithDebInfo "$@" >/dev/null
    cmake --build "$dir" -j "$(nproc)"
}
