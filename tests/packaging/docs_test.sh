#!/usr/bin/env bash
# The manual pages, docs/usage.md and the usage text describe the options the parser accepts:
# every option of the parser's tables is in the man page and in docs/usage.md; every option of
# the usage text is one of the parser's, which leaves out only the options it hides on purpose;
# the man page names every --sort column and -f format that the binary accepts; and groff reads
# every page without a warning.
# vmsnap's page names every option of vmsnap's usage.
# Usage: docs_test.sh MEMSPREAD_BINARY SOURCE_DIR VMSNAP_BINARY
set -uo pipefail
binary=$1
source_dir=$2
vmsnap=$3
failures=0

fail() {
    echo "FAIL: $*" >&2
    failures=$((failures + 1))
}

# Options the usage text does not list: -t (measures children), --metrilog (listed only on
# internal builds of the platform) and the deprecated ones, which only warn.
hidden_options='-t --targetChildren --metrilog -y --summary --physMemspread'

# The parser's options: the long-option table and the short-option string of the parser.
parser_source=$source_dir/src/driver/RKMemspreadArgs.cpp
long_options=$(grep -oE '\{"[A-Za-z]+", *(no|required|optional)_argument' "$parser_source" |
    sed -E 's/^\{"([A-Za-z]+)".*/--\1/')
short_letters=$(sed -nE 's/.*kShortOptions = "([^"]*)".*/\1/p' "$parser_source" | tr -d ':')
[[ $(wc -l <<<"$long_options") -ge 10 && ${#short_letters} -ge 5 ]] || fail "cannot read the options of $parser_source"
parser_options=$(printf '%s\n' $long_options $(grep -o . <<<"$short_letters" | sed 's/^/-/') | sort -u)

# The text of a page or document with roff's escaped hyphens and font changes taken out.
man_page=$source_dir/man/memspread.1
man_text=$(sed -E 's/\\-/-/g; s/\\f[BIRP]//g' "$man_page")
usage_doc=$(cat "$source_dir/docs/usage.md")

# mentions TEXT OPTION: OPTION stands in TEXT as a word of its own.
mentions() {
    grep -qE -- "(^|[^-[:alnum:]])$2([^-[:alnum:]]|$)" <<<"$1"
}

for option in $parser_options; do
    mentions "$man_text" "$option" || fail "$option is not in man/memspread.1"
    mentions "$usage_doc" "$option" || fail "$option is not in docs/usage.md"
done

usage_options=$("$binary" -h | grep -oE -- '(^|[ ,])--?[A-Za-z]+' | tr -d ' ,' | sort -u)
for option in $usage_options; do
    grep -qxF -- "$option" <<<"$parser_options" || fail "the usage lists $option, which the parser does not accept"
done
for option in $parser_options; do
    listed=no
    grep -qxF -- "$option" <<<"$usage_options" && listed=yes
    hidden=no
    mentions "$hidden_options" "$option" && hidden=yes
    [[ $listed != "$hidden" ]] || fail "$option: listed by the usage: $listed, hidden on purpose: $hidden"
done

columns=$("$binary" --sort nonsense 2>&1 >/dev/null | sed -n 's/^Accepted arguments: //p' | tr -d ' ' | tr ',' ' ')
formats=$("$binary" -f nonsense 2>&1 >/dev/null | sed -n 's/^Accepted arguments: //p' | tr -d " '." | tr ',' ' ')
[[ -n $columns && -n $formats ]] || fail "cannot read the columns and formats from $binary"
for value in $columns $formats; do
    mentions "$man_text" "$value" || fail "the value $value is not in man/memspread.1"
    mentions "$usage_doc" "$value" || fail "the value $value is not in docs/usage.md"
done

vmsnap_text=$(sed -E 's/\\-/-/g; s/\\f[BIRP]//g' "$source_dir/man/vmsnap.1")
vmsnap_options=$("$vmsnap" -h | grep -oE -- '(^|[ ,])--?[A-Za-z]+' | tr -d ' ,' | sort -u)
[[ $(wc -l <<<"$vmsnap_options") -ge 6 ]] || fail "cannot read the options of $vmsnap"
for option in $vmsnap_options; do
    mentions "$vmsnap_text" "$option" || fail "$option is not in man/vmsnap.1"
done

for page in "$source_dir"/man/*.[1-8]; do
    warnings=$(groff -man -ww -z "$page" 2>&1)
    [[ -z $warnings ]] || fail "groff warns about $page: $warnings"
done

exit $((failures > 0))
