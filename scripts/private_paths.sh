# Helpers for running the daemons at their fixed paths (/var/spool,
# /var/run, /tmp) without touching this machine's own files there: a
# private mount namespace in which those folders are fresh. Sourced by the
# preview demo and the preview road test.

# find_private_namespace: sets NAMESPACE to the unshare command line that
# makes a private mount namespace (as root, or in a user namespace where
# allowed). Fails when none can be made. A namespace counts only if a tmpfs
# can be mounted in it.
find_private_namespace() {
  local probe='mount -t tmpfs probe /var/spool'
  if [ "$(id -u)" -eq 0 ] && unshare --mount --propagation private \
      sh -c "$probe" 2>/dev/null; then
    NAMESPACE=(unshare --mount --propagation private)
  elif unshare -Urm sh -c "$probe" 2>/dev/null; then
    NAMESPACE=(unshare -Urm)
  else
    return 1
  fi
}

# mount_private_paths LABEL PATH...: inside the namespace, fresh tmpfs over
# /var/spool, /run (/var/run) and /tmp. Each PATH (the work directory, the
# programs to run) stays reachable under its own name: a PATH under /tmp
# keeps its top folder, bound from the machine's /tmp into the fresh one.
mount_private_paths() {
  local label=$1 old path top
  shift
  mount -t tmpfs -o mode=0755 "$label-spool" /var/spool
  mount -t tmpfs -o mode=0755 "$label-run" "$(readlink -f /var/run)"
  old=$(mktemp -d /run/machine-tmp.XXXXXX)
  mount --bind /tmp "$old"
  mount -t tmpfs -o mode=1777 "$label-tmp" /tmp
  for path in "$@"; do
    case $path in
      /tmp/?*)
        top=${path#/tmp/}
        top=${top%%/*}
        if [ ! -e "/tmp/$top" ]; then
          mkdir "/tmp/$top"
          mount --bind "$old/$top" "/tmp/$top"
        fi
        ;;
    esac
  done
  umount -l "$old"
  rmdir "$old"
}

# wait_for SECONDS COMMAND...: polls COMMAND every 50 ms until it succeeds;
# fails when SECONDS have passed.
wait_for() {
  local limit=$(($1 * 20)) i
  shift
  for ((i = 0; i < limit; i++)); do
    "$@" && return 0
    sleep 0.05
  done
  return 1
}
