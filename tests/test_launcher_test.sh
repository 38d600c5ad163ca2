#!/bin/sh
# The test launcher: ends as the test did, ends what the test left behind
# (also what holds the test's output open), and reaps orphans meanwhile.
#   test_launcher_test.sh LAUNCHER SCRATCH_DIR
set -u
launcher=$1
dir=$(mktemp -d "$2/launcher.XXXXXX")
storm=
trap '[ -n "$storm" ] && kill $storm 2>/dev/null; rm -rf "$dir"' EXIT
fail() { echo "FAIL: $*"; exit 1; }

# A test that exits 3 and leaves a process holding its output: the launcher
# must end with 3 at once, the output must reach its end, the process be gone.
# (cat ends only when nobody holds the pipe any more)
timeout 20 sh -c "'$launcher' /bin/sh -c \"sleep 300 & echo \\\$! > '$dir/pid'\" | cat" ||
    fail "the output stayed open behind the test"
"$launcher" /bin/sh -c "sleep 300 & echo \$! > '$dir/pid2'; exit 3" > /dev/null
[ $? -eq 3 ] || fail "exit status not passed on"
for f in pid pid2; do
    kill -0 "$(cat "$dir/$f")" 2>/dev/null && fail "a leftover process still runs"
done

# While processes come and go on the machine (their /proc entries vanish
# while it reads them), the launcher still ends the leftovers and passes the
# status on. (A read that threw on a vanished entry failed 1 run in 40 here.)
( while :; do /bin/true; done ) &
storm=$!
for round in $(seq 40); do
    "$launcher" /bin/sh -c 'sleep 30 & sleep 30 & exit 4' > /dev/null 2>&1
    status=$?
    [ $status -eq 4 ] || fail "processes coming and going upset the launcher"
done
kill $storm
storm=

# A test that dies of a signal: the launcher dies of the same one.
"$launcher" /bin/sh -c 'kill -SEGV $$'
[ $? -eq $((128 + 11)) ] || fail "a test killed by SIGSEGV did not end the launcher by it"

# An orphan that ends while the test runs is reaped, not left a zombie.
"$launcher" /bin/sh -c "( sleep 0.1 & echo \$! > '$dir/orphan' ); sleep 1;
    ps -o stat= -p \$(cat '$dir/orphan') | grep -q Z && exit 9; exit 0"
[ $? -eq 0 ] || fail "an orphan that ended was left a zombie while the test ran"

# Nothing to run is an error of the launcher's own.
"$launcher" 2>/dev/null
[ $? -eq 2 ] || fail "no program given was not refused"
echo "PASS"
