# Stages, one after the other, also after a failure, and a table of them at the end: for .ci/run and scripts/nightly.
# shellcheck shell=bash

stage_rows=() stages_failed=0

# The processor time, in seconds, of what has been waited for so far.
cpu_seconds() {
  local fields
  read -r -a fields </proc/$$/stat
  echo $(((fields[15] + fields[16]) / $(getconf CLK_TCK)))
}

# stage NAME COMMAND...
stage() {
  local name=$1 started=$SECONDS cpu result=passed
  cpu=$(cpu_seconds)
  shift
  echo
  echo "=== $name"
  "$@" </dev/null || {
    result=FAILED
    stages_failed=$((stages_failed + 1))
  }
  stage_rows+=("$(printf '%-45s %-6s %6d s %6d s' "$name" "$result" $((SECONDS - started)) $(($(cpu_seconds) - cpu)))")
  echo "=== $name: $result after $((SECONDS - started)) s"
}

# Ends the script with the table and a verdict on all stages: end_of_stages WHAT
end_of_stages() {
  echo
  echo "=== Summary"
  printf '%-45s %-6s %8s %8s\n' stage result time processor
  printf '%s\n' "${stage_rows[@]}"
  printf '%-45s %-6s %6d s %6d s\n' all "" "$SECONDS" "$(cpu_seconds)"
  echo
  if ((stages_failed > 0)); then
    echo "$1 FAILED: $stages_failed of ${#stage_rows[@]} stages"
    exit 1
  fi
  echo "ALL $1 PASSED: ${#stage_rows[@]} stages"
  exit 0
}
