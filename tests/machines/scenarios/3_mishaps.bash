# What breaks off in the midst of a push is made up for, without anybody's help.
# shellcheck shell=bash

power_cut_of_the_client() {  # scenario
    in_a_push
    machine down client kill
    machine up client --disk photos=/srv/photos
    until_true 60 in_step
}

power_cut_of_the_server() {  # scenario
    in_a_push
    machine down server kill
    machine up server --disk copies=/srv/copies
    until_true 60 in_step  # what a receiver had of a file when it died is gone, too
}

killed_daemons() {  # scenario
    in_a_push
    at client systemctl kill --signal=KILL zel_daemon
    until_true 60 in_step
    in_a_push
    at server systemctl kill --signal=KILL zel_rsyncd
    until_true 60 in_step
}

restarted_daemons() {  # scenario
    in_a_push
    at client systemctl restart zel_daemon
    at server systemctl restart zel_rsyncd
    until_true 60 in_step
}

network_cut() {  # scenario
    in_a_push
    machine cable client pulled
    sleep 10
    fails in_step
    machine cable client plugged
    until_true 90 in_step
}

# A server that takes the connection and says nothing, and one that falls silent in the midst of a push, end a run in the
# time that is set, once, and are left for later.
silent_server() {  # scenario
    at client bash -c 'printf "[rsync]\nanswer_seconds=\"4\"\ndead_seconds=\"8\"\n" >/usr/tarq/etc/tarqrsync.conf'
    at server systemctl stop zel_rsyncd
    at server systemd-run --quiet --unit=silent perl -MIO::Socket::INET -e \
        'my $s = IO::Socket::INET->new(LocalPort => 874, Listen => 5, ReuseAddr => 1) or die; my @c; while (push @c, $s->accept) {}'
    until_true 5 at server bash -c 'ss -ltn | grep -q :874'
    local begin=$SECONDS
    ends_with 1 at client zelctl task run photos --wait
    echo "$((SECONDS - begin)) s"
    ((SECONDS - begin < 12))
    ends_with 3 at client zelctl doctor
    at server systemctl stop silent
    at server systemctl start zel_rsyncd
    until_true 60 at client zelctl task run photos --wait  # which waits for no next try
    in_step

    in_a_push
    machine cable server pulled
    until_true 30 at client bash -c 'zelctl task log photos --limit 1 | grep -q "is dead"'
    machine cable server plugged
    until_true 60 in_step
    at client rm /usr/tarq/etc/tarqrsync.conf
}
