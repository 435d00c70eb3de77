# Shared by the scripts that run the sample server (source it):
#   klp_need BIN PROGRAM...     exits 2 unless every program is built in BIN
#   klp_private_ipc NAME        makes DIR, a fresh directory, the IPC directory
#   klp_start_server BIN NAME   starts klpkcap NAME in DIR and waits until its
#                               queue exists; SERVER_PID is its process id
#   klp_end_process PID         ends a process we started: politely, then for sure

klp_need() {
  local bin=$1 p
  shift
  for p in "$@"; do
    if [[ ! -x "$bin/$p" ]]; then
      echo "${0##*/}: $bin/$p not found; build first (make build)" >&2
      exit 2
    fi
  done
}

klp_private_ipc() {
  DIR=$(mktemp -d "${TMPDIR:-/tmp}/$1.XXXXXX")
  export TMPDIR="$DIR/"
}

klp_start_server() {
  local bin=$1 server=$2 i
  "$bin/klpkcap" "CAPTURE_SERVER=$server" "CAPTURE_PATH=$DIR/" >"$DIR/klpkcap.out" 2>&1 &
  SERVER_PID=$!
  # The server is ready once its log says that it created its queue.
  for i in $(seq 1 100); do
    grep -q KLP0594I "$DIR/$server.KLP.KCAP.log" 2>/dev/null && return 0
    if ! kill -0 "$SERVER_PID" 2>/dev/null; then
      echo "${0##*/}: klpkcap did not start:" >&2
      cat "$DIR/klpkcap.out" >&2
      exit 1
    fi
    sleep 0.1
  done
}

klp_end_process() {
  local pid=$1 i
  [[ -n "$pid" ]] || return 0
  kill -0 "$pid" 2>/dev/null || return 0
  kill -TERM "$pid" 2>/dev/null || true
  for i in $(seq 1 150); do
    kill -0 "$pid" 2>/dev/null || break
    sleep 0.1
  done
  if kill -0 "$pid" 2>/dev/null; then kill -KILL "$pid" 2>/dev/null || true; fi
  wait "$pid" 2>/dev/null || true
}
