# What breaks off in the midst of a push is made up for, without anybody's help.
# shellcheck shell=bash

power_cut_of_the_client() {  # scenario
    in_a_push
    machine down client kill
    machine up client --disk photos=/srv/photos
    until_true 60 in_step
}

# made_up_for: a receiver that died could not take away what it had of a file. That lies beside the file until the share is
# compared as a whole.
made_up_for() {
    until_true 60 same_file large
    at client zelctl task run photos --wait
    in_step
}

power_cut_of_the_server() {  # scenario
    in_a_push
    machine down server kill
    machine up server --disk copies=/srv/copies
    made_up_for
}

killed_daemons() {  # scenario
    in_a_push
    at client systemctl kill --signal=KILL zel_daemon
    until_true 60 in_step
    in_a_push
    at server systemctl kill --signal=KILL zel_rsyncd
    made_up_for
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
