#!/usr/bin/env bash
# The completions, driven as readline drives them, with lists that come from here.  completion_test.sh SOURCE-FOLDER ZELCTL
set -euo pipefail
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
mkdir -p "$work"/{bin,zel,bash-completion/completions}
cp "$1"/packaging/completions/z* "$work/bash-completion/completions/"
cp "$1/packaging/completions/common.bash" "$work/zel/completion.bash"
cat >"$work/bin/zelctl" <<END
#!/bin/sh
zelctl=$2
END
cat >>"$work/bin/zelctl" <<'END'
echo "a complaint" >&2
case "$*" in
    *--help) exec "$zelctl" "$@" ;;
    "task list --json") printf '%s\n' '[{"id": 1, "name": "my photos", "server_name": "nas"},' '{"name": "a:b=c"},' '{"name": "x\\y"}]' ;;
    "share list --json") printf '%s\n' '[' '  {' '    "share": "Übungen",' '    "folder": "/srv"' '  }' ']' ;;
esac
END
printf '#!/bin/sh\nexit 1\n' >"$work/bin/zel_server"  # not set up
chmod +x "$work"/bin/*
PATH=$work/bin:$PATH
export LC_ALL=C.UTF-8
for program in zelctl zel_server zel_daemon; do . "$work/bash-completion/completions/$program"; done

failures=0
# expect "REPLIES" WORD...: the last word is completed to these, each in <>; errors would be seen at the prompt.
expect() {
    local wanted=$1 got
    shift
    COMP_WORDS=("$@") COMP_CWORD=$(($# - 1)) COMPREPLY=()
    "_$1" 2>"$work/errors" || true
    got=$(printf '<%s>' "${COMPREPLY[@]}")
    if [ "$got" != "$wanted" ] || [ -s "$work/errors" ]; then
        echo "$*: $got instead of $wanted $(cat "$work/errors")"
        failures=$((failures + 1))
    fi
}
expect '<my\ photos><a:b=c><x\\y>' zelctl task show ''
expect '<my\ photos>' zelctl task show 'my\ ph'
expect '<my photos>' zelctl task show '"my ph'
expect '<b=c>' zelctl task run other a : b
expect '<>' zelctl task show 'my\ photos' ''
expect '<Übungen>' zelctl task add x --share ''
expect '<Übungen>' zelctl task edit x --share = Ü
expect '<my\ photos>' zelctl task edit --server nas my
expect '<Übungen>' zelctl push --server nas other ''
expect '<--help><--limit><--json><--verbose>' zelctl task log x --
expect '<--ssh><--ssh-port>' zelctl task add x --bwlimit 7 --ss
expect '<--help><--fingerprint><--plain><--ssh><--list><--forget><--json>' zelctl trust nas --
expect '<--no-exclude>' zelctl task edit x --no-e
expect '<--monthly>' zelctl next --mo
expect '<run><rm><resume>' zelctl help task r
expect '<>' zel_server account rm ''
expect '<syslog>' zel_daemon --foreground --log sy
exit "$((failures > 0))"
