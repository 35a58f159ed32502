#!/bin/sh
# vireo-forwarder against a private ClickHouse server (Debian's clickhouse-server, its own
# config in the temporary directory, free loopback ports), in two parts.
#
# Backlog: a store of N telemetry_messages rows (and SESSIONS sessions), filled in one
# transaction with message_load's 20-entry payload (~500 B of JSON), sent by
# `vireo-forwarder --once` with BatchRows=5000 (the default) and BatchRows=LARGE_BATCH.
# Floor: the same rows as a JSONEachRow file, loaded by clickhouse-client into an
# identical table (only the load is timed). Each repetition uses fresh databases and
# resets the store's cursors; the order of the three runs is reversed every second
# repetition, and the merges a run left behind are waited out before the next one.
# Every run is checked: count() FINAL = N.
#
# Load: message_load (1 client synchronous, 1 client with WINDOW in flight) against the
# private daemon, once without a forwarder and once with vireo-forwarder (Interval=1)
# running beside it and sending the rows the load writes, alternating, REPETITIONS times.
#
# Figures are medians over REPETITIONS. About seven minutes with the defaults.
#
# Environment: N rows (1000000), SESSIONS (10), LARGE_BATCH (50000), REPETITIONS (3),
# MESSAGES per synchronous phase (4000), PIPELINED_MESSAGES (20000), WINDOW (64),
# LOAD=0 / BACKLOG=0 to leave out a part, JOBS build jobs (2), VIREO_BENCH_BUILD build
# directory (build/bench), VIREO_BENCH_NO_BUILD=1 to skip the build, VIREO_BENCH_KEEP=1
# to keep the temporary directory (logs, stores, ClickHouse data).
set -eu

N=${N:-1000000}
SESSIONS=${SESSIONS:-10}
LARGE_BATCH=${LARGE_BATCH:-50000}
REPETITIONS=${REPETITIONS:-3}
MESSAGES=${MESSAGES:-4000}
PIPELINED_MESSAGES=${PIPELINED_MESSAGES:-20000}
WINDOW=${WINDOW:-64}

command -v clickhouse-server >/dev/null || [ -x /usr/sbin/clickhouse-server ] ||
  { echo "clickhouse-server is not installed (Debian package clickhouse-server)" >&2; exit 1; }
command -v clickhouse-client >/dev/null || { echo "clickhouse-client is not installed" >&2; exit 1; }
command -v sqlite3 >/dev/null || { echo "sqlite3 is not installed" >&2; exit 1; }

TARGETS="vireo-forwarder message_load" TMP_PREFIX=vireo-fwdbench
. "$(dirname "$0")/private_daemon.sh"
FORWARDER=$BUILD/src/forwarder/vireo-forwarder
SCHEMA=$ROOT/data/forwarder/clickhouse.sql

CH_PID=
FWD_PID=
stop_all() {
  [ -n "$FWD_PID" ] && kill "$FWD_PID" 2>/dev/null && wait "$FWD_PID" 2>/dev/null || true
  [ -n "$CH_PID" ] && kill -KILL "$CH_PID" 2>/dev/null && wait "$CH_PID" 2>/dev/null || true
  cleanup
}
trap stop_all EXIT

now() { date +%s.%N; }
# arithmetic on decimals: calc EXPRESSION
calc() { awk "BEGIN { print ($1) }"; }
# median of the numbers on stdin (mean of the middle two for an even count)
median() { sort -g | awk '{ v[NR] = $1 } END { if (NR == 0) print 0; else if (NR % 2) print v[(NR + 1) / 2]; else print (v[NR / 2] + v[NR / 2 + 1]) / 2 }'; }
free_port() {
  /usr/bin/python3 -c 'import socket; s = socket.socket(); s.bind(("127.0.0.1", 0)); print(s.getsockname()[1])'
}

