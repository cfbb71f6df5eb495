# bash completion for memspread(1) and vmsnap(1)           -*- shell-script -*-

# Names under which memspread finds running processes, one a line: the file name of the
# executable, or, where the executable cannot be read (another user's process without root),
# the command name of /proc/PID/stat. Kernel threads are left out, as memspread leaves them
# out; "kernel" stands for the kernel itself. Reads /proc with one find and bash's own read, so
# that a server with many thousands of processes completes at once.
_memspread_process_names()
{
    local dir link stat_line rest
    echo kernel
    while IFS=$'\t' read -r dir link; do
        if [[ -n $link ]]; then
            link=${link% (deleted)}
            printf '%s\n' "${link##*/}"
        elif _memspread_read_stat "$dir"; then
            rest=${stat_line#*"("}
            printf '%s\n' "${rest%")"*}"
        fi
    done < <(find /proc/[0-9]*/exe -maxdepth 0 -printf '%h\t%l\n' 2>/dev/null)
}

# Pids of the processes memspread can measure, and 0 for the kernel.
_memspread_pids()
{
    local dir stat_line
    echo 0
    for dir in /proc/[0-9]*; do
        _memspread_read_stat "$dir" && printf '%s\n' "${dir#/proc/}"
    done
}

# Reads the stat file of the /proc directory $1 into the caller's variable stat_line. Fails for a
# process that is gone and for a kernel thread (PF_KTHREAD, 0x00200000, in the flags, the seventh
# field after the name).
_memspread_read_stat()
{
    local -a fields
    read -r stat_line 2>/dev/null <"$1/stat" || return 1
    read -ra fields <<<"${stat_line##*") "}"
    ! ((${fields[6]:-0} & 0x00200000))
}

# Adds to COMPREPLY the lines of standard input that start with the word $1 (as typed, quotes
# and backslashes included), once each, quoted for the shell.
_memspread_add_matching()
{
    local prefix=$1 word quoted
    [[ $prefix == *[\\\'\"]* ]] && prefix=$(dequote "$prefix")
    local -A seen=()
    while IFS= read -r word; do
        [[ -n $word && $word == "$prefix"* && -z ${seen["$word"]-} ]] || continue
        seen["$word"]=1
        printf -v quoted '%q' "$word"
        COMPREPLY+=("$quoted")
    done
}

# A target: a pid, a process name, or (a word that looks like a path) a snapshot file.
_memspread_target()
{
    local cur=$1 pids_only=${2-}
    if [[ -z $pids_only && ($cur == */* || $cur == .* || $cur == \~*) ]]; then
        _filedir
    elif [[ -n $pids_only || $cur == [0-9]* ]]; then
        _memspread_add_matching "$cur" < <(_memspread_pids)
    else
        _memspread_add_matching "$cur" < <(_memspread_process_names)
    fi
}

_memspread()
{
    local cur prev words cword split
    _init_completion -s || return

    case $prev in
        -j | --json | --metrilog)
            _filedir
            return
            ;;
        -f | --format)
            COMPREPLY=($(compgen -W 'bytes formatted pages' -- "$cur"))
            return
            ;;
        --sort)
            COMPREPLY=($(compgen -W 'dirty swapped clean reclaimable wired regions category' -- "$cur"))
            return
            ;;
        -p | --proc | -x | --exclude)
            _memspread_target "$cur"
            return
            ;;
        --pid)
            _memspread_target "$cur" pids
            return
            ;;
        --sample)
            return
            ;;
    esac
    $split && return

    if [[ $cur == -* ]]; then
        COMPREPLY=($(compgen -W '-a --all -j --json --metrilog -h --help -t --targetChildren
            -p --proc --pid -x --exclude -s --skip -v -f --format --sort -w --wide --swapped
            --wired --vmObjectDirty --unmapped --sample' -- "$cur"))
        return
    fi
    _memspread_target "$cur"
} &&
    complete -F _memspread memspread

# vmsnap saves live processes: its targets are pids and names, never files.
_vmsnap()
{
    local cur prev words cword split
    _init_completion -s || return

    case $prev in
        -o | --output)
            _filedir
            return
            ;;
    esac
    $split && return

    if [[ $cur == -* ]]; then
        COMPREPLY=($(compgen -W '-o --output -a --all -h --help' -- "$cur"))
        return
    fi
    # The kernel (pid 0, "kernel") has no address space to save.
    if [[ $cur == [0-9]* ]]; then
        _memspread_add_matching "$cur" < <(_memspread_pids | grep -vx 0)
    else
        _memspread_add_matching "$cur" < <(_memspread_process_names | grep -vx kernel)
    fi
} &&
    complete -F _vmsnap vmsnap

# ex: filetype=sh
