# What scenarios are written with. Sourced by `run`, which also sets $project and $packages.
# shellcheck shell=bash

readonly password='two words & "signs"'  # of the account alice

machine() { "$here/machine" "$@"; }

# at MACHINE COMMAND...
at() { machine in "$@"; }

# at_as MACHINE USER COMMAND...
at_as() { at "$1" runuser -u "$2" -- "${@:3}"; }

# typed MACHINE COMMAND-LINE: as a person at a terminal who is asked for the password.
typed() { "$here/answer" "$password" "$here/machine" in "$1" bash -c "$2"; }

# until_true SECONDS COMMAND...
until_true() {
    local end=$((SECONDS + $1))
    shift
    until "$@" >/dev/null 2>&1; do
        if ((SECONDS >= end)); then
            echo "in vain: $*" >&2
            return 1
        fi
        sleep 0.2
    done
}

# ends_with STATUS COMMAND...
ends_with() {
    local expected=$1 status=0
    shift
    "$@" || status=$?
    [ "$status" -eq "$expected" ] || { echo "status $status instead of $expected: $*" >&2; return 1; }
}

# fails COMMAND...: in place of "!", which ends no scenario.
fails() {
    if "$@"; then
        echo "succeeds: $*" >&2
        return 1
    fi
}

is() { [ "$1" = "$2" ] || { echo "'$1' instead of '$2'" >&2; return 1; }; }

# commands_of FILE HEADING INTRODUCTION: the indented lines that follow this line of the documentation, without remarks.
commands_of() {
    awk -v heading="## $2" -v introduction="$3" '
        /^## / { inside = $0 == heading; found = 0 }
        inside && $0 == introduction { found = 1; next }
        inside && found && /^    / { print substr($0, 5); next }
        inside && found && NF { found = 0 }' "$project/$1" | sed 's/  *# .*//'
}

# ---- Trees ----

# tree MACHINE FOLDER: what is in it, but for the folder that the server has in each copy; files by their content.
tree() {
    at "$1" bash -euo pipefail -c 'cd "$1"
        find . -type f -print0 | xargs -0 -r sha256sum -b
        find . ! -type f ! -path "./.zel_*" -printf "%y %p %l\n"' -- "$2" | LC_ALL=C sort
}

# same_tree CLIENT-FOLDER SERVER-FOLDER
same_tree() { diff <(tree client "$1") <(tree server "$2"); }

in_step() { same_tree /srv/photos /srv/copies/photos; }

# same_file NAME: of the share photos.
same_file() { cmp "$MACHINES/disk/photos/$1" "$MACHINES/disk/copies/photos/$1"; }

# random_file PATH MIB: a file on the client that cannot be compressed.
random_file() { at client dd if=/dev/urandom of="$1" bs=1M count="$2" status=none; }

# ---- Tasks ----

# of_task TASK FILTER: one of its facts as jq gives it.
of_task() { at client zelctl task show "$1" --json | jq -r "$2"; }

# last_run TASK FILTER
last_run() { at client zelctl task log "$1" --limit 1 --json | jq -r ".[0] | $2"; }

runs() { at client zelctl task log "$1" --limit 200 --json | jq length; }

task_is() { [ "$(of_task "$1" "$2")" = true ]; }

active() { at "$1" systemctl is-active --quiet "$2"; }

# in_a_push: begins a push of some seconds, and returns in the midst of it. What it sends is never in the copy by halves.
in_a_push() {
    until_true 30 at client zelctl task edit photos --bwlimit 4000  # when no run is under way
    random_file /srv/photos/large 24
    until_true 20 at server bash -c 'find /proc/[0-9]*/fd -lname "/srv/copies/photos/.zel_partial/*/large.*" -printf "%l\n" |
        xargs -r du -m | grep -q "^[1-9]"'
    fails in_step >/dev/null
}

# give_packages MACHINE FOLDER: into its /root/packages.
give_packages() {
    rm -rf "$MACHINES/root/$1/root/packages"
    cp -r "$2" "$MACHINES/root/$1/root/packages"
}
