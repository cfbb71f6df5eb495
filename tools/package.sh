# Sourced by test.sh: checks what `cmake --install` and `cpack -G DEB` make of a build tree.

# check_install_and_package BUILD_DIR: installs BUILD_DIR into a staging root and runs the
# installed binaries; builds the Debian package, checks that it holds exactly the staged files and
# depends on libbsd and the C++ runtime, and runs the binaries unpacked from it.
check_install_and_package() {
    local build
    build=$(cd "$1" && pwd)
    local stage=$build/stage unpacked=$build/deb-root
    rm -rf "$stage" "$unpacked" "$build"/memspread_*.deb
    cmake --install "$build" --prefix "$stage/usr" >/dev/null

    local file
    for file in usr/bin/memspread usr/bin/vmsnap usr/share/man/man1/memspread.1.gz \
        usr/share/man/man1/vmsnap.1.gz usr/share/bash-completion/completions/memspread \
        usr/share/bash-completion/completions/vmsnap usr/share/doc/memspread/README.md \
        usr/share/doc/memspread/usage.md usr/share/doc/memspread/json.md \
        usr/share/doc/memspread/vmsnap.md; do
        [ -f "$stage/$file" ] || { echo "install: $file is missing" >&2; return 1; }
    done
    local warnings page
    for page in memspread vmsnap; do
        warnings=$(gzip -dc "$stage/usr/share/man/man1/$page.1.gz" | groff -man -ww -z 2>&1)
        [ -z "$warnings" ] || { echo "install: the installed man page $page.1: $warnings" >&2; return 1; }
    done
    check_installed_binary "$stage/usr/bin" || return 1

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
    check_installed_binary "$unpacked/usr/bin" || return 1
    echo "package: $(basename "$deb"), Depends: $depends"
}

# check_installed_binary BIN_DIR: its memspread measures this shell and writes a JSON document
# that parses; its vmsnap saves this shell, and memspread reports the file.
check_installed_binary() {
    local bin=$1 work
    work=$(mktemp -d)
    if ! "$bin/memspread" -j "$work/report.json" $$ >/dev/null || ! python3 -m json.tool "$work/report.json" >/dev/null; then
        echo "install: $bin/memspread does not measure a process" >&2
        rm -rf "$work"
        return 1
    fi
    if ! "$bin/vmsnap" -o "$work/shell.vmsnap" $$ >/dev/null ||
        ! "$bin/memspread" "$work/shell.vmsnap" | grep -q "\[$$\] (vmsnap)"; then
        echo "install: $bin/vmsnap does not save a process that memspread reports" >&2
        rm -rf "$work"
        return 1
    fi
    rm -rf "$work"
}
