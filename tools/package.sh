# Sourced by test.sh: checks what `cmake --install` and `cpack -G DEB` make of a build tree.

# check_install_and_package BUILD_DIR: installs BUILD_DIR into a staging root and runs the
# installed binary; builds the Debian package, checks that it holds exactly the staged files and
# depends on libbsd and the C++ runtime, and runs the binary unpacked from it.
check_install_and_package() {
    local build
    build=$(cd "$1" && pwd)
    local stage=$build/stage unpacked=$build/deb-root
    rm -rf "$stage" "$unpacked" "$build"/memspread_*.deb
    cmake --install "$build" --prefix "$stage/usr" >/dev/null

    local file
    for file in usr/bin/memspread usr/share/man/man1/memspread.1.gz \
        usr/share/bash-completion/completions/memspread usr/share/doc/memspread/README.md \
        usr/share/doc/memspread/usage.md usr/share/doc/memspread/json.md; do
        [ -f "$stage/$file" ] || { echo "install: $file is missing" >&2; return 1; }
    done
    local warnings
    warnings=$(gzip -dc "$stage/usr/share/man/man1/memspread.1.gz" | groff -man -ww -z 2>&1)
    [ -z "$warnings" ] || { echo "install: the installed man page: $warnings" >&2; return 1; }
    check_installed_binary "$stage/usr/bin/memspread" || return 1

    if ! (cd "$build" && cpack -G DEB >"$build/cpack.log" 2>&1); then
        cat "$build/cpack.log" >&2
        return 1
    fi
    local deb
    deb=$(echo "$build"/memspread_*.deb)
    [ -f "$deb" ] || { echo "package: cpack made no .deb" >&2; return 1; }
    local depends
    depends=$(dpkg-deb -f "$deb" Depends)
    case "$depends" in
        *libbsd0*libstdc++6* | *libstdc++6*libbsd0*) ;;
        *) echo "package: dependencies without libbsd0 or libstdc++6: $depends" >&2; return 1 ;;
    esac
    local packaged staged
    packaged=$(dpkg-deb -c "$deb" | awk '$1 !~ /^d/ { sub(/^\.\//, "", $6); print $6 }' | sort)
    staged=$(cd "$stage" && find . -type f | sed 's|^\./||' | sort)
    [ "$packaged" = "$staged" ] || {
        echo "package: files differ from the staged install:" >&2
        diff <(echo "$staged") <(echo "$packaged") >&2
        return 1
    }
    dpkg-deb -x "$deb" "$unpacked"
    check_installed_binary "$unpacked/usr/bin/memspread" || return 1
    echo "package: $(basename "$deb"), Depends: $depends"
}

# check_installed_binary BINARY: it measures this shell and writes a JSON document that parses.
check_installed_binary() {
    local binary=$1 json
    json=$(mktemp)
    if ! "$binary" -j "$json" $$ >/dev/null || ! python3 -m json.tool "$json" >/dev/null; then
        echo "install: $binary does not measure a process" >&2
        rm -f "$json"
        return 1
    fi
    rm -f "$json"
}
