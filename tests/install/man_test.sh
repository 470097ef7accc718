#!/bin/sh
# The manual page keeps up with the tool: every command `tqovix --help` lists has a section,
# every option a command's --help prints is described, every exported code is listed, and
# groff reads the page without a warning.
# usage: man_test.sh TQOVIX MANPAGE
set -eu
tool=$1
page=$2
failed=0
# The page as plain words: roff's escaped hyphens and font changes removed.
text=$(sed -e 's/\\-/-/g' -e 's/\\f[BIRP]//g' "$page")

mentions() { printf '%s\n' "$text" | grep -qE -- "(^|[^a-z0-9-])$1([^a-z0-9-]|\$)"; }

commands=$("$tool" --help | sed -n 's/^  \([a-z][a-z-]*\) .*/\1/p' | grep -v '^tqovix$')
[ -n "$commands" ] || { echo "FAILED: no commands in tqovix --help"; exit 1; }
for command in $commands; do
    if ! printf '%s\n' "$text" | grep -qE "^\.SS $command( |\$)"; then
        echo "FAILED: no section for '$command'"
        failed=1
    fi
    for option in $("$tool" "$command" --help | grep -oE -- '(^|[ [|])--?[a-zA-Z][a-zA-Z0-9-]*' | sed 's/^[ [|]//' | sort -u); do
        if ! mentions "$option"; then
            echo "FAILED: '$command $option' is not described"
            failed=1
        fi
    done
done

for code in 0 7 8 9 20 100 110 111 120 121 130 131 190 200; do
    if ! sed -n '/^\.SH RESULT CODES/,/^\.SH /p' "$page" | grep -qx "\.B $code"; then
        echo "FAILED: result code $code is not listed"
        failed=1
    fi
done

if command -v groff >/dev/null; then
    warnings=$(groff -man -ww -z -t "$page" 2>&1)
    if [ -n "$warnings" ]; then
        echo "FAILED: groff: $warnings"
        failed=1
    fi
fi
[ $failed -eq 0 ] && echo "the manual page covers $(echo $commands | wc -w) commands and their options"
exit $failed