# --- the private ClickHouse server
CH=$TMP/ch
mkdir -p "$CH"
HTTP_PORT=$(free_port)
TCP_PORT=$(free_port)
cat >"$CH/users.xml" <<EOF
<yandex><profiles><default/></profiles><quotas><default/></quotas><users><fleet>
<password>s3cret</password><networks><ip>127.0.0.1</ip></networks>
<profile>default</profile><quota>default</quota></fleet></users></yandex>
EOF
cat >"$CH/config.xml" <<EOF
<yandex><logger><level>warning</level><log>$CH/server.log</log><errorlog>$CH/error.log</errorlog></logger>
<http_port>$HTTP_PORT</http_port><tcp_port>$TCP_PORT</tcp_port><listen_host>127.0.0.1</listen_host>
<path>$CH/data/</path><tmp_path>$CH/tmp/</tmp_path><user_files_path>$CH/files/</user_files_path>
<format_schema_path>$CH/schemas/</format_schema_path><users_config>$CH/users.xml</users_config>
<default_profile>default</default_profile><mark_cache_size>5368709</mark_cache_size></yandex>
EOF
CH_SERVER=$(command -v clickhouse-server || echo /usr/sbin/clickhouse-server)
"$CH_SERVER" --config-file="$CH/config.xml" >"$CH/stdout.log" 2>&1 &
CH_PID=$!
chq() { clickhouse-client --host 127.0.0.1 --port "$TCP_PORT" --user fleet --password s3cret "$@"; }
for _ in $(seq 300); do [ "$(chq --query 'SELECT 1' 2>/dev/null)" = 1 ] && break; sleep 0.1; done
[ "$(chq --query 'SELECT 1' 2>/dev/null)" = 1 ] ||
  { echo "clickhouse-server did not start" >&2; tail -n 20 "$CH/stdout.log" "$CH/error.log" >&2 2>/dev/null; exit 1; }
printf 's3cret\n' >"$TMP/password"

# forwarder.conf for DIR: database DB, then further lines
write_conf() {
  dir=$1 db=$2
  shift 2
  mkdir -p "$dir"
  cp "$TMP/password" "$dir/password"
  { printf 'URL=http://127.0.0.1:%s/\nUser=fleet\nPasswordFile=password\nDatabase=%s\nKeepForwarded=0\n' "$HTTP_PORT" "$db"
    for line in "$@"; do printf '%s\n' "$line"; done; } >"$dir/forwarder.conf"
}
# Waits until the server runs no merge (a run's parts are merged before the next run).
settle() {
  for _ in $(seq 600); do [ "$(chq --query 'SELECT count() FROM system.merges')" = 0 ] && return; sleep 0.1; done
}
final_count() { chq --query "SELECT count() FROM $1.telemetry_messages FINAL" 2>/dev/null || echo error; }

status=0
echo "Vireo forwarder report"
echo "  ClickHouse $(chq --query 'SELECT version()') on 127.0.0.1:$HTTP_PORT, $(nproc) CPUs, load average $(cut -d' ' -f1-3 /proc/loadavg)"

if [ "${BACKLOG:-1}" != 0 ]; then
  # --- the backlog store: the daemon's tables, then N rows in one transaction
  STORE=$TMP/backlog
  mkdir -p "$STORE/state"
  DB=$STORE/state/vireo.db
  sqlite3 "$STATE_DIRECTORY/vireo.db" "SELECT sql || ';' FROM sqlite_master WHERE type = 'table' AND name IN
    ('telemetry_sessions', 'telemetry_messages', 'analytics_events', 'energy_events', 'forward_state',
     'store_changes', 'store_dropped')" >"$STORE/schema.sql"
  started=$(now)
  start_at=$(date +%s)
  sqlite3 "$DB" >/dev/null <<EOF
PRAGMA journal_mode = WAL;
.read $STORE/schema.sql
BEGIN;
WITH RECURSIVE s(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM s WHERE i < $SESSIONS)
INSERT INTO telemetry_sessions (id, session_info, user_info, backends, created_at, flushed_at)
SELECT i, '{"client_type":19,"client_version":2.0,"session_id":' || (75581358080 + i) ||
          ',"batch_event":true,"hierarchy_token":"' || lower(hex(randomblob(16))) || '"}',
       '{"client_name":"com.orvane.vireo","service_name":"bench"}', '["local"]', $start_at - 1, $start_at
