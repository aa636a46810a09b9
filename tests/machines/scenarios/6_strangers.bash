# A local user without rights who came first, and looks at everything.
# shellcheck shell=bash

stranger() {
    local name
    for name in client server; do at "$name" bash -c 'id mallory >/dev/null || useradd mallory'; done
}

nothing_to_see() {  # scenario
    local name
    stranger
    at client bash -c 'install -m 600 /dev/null /srv/photos/secret; echo "for my eyes" >>/srv/photos/secret'
    until_true 20 in_step
    fails at_as server mallory cat /srv/copies/photos/secret
    fails at_as client mallory zelctl status
    fails at_as client mallory zelctl task list --json
    in_a_push
    # In what the programs wrote, and in the processes' argument lists and environments.
    for name in client server; do
        fails at_as "$name" mallory grep -rqsF -e "$password" /usr/tarq /run /tmp /var /srv/copies /proc/[0-9]*/{cmdline,environ}
    done
    until_true 30 in_step
}

# He has made the scratch folder and the semaphore of the programs before they come up.
nothing_to_hold() {  # scenario
    stranger
    local name
    for name in client server; do
        # A key for System V semaphores is anybody's: he holds the one of the registry's lock.
        at_as "$name" mallory perl -e '$id = semget(0x2980298, 1, 01666) // die $!; semop($id, pack("s!3", 0, 1, 0)) || die $!'
        at_as "$name" mallory bash -c 'echo 1 >/run/lock/tarqcore || true'
        fails at_as "$name" mallory bash -c 'mkdir /run/tarqcore || ls /run/tarqcore'
    done
    at client rm -rf /tmp/ZEL
    at_as client mallory mkdir -m 700 /tmp/ZEL
    at client systemd-tmpfiles --create  # as each boot does, and the package's installation
    at client systemctl restart zel_daemon
    at client bash -c 'date >/srv/photos/date'
    until_true 20 in_step
    typed client "zelctl push photos --server nas2 --user alice"
    at server zel_server status
}

# Copies have the modes of their files at the client; the folder above them keeps everybody else out.
copies_are_closed() {  # scenario
    local attempt
    stranger
    at client bash -c 'install -m 666 /dev/null /srv/photos/all; echo mine >>/srv/photos/all'
    until_true 20 in_step
    is "$(at server stat -c '%U %a' /srv/copies)" "zel 700"
    for attempt in 'cat' 'echo forged >>' 'ln -t /tmp' 'touch -r /etc/passwd' 'ls -l'; do
        fails at_as server mallory bash -c "$attempt /srv/copies/photos/all"
    done
    # Whoever opens it is told, and nothing is served before it is closed.
    at server chmod 755 /srv/copies
    ends_with 1 at server zel_server status
    ends_with 4 at client zelctl task run photos --wait
    fails at server systemctl restart zel_rsyncd
    at server zel_server setup
    at client zelctl task run photos --wait
    # An earlier version has left it open: the first start of this one closes it.
    at server systemctl stop zel_rsyncd
    at server bash -euc 'sed -i /closed=/d /usr/tarq/etc/zel_server/server.conf
        chown root: /srv/copies
        chmod 755 /srv/copies'
    at server systemctl start zel_rsyncd
    is "$(at server stat -c '%U %a' /srv/copies)" "zel 700"
    at client zelctl task run photos --wait
    at server zel_server status
    in_step
}

# Strangers on the network: nothing without TLS, and no more than so many connections; who says nothing is ended.
crowd_on_the_network() {  # scenario
    fails at client bash -c 'exec 3<>/dev/tcp/10.77.0.2/873'
    at client systemd-run --quiet --unit=crowd perl -MIO::Socket::INET -e \
        'my @c; push @c, IO::Socket::INET->new("10.77.0.2:874") // () for 1..300; sleep 600'
    until_true 10 at server bash -c 'ss -Htn state established "( sport = :874 )" | grep -q .'
    sleep 2
    (($(at server bash -c 'ss -Htn state established "( sport = :874 )" | wc -l') <= 64))
    # Another address is served meanwhile, through the same front.
    at server bash -c 'timeout 5 openssl s_client -quiet -verify_quiet -connect 10.77.0.2:874 </dev/null 2>/dev/null | grep -q RSYNCD' ||
        at server timeout 5 openssl s_client -connect 10.77.0.2:874
    until_true 40 at server bash -c '! ss -Htn state established "( sport = :874 )" | grep -q .'
    at client systemctl stop crowd
    at client zelctl task run photos --wait
}

# Another key in the server's place gets neither password nor file.
false_server() {  # scenario
    at server bash -c 'mv /usr/tarq/etc/zel_server/front.pem /root/ && systemctl restart zel_rsyncd'  # which makes a new one
    until_true 10 at server zel_server status
    ends_with 4 at client zelctl task run photos --wait
    at client bash -c 'zelctl task log photos --limit 1 | grep -q "zelctl trust nas2"'
    ends_with 3 at client zelctl doctor
    fails at client bash -c 'zelctl push photos --server nas2 --user alice --password-file - <<<any'
    at server bash -c 'mv /root/front.pem /usr/tarq/etc/zel_server/ && systemctl restart zel_rsyncd'
    until_true 10 at server zel_server status
    at client zelctl task run photos --wait
    at client zelctl doctor
}
