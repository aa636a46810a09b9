# What people do on good days.
# shellcheck shell=bash

changes_are_sent_by_themselves() {  # scenario
    at client bash -euc 'cd /srv/photos
        echo first >"a file"
        mkdir -p new/folder
        echo in it >new/folder/file'
    until_true 20 in_step
    at client bash -euc 'cd /srv/photos
        echo more >>"a file"
        mv new moved
        echo deep >moved/folder/another
        rm -r "2024 summer"'
    until_true 20 in_step
    is "$(last_run photos .reason)" change
    at server test -d /run/zel_server/.pushes  # some needed one connection alone
    at client zelctl doctor
}

# Owners, modes, lists and attributes come back, though the server's daemon may not set them.
files_come_back_as_they_were() {  # scenario
    at client bash -euc 'mkdir /srv/photos/special
        cd /srv/photos/special
        echo private >private
        chown daemon:mail private
        chmod 4600 private
        setfacl -m u:games:r private
        setfattr -n user.colour -v red private
        ln -s nowhere link
        mkfifo pipe
        touch -d 1999-12-31 old'
    at client zelctl task run photos --wait
    typed client "$(commands_of docs/operations.md "Get files back" \
        "At the client that pushes, or at any other that knows the account's password:" | head -n 1)"
    is "$(at client rsync -aAXn --itemize-changes --checksum --delete --numeric-ids /srv/photos/ /srv/restored/)" ""
    at client rm -r /srv/restored /srv/photos/special
}

# Without anybody at the server, as nobody reaches what it keeps.
what_was_lost_comes_back() {  # scenario
    at client bash -euc 'mkdir /srv/photos/papers; echo first >/srv/photos/papers/letter; echo kept >/srv/photos/papers/note'
    until_true 20 in_step
    sleep 1.1
    local moment
    moment=$(at client date '+%Y-%m-%d %H:%M:%S')
    sleep 1.1
    at client bash -euc 'echo another >/srv/photos/papers/letter; rm /srv/photos/papers/note'
    until_true 20 in_step
    at server ls /srv/copies/.versions/photos
    at server zel_server versions photos --json | jq -e '.. | numbers' >/dev/null
    at client zelctl versions photos papers/note
    at client zelctl restore photos --to /srv/restored --at "$moment" papers
    is "$(at client bash -euc 'cat /srv/restored/papers/letter /srv/restored/papers/note')" $'first\nkept'
    at client rm -r /srv/restored /srv/photos/papers
}

# age_oldest_version DAYS
age_oldest_version() {
    at server bash -euc 'cd /srv/copies/.versions/photos
        set -- "$1" *
        mv "$2" "$(date -d "$1 days ago" +%Y%m%d)${2:8}"' age "$1"
}

# As the unit lets them: with time, and with less than a tenth of the disk free.
old_versions_go() {  # scenario
    local number versions=$MACHINES/disk/copies/.versions/photos
    for number in 1 2 3; do
        at client bash -c "echo $number >/srv/photos/changing"
        until_true 20 same_file changing
    done
    age_oldest_version 400
    at server systemctl restart zel_rsyncd
    until_true 20 bash -c "! ls $versions | grep -q ^$(date -d '400 days ago' +%Y%m%d)"
    age_oldest_version 60
    at server bash -c 'fallocate -l "$(($(stat -f -c "%a*%S" /srv/copies) - 64*1024*1024))" /srv/copies/.filler'
    at client bash -c "echo 4 >/srv/photos/changing"
    until_true 20 bash -c "! ls $versions | grep -q ^$(date -d '60 days ago' +%Y%m%d)"
    at server rm /srv/copies/.filler
}

# A disk that has turned a bit says nothing of it.
damage_is_found() {  # scenario
    local copy=$MACHINES/disk/copies/photos
    at client bash -euc 'echo sound >/srv/photos/sound; echo lost >/srv/photos/lost'
    until_true 20 in_step
    at client zelctl verify photos
    at server bash -euc 'cd /srv/copies/photos
        touch -r sound /tmp/time
        printf S | dd of=sound conv=notrunc status=none
        touch -r /tmp/time sound
        rm lost'
    ends_with 1 at client zelctl verify photos >"$MACHINES/found"
    grep -q '^DAMAGED  sound ' "$MACHINES/found"
    grep -q '^differs  lost ' "$MACHINES/found"
    until_true 20 test -e "$copy/lost"
    at client bash -euc 'touch /srv/photos/sound'
    until_true 20 same_file sound
    at client rm /srv/photos/sound /srv/photos/lost
}

# Nobody has to look.
damage_is_found_by_itself() {  # scenario
    at client bash -euc 'mkdir /srv/rotten; echo sound >/srv/rotten/sound; zelctl share add rotten /srv/rotten'
    typed client "zelctl task add rotten --share rotten --server nas2 --user alice --on-change --verify off"
    until_true 20 task_is rotten '.result == "done"'
    at server bash -euc 'cd /srv/copies/rotten
        touch -r sound /tmp/time
        printf S | dd of=sound conv=notrunc status=none
        touch -r /tmp/time sound'
    at client zelctl task edit rotten --verify 30d
    until_true 120 task_is rotten '.damaged == 1 and .last_verified'  # a start has its minute
    ends_with 3 at client zelctl doctor
    at client touch /srv/rotten/sound
    until_true 20 task_is rotten '.damaged == null'
    at client bash -euc 'zelctl task rm rotten; zelctl share rm rotten; rm -r /srv/rotten'
}

reboots_lose_no_change() {  # scenario
    machine down client
    echo "while it was off" >"$MACHINES/disk/photos/off"
    machine up client --disk photos=/srv/photos
    until_true 30 in_step
    machine down server
    at client bash -c 'echo "while the server was off" >/srv/photos/server'
    until_true 20 task_is photos '.retry_in > 0'
    machine up server --disk copies=/srv/copies
    until_true 60 in_step
}
