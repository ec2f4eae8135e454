# Sourced by the shell suites: the tally of checks and a bounded wait.
passed=0 failed=0
check() { # description, then a command that must succeed
    what=$1 && shift
    if "$@" >/dev/null 2>&1; then passed=$((passed + 1)) && echo "ok   $what"
    else failed=$((failed + 1)) && echo "FAIL $what"; fi
}
within() { # seconds, then a command: the waits poll, they never sleep a fixed time
    limit=$(($(date +%s) + $1)) && shift
    until "$@" >/dev/null 2>&1; do [ "$(date +%s)" -lt "$limit" ] || return 1 && sleep 0.2; done
}
not() { ! "$@"; }
give_up() { echo "FAIL $1" && echo "0 passed, 1 failed" && exit 1; } # the subject can't even start
summary() { echo "$passed passed, $failed failed$*" && exit $((failed > 0)); }