FROM s;
WITH RECURSIVE m(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM m WHERE i < $N)
INSERT INTO telemetry_messages (id, session, session_info, user_info, category, type, payload, sent_at)
SELECT i, 1 + i % $SESSIONS, NULL, NULL, 1073741827, 1,
       '{"string_0":"value of entry ' || i || '","string_1":"value of entry 1","string_2":"value of entry 2",' ||
       '"string_3":"value of entry 3","string_4":"value of entry 4","string_5":"value of entry 5",' ||
       '"string_6":"value of entry 6","int_0":' || (1234567890123 + i) || ',"int_1":2469135780246,' ||
       '"int_2":3703703670369,"int_3":4938271560492,"int_4":6172839450615,"int_5":7407407340738,' ||
       '"int_6":' || (8641975230861 - i) || ',"double_0":' || (3.14159 * i) || ',"double_1":6.28318,' ||
       '"double_2":9.424769999999999,"double_3":12.56636,"double_4":15.70795,"double_5":18.849539999999998}',
       $start_at + i / 1000.0
FROM m;
COMMIT;
EOF
  fill=$(calc "$(now) - $started")
  # The floor's input: the rows as the forwarder sends them (device, id, columns, version 0).
  started=$(now)
  sqlite3 "$DB" "SELECT json_object('device', 'bench-device', 'id', id, 'session', session,
    'session_info', session_info, 'user_info', user_info, 'category', category, 'type', type,
    'payload', payload, 'sent_at', sent_at, 'version', 0) FROM telemetry_messages ORDER BY id" >"$STORE/rows.json"
  export_s=$(calc "$(now) - $started")
  bytes=$(stat -c %s "$STORE/rows.json")
  avg_payload=$(sqlite3 "$DB" "SELECT CAST(AVG(LENGTH(payload)) AS INTEGER) FROM telemetry_messages WHERE id <= 1000")

  RESULTS=$TMP/backlog.txt
  : >"$RESULTS"
  # One run: KIND (floor, or a batch size), repetition REP; appends "KIND seconds" to RESULTS.
  run_one() {
    kind=$1 rep=$2
    settle
    if [ "$kind" = floor ]; then
      db=floor_$rep
      sed "s/EXISTS vireo\./EXISTS $db./; s/EXISTS vireo;/EXISTS $db;/" "$SCHEMA" | chq --multiquery
      t0=$(now)
      chq --query "INSERT INTO $db.telemetry_messages FORMAT JSONEachRow" <"$STORE/rows.json"
      seconds=$(calc "$(now) - $t0")
    else
      db=fwd_${rep}_$kind
      write_conf "$STORE/conf" "$db" "BatchRows=$kind"
      sqlite3 "$DB" "DELETE FROM forward_state; DELETE FROM store_changes;"
      t0=$(now)
      run_status=0
      CONFIGURATION_DIRECTORY=$STORE/conf STATE_DIRECTORY=$STORE/state VIREO_FORWARDER_DEVICE=bench-device \
        "$FORWARDER" --once >>"$STORE/forwarder.log" 2>&1 || run_status=$?
      seconds=$(calc "$(now) - $t0")
      [ "$run_status" = 0 ] || { echo "  vireo-forwarder --once exited with $run_status (see $STORE/forwarder.log)"; status=1; }
    fi
    got=$(final_count "$db")
    [ "$got" = "$N" ] || { echo "  $db: count() FINAL = $got, expected $N"; status=1; }
    echo "$kind $seconds" >>"$RESULTS"
    chq --query "DROP DATABASE $db"
  }
  started=$(now)
  for rep in $(seq "$REPETITIONS"); do
    order="floor 5000 $LARGE_BATCH"
    [ $((rep % 2)) = 0 ] && order="$LARGE_BATCH 5000 floor"
    for kind in $order; do run_one "$kind" "$rep"; done
  done
  wall=$(calc "$(now) - $started")
  rate_of() { awk -v k="$1" -v n="$N" '$1 == k { print n / $2 }' "$RESULTS" | median; }
  per_rep() { awk -v k="$1" -v n="$N" '$1 == k { printf "  %.0f", n / $2 }' "$RESULTS"; }
  floor_rate=$(rate_of floor)

  echo
  echo "== backlog: vireo-forwarder --once over a full store"
  printf '  %s telemetry_messages rows (payload ~%s B) and %s sessions, filled in %.1f s; floor input\n' \
    "$N" "$avg_payload" "$SESSIONS" "$fill"
  printf '    %s MB of JSONEachRow, written in %.1f s. %s repetitions, %.0f s in all; medians.\n' \
    "$((bytes / 1000000))" "$export_s" "$REPETITIONS" "$wall"
  echo "  forwarder: the whole --once process (reading the store, JSON, HTTP INSERTs of BatchRows rows,"
  echo "    the cursor after each, creating the tables); floor: clickhouse-client INSERT ... FORMAT"
  echo "    JSONEachRow of the same rows from a file into an identical table, one process."
  echo "  Every run checked: count() FINAL = $N in a fresh database."
  echo
  printf '  %-28s  %10s  %6s  %s\n' "run" "rows/s" "ratio" "per repetition"
  printf '  %-28s  %10.0f  %6s %s\n' "floor (clickhouse-client)" "$floor_rate" "1.00" "$(per_rep floor)"
  for batch in 5000 "$LARGE_BATCH"; do
    rate=$(rate_of "$batch")
    printf '  %-28s  %10.0f  %6.2f %s\n' "forwarder, BatchRows=$batch" "$rate" \
      "$(calc "$rate / $floor_rate")" "$(per_rep "$batch")"
  done
  if grep -qv '^<[56]>' "$STORE/forwarder.log" 2>/dev/null; then
    echo "  the forwarder's warnings and errors:"
    grep -v '^<[56]>' "$STORE/forwarder.log" | tail -n 5 | sed 's/^/    /'
  fi
  [ -n "${VIREO_BENCH_KEEP:-}" ] || rm -f "$STORE/rows.json" "$DB" "$DB-wal" "$DB-shm"
