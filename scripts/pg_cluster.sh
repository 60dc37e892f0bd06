#!/usr/bin/env bash
# Throwaway PostgreSQL cluster for the tests and benchmarks.
#
#   pg_cluster.sh start DIR     initdb into DIR, start the server, load the schema
#   pg_cluster.sh restart DIR   restart a running cluster (fast shutdown)
#   pg_cluster.sh down DIR      stop the server, keep the cluster
#   pg_cluster.sh up DIR        start it again
#   pg_cluster.sh stall DIR     freeze the server's processes (SIGSTOP): it answers nothing
#   pg_cluster.sh resume DIR    let them go on (SIGCONT)
#   pg_cluster.sh stop DIR      stop the server and remove DIR
#
# The server listens only on a unix socket in DIR (no TCP), runs as an
# unprivileged user (it refuses to run as root), and trusts local connections
# of the database user "ptz". Clients use PGHOST=DIR PGUSER=ptz PGDATABASE=ptztest.
set -euo pipefail

cmd=${1:?usage: pg_cluster.sh start|restart|down|up|stall|resume|stop DIR}
dir=${2:?usage: pg_cluster.sh start|restart|down|up|stall|resume|stop DIR}
here=$(cd "$(dirname "$0")" && pwd)
schema="$here/../hostlib/db/schema.sql"

bindir=$(ls -d /usr/lib/postgresql/*/bin 2>/dev/null | sort -V | tail -n 1)
[ -x "$bindir/initdb" ] || { echo "pg_cluster: PostgreSQL server binaries not found" >&2; exit 1; }

as_owner() {
  if [ "$(id -u)" -eq 0 ]; then
    local owner
    owner=$(stat -c %U "$dir")
    runuser -u "$owner" -- "$@"
  else
    "$@"
  fi
}

server_start() {
  as_owner "$bindir/pg_ctl" -D "$dir/data" -l "$dir/server.log" -w -t 60 \
    -o "-c listen_addresses='' -c unix_socket_directories='$dir' -c fsync=off -c max_connections=300" start >/dev/null
}

case "$cmd" in
start)
  if [ -f "$dir/data/postmaster.pid" ]; then
    "$0" stop "$dir" || true
  fi
  rm -rf "$dir"
  mkdir -p "$dir"
  if [ "$(id -u)" -eq 0 ]; then
    user=postgres
    id -u "$user" >/dev/null 2>&1 || user=nobody
    chown "$user" "$dir"
  fi
  chmod 700 "$dir"
  as_owner "$bindir/initdb" -D "$dir/data" -U ptz -A trust -E UTF8 --locale=C.UTF-8 >"$dir/initdb.log" 2>&1 ||
    { cat "$dir/initdb.log" >&2; exit 1; }
  chmod 755 "$dir"
  server_start || { cat "$dir/server.log" >&2; exit 1; }
  as_owner "$bindir/createdb" -h "$dir" -U ptz ptztest
  psql -X -q -v ON_ERROR_STOP=1 -h "$dir" -U ptz -d ptztest -f "$schema" >/dev/null
  echo "pg_cluster: started in $dir"
  ;;
restart)
  as_owner "$bindir/pg_ctl" -D "$dir/data" -l "$dir/server.log" -w -t 60 -m fast restart >/dev/null
  ;;
down)
  as_owner "$bindir/pg_ctl" -D "$dir/data" -w -t 60 -m fast stop >/dev/null
  ;;
up)
  server_start
  ;;
stall|resume)
  signal=$([ "$cmd" = stall ] && echo STOP || echo CONT)
  pid=$(head -n 1 "$dir/data/postmaster.pid")
  kill -"$signal" "$pid"
  pkill -"$signal" -P "$pid" || true
  ;;
stop)
  if [ -d "$dir/data" ]; then
    as_owner "$bindir/pg_ctl" -D "$dir/data" -w -t 60 -m fast stop >/dev/null 2>&1 || true
  fi
  rm -rf "$dir"
  echo "pg_cluster: stopped $dir"
  ;;
*)
  echo "usage: pg_cluster.sh start|restart|down|up|stall|resume|stop DIR" >&2
  exit 2
  ;;
esac
