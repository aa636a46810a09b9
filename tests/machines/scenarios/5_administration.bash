# What administrators get wrong is refused or told, and what runs goes on.
# shellcheck shell=bash

# While something is wrong, the server's status and the client's doctor say so by how they end.
told() {
    ends_with 1 at server zel_server status
    ends_with 3 at client zelctl doctor
}

well() {
    at server zel_server status
    at client zelctl doctor
}

set_up_tells_the_truth() {  # scenario
    local before
    before=$(at server cksum /usr/tarq/etc/zel_server/{server,rsyncd}.conf)
    fails at server zel_server setup --storage /tmp/copies
    fails at server zel_server setup --storage /usr/copies
    at server systemd-run --quiet --unit=holder perl -MIO::Socket::INET -e \
        'my $s = IO::Socket::INET->new(LocalPort => 8730, Listen => 5) or die; sleep 600'
    until_true 5 at server bash -c 'ss -ltn | grep -q :8730'
    fails at server zel_server setup --port 8730
    at server systemctl stop holder
    is "$(at server cksum /usr/tarq/etc/zel_server/{server,rsyncd}.conf)" "$before"

    at server zel_server disable
    at server zel_server setup
    told
    ends_with 4 at client zelctl task run photos --wait
    at server zel_server enable
    at client zelctl task run photos --wait
    well
}

# Through ssh the same server is reached, at its loopback address; known by its host key under another of its names.
through_ssh() {  # scenario
    at server useradd alice
    echo "alice:$password" | at server chpasswd
    at client bash -c 'mkdir /srv/letters && echo dear >/srv/letters/one'
    at client zelctl share add letters /srv/letters
    # The server is known by its TLS key already: no command goes another way in passing.
    ends_with 2 typed client "zelctl task add letters --share letters --server nas2 --user alice --ssh --manual"
    typed client "zelctl task add letters --share letters --server server --user alice --ssh --manual"
    at client zelctl task run letters --wait
    same_tree /srv/letters /srv/copies/letters
    at server zel_server setup --address 10.77.0.2
    at client bash -c 'echo yours >/srv/letters/two'
    at client zelctl task run letters photos --wait
    same_tree /srv/letters /srv/copies/letters
    at server zel_server setup --address all
    well
}

stopped_server() {  # scenario
    at server systemctl stop zel_rsyncd
    told
    at server systemctl start zel_rsyncd
    mount -o remount,ro "$MACHINES/disk/copies"
    ends_with 1 at server zel_server status
    mount -o remount,rw "$MACHINES/disk/copies"
    well
}

damaged_registry() {  # scenario
    at server sed -i '/^.SHARE_photos/q' /usr/tarq/etc/tarqZEL.info
    ends_with 4 at client zelctl task run photos --wait
    told
    at server zel_server repair
    at client zelctl task run photos --wait
    well
}

another_password() {  # scenario
    echo another one | at server zel_server account add alice --password-file - --reset
    ends_with 3 at client zelctl doctor
    ends_with 4 at client zelctl task run photos --wait
    echo "$password" | at server zel_server account add alice --password-file - --reset
    at client zelctl task run photos --wait
    well
}

# A wrong file is refused at a reload, and not started with again and again.
wrong_configuration() {  # scenario
    at client bash -c 'printf "[daemon]\nworkers=\"many\"\n" >/usr/tarq/etc/zel_daemon.conf'
    fails at client systemctl reload zel_daemon
    active client zel_daemon
    ends_with 3 at client zelctl doctor
    fails at client systemctl restart zel_daemon
    sleep 6
    is "$(at client systemctl show -P NRestarts zel_daemon)" 0
    at client rm /usr/tarq/etc/zel_daemon.conf
    at client systemctl restart zel_daemon
    until_true 20 well
}

# A task that cannot watch anything is found by the doctor; its changes are found at a poll.
nothing_watched() {  # scenario
    at client bash -euc 'mkdir /etc/systemd/system/zel_daemon.service.d
        printf "[Service]\nSystemCallFilter=~inotify_init1\n" >/etc/systemd/system/zel_daemon.service.d/confined.conf
        systemctl daemon-reload
        systemctl restart zel_daemon'
    until_true 10 at client zelctl status
    ends_with 3 at client zelctl doctor
    at client bash -euc 'rm -r /etc/systemd/system/zel_daemon.service.d
        systemctl daemon-reload
        systemctl restart zel_daemon'
    until_true 20 well
}

# One share that cannot be sent does not keep the others.
one_bad_share() {  # scenario
    at client bash -euc 'mkdir /srv/{good,lost}
        echo good >/srv/good/file
        echo lost >/srv/lost/file
        zelctl share add good /srv/good
        zelctl share add lost /srv/lost'
    typed client "zelctl task add two --share lost good --server nas2 --user alice --on-change"
    until_true 20 same_tree /srv/lost /srv/copies/lost
    at client mv /srv/lost /srv/moved
    at client bash -c 'echo better >/srv/good/file'
    until_true 20 same_tree /srv/good /srv/copies/good
    at client bash -c 'echo best >/srv/good/file'
    until_true 15 same_tree /srv/good /srv/copies/good  # not when the other one is tried again
    is "$(at server cat /srv/copies/lost/file)" lost
    until_true 20 fails at client zelctl task run two --wait  # at first it may be the run that sent the change
    at client zelctl task rm two
}
