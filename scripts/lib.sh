# Sourced by the other scripts: the project's root, the number of jobs, timed steps.

root=$(CDPATH='' cd -- "$(dirname -- "$0")/.." && pwd)
jobs=${VLN_JOBS:-$(nproc 2>/dev/null || echo 2)}

# step NAME COMMAND...: runs the command and prints how long it took; its exit status is kept.
step() {
  step_name=$1
  shift
  echo "==> $step_name"
  step_start=$(date +%s)
  step_status=0
  "$@" || step_status=$?
  step_took=$(($(date +%s) - step_start))
  if [ "$step_status" -eq 0 ]; then
    echo "==> $step_name: done in $step_took s"
  else
    echo "==> $step_name: FAILED with status $step_status after $step_took s" >&2
  fi
  return "$step_status"
}