fi

if [ "${LOAD:-1}" != 0 ]; then
  # --- the daemon's message rate with and without the forwarder beside it
  write_conf "$CONFIGURATION_DIRECTORY" live "Interval=1"
  LOADS=$TMP/load.txt
  : >"$LOADS"
  # Starts the forwarder on the daemon's store and waits until its first pass is done,
  # so that what it does during the load is sending the load's own rows.
  start_forwarder() {
    rm -f "$STATE_DIRECTORY/forwarder.json"
    VIREO_FORWARDER_DEVICE=bench-device "$FORWARDER" >>"$TMP/forwarder.log" 2>&1 &
    FWD_PID=$!
    for _ in $(seq 600); do [ -s "$STATE_DIRECTORY/forwarder.json" ] && return; sleep 0.1; done
    echo "  the forwarder wrote no status (see $TMP/forwarder.log)"
    status=1
  }
  stop_forwarder() {
    kill -TERM "$FWD_PID"
    fwd_status=0
    wait "$FWD_PID" || fwd_status=$?
    FWD_PID=
    [ "$fwd_status" = 0 ] || { echo "  the forwarder exited with $fwd_status at SIGTERM"; status=1; }
  }
  # One message_load run; appends "MODE shape msgs/s p99" lines to LOADS.
  load_one() {
    mode=$1
    [ "$mode" = with ] && start_forwarder
    out=$("$BUILD/bench/message_load" --clients 1 --messages "$MESSAGES" --pipelined-messages "$PIPELINED_MESSAGES" \
      --window "$WINDOW" --repetitions 1 --broadcast 0 --ping 0 --db "$STATE_DIRECTORY/vireo.db" \
      --pid "$DAEMON_PID") || { echo "  message_load failed ($mode the forwarder):"; echo "$out" | tail -n 5; status=1; }
    [ "$mode" = with ] && stop_forwarder
    echo "$out" | awk -v mode="$mode" '
      /^  1 client, sync / { sub(/^  1 client, sync +/, ""); print mode, "sync", $1, $6 }
      /^  1 client, [0-9]+ in flight / { sub(/^  1 client, [0-9]+ in flight +/, ""); print mode, "window", $1, $6 }' >>"$LOADS"
  }
  started=$(now)
  for rep in $(seq "$REPETITIONS"); do
    if [ $((rep % 2)) = 1 ]; then load_one without; load_one with; else load_one with; load_one without; fi
  done
  wall=$(calc "$(now) - $started")
  # Everything the load wrote reaches ClickHouse.
  CONFIGURATION_DIRECTORY=$CONFIGURATION_DIRECTORY STATE_DIRECTORY=$STATE_DIRECTORY VIREO_FORWARDER_DEVICE=bench-device \
    "$FORWARDER" --once >>"$TMP/forwarder.log" 2>&1 || { echo "  the last vireo-forwarder --once failed"; status=1; }
  # The daemon's disk quota (MaxStoreBytes=, 128M) deletes rows during the load, those
  # already sent first: ClickHouse must hold the store's rows and the deleted sent ones.
  local_rows=$(sqlite3 "$STATE_DIRECTORY/vireo.db" "SELECT COUNT(*) FROM telemetry_messages")
  dropped=$(sqlite3 -separator ' ' "$STATE_DIRECTORY/vireo.db" \
    "SELECT COALESCE(SUM(forwarded), 0), COALESCE(SUM(unforwarded), 0) FROM store_dropped WHERE tbl = 'telemetry_messages'")
  dropped_sent=${dropped% *} dropped_unsent=${dropped#* }
  remote_rows=$(final_count live)
  [ "$remote_rows" = "$((local_rows + dropped_sent))" ] || status=1

  pick() { awk -v m="$1" -v s="$2" -v c="$3" '$1 == m && $2 == s { print $c }' "$LOADS" | median; }
  echo
  echo "== the daemon's message rate, with vireo-forwarder running beside it (Interval=1)"
  echo "  message_load, 1 client: synchronous ($MESSAGES messages) and $WINDOW in flight ($PIPELINED_MESSAGES),"
  echo "    end to end (a message counts once its row is stored); without and with the forwarder"
  echo "    alternating, $REPETITIONS repetitions, $(printf '%.0f' "$wall") s in all; medians. The forwarder is started before"
  echo "    each run with the forwarder and has sent what was waiting, so it sends the load's rows."
  echo
  printf '  %-22s  %15s  %15s  %6s  %15s  %15s  %7s\n' "shape" "msgs/s without" "msgs/s with" "ratio" \
    "p99 us without" "p99 us with" "p99 x"
  for shape in sync window; do
    name="1 client, sync"
    [ "$shape" = window ] && name="1 client, $WINDOW in flight"
    r0=$(pick without "$shape" 3) r1=$(pick with "$shape" 3)
    p0=$(pick without "$shape" 4) p1=$(pick with "$shape" 4)
    printf '  %-22s  %15.0f  %15.0f  %6.2f  %15.0f  %15.0f  %7.2f\n' "$name" "$r0" "$r1" \
      "$(calc "$r0 > 0 ? $r1 / $r0 : 0")" "$p0" "$p1" "$(calc "$p0 > 0 ? $p1 / $p0 : 0")"
  done
  echo "  per repetition, msgs/s without / with:"
  for shape in sync window; do
    printf '    %-8s' "$shape"
    awk -v s="$shape" '$2 == s && $1 == "without" { w[++a] = $3 } $2 == s && $1 == "with" { f[++b] = $3 }
      END { for (i = 1; i <= a; i++) printf "  %.0f / %.0f", w[i], f[i]; printf "\n" }' "$LOADS"
  done
  echo "  rows: $remote_rows in ClickHouse (count() FINAL) after a last --once; $local_rows in the store"
  echo "    and $dropped_sent sent, then deleted by the daemon's disk quota (expected: the sum); $dropped_unsent"
  echo "    deleted by the quota before they were sent (while no forwarder ran)"
  if grep -qv '^<[56]>' "$TMP/forwarder.log" 2>/dev/null; then
    echo "  the forwarder's warnings and errors:"
    grep -v '^<[56]>' "$TMP/forwarder.log" | tail -n 5 | sed 's/^/    /'
  fi
fi
exit "$status"
