#!/usr/bin/env bash
# Builds the fuzz targets in the sanitizer build (build/asan, which the tests
# share) and runs each for SECONDS (default 30) from the seed corpus made of
# the test captures. A crash leaves its input in build/asan/findings/<target>/
# and fails the script.
#   scripts/fuzz.sh [SECONDS]
set -euo pipefail
cd "$(dirname "$0")/.."

seconds=${1:-30}
dir=build/asan
targets=(dhcp_parse_fuzz frame_fuzz control_fuzz capture_fuzz restore_state_fuzz link_message_fuzz ctl_request_fuzz punt_checksum_fuzz)
targets+=(fhs_parse_fuzz)
# The kernel fast path's target loads a BPF program: root only.
if [ "$(id -u)" -eq 0 ]; then
  targets+=(fastpath_fuzz)
else
  echo "fuzz: fastpath_fuzz skipped: loading its BPF program needs root"
fi

bash scripts/build.sh asan "${targets[@]}" seed_corpus state_seeds swsec_module

# Seeds are regenerated each run; what a run discovers goes to a separate
# corpus directory that later local runs keep using.
rm -rf "$dir/seeds"
"$dir/fuzz/seed_corpus" "$dir/seeds" tests/data/*.pcap
# Capture files are their own seeds, with the hand-made hostile ones.
mkdir -p "$dir/seeds/capture_fuzz"
cp tests/data/*.pcap fuzz/capture_seeds/*.pcap* "$dir/seeds/capture_fuzz/"
# Inputs on which the fast path once disagreed with the module.
mkdir -p "$dir/seeds/fastpath_fuzz"
cp fuzz/fastpath_seeds/* "$dir/seeds/fastpath_fuzz/"
"$dir/fuzz/state_seeds" "$dir/seeds" tests/data/manifest.json examples/enforcing.json >/dev/null
# Control requests (an even first byte).
mkdir -p "$dir/seeds/ctl_request_fuzz"
n=0
for line in '{"command": "ports"}' '{"command": "bindings", "port": "vm1"}' '{"command": "log", "follow": true}' \
            '{"command": "clear", "port": "vm1", "key": ["0", "02:00:5e:c0:00:01", "192.0.2.1"]}' \
            '{"command": "config", "port": "vm2", "text": "{}", "origin": "f"}' '{"command": "counters"}'; do
  printf '\0%s' "$line" >"$dir/seeds/ctl_request_fuzz/request$((n += 1))"
done


export ASAN_OPTIONS=detect_leaks=1:abort_on_error=1
export UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
failed=()
for target in "${targets[@]}"; do
  echo "== fuzz $target (${seconds}s)"
  mkdir -p "$dir/corpus/$target" "$dir/findings/$target" "$dir/seeds/$target"
  # A capture file is larger than a frame. Its reader runs with a tighter
  # memory limit: an allocation sized by a length read from the file (4 GiB
  # for a block that claims it) fails the run.
  limits=(-rss_limit_mb=4096 -max_len=2048)
  if [ "$target" = capture_fuzz ]; then
    limits=(-rss_limit_mb=512 -malloc_limit_mb=256 -max_len=16384)
  fi
  # A request or a state held to its limits: nothing grows with the input.
  if [ "$target" = ctl_request_fuzz ]; then
    limits=(-rss_limit_mb=512 -malloc_limit_mb=128 -max_len=16384)
  fi
  if ! "$dir/fuzz/$target" -max_total_time="$seconds" -timeout=10 "${limits[@]}" \
       -print_final_stats=1 \
       -artifact_prefix="$dir/findings/$target/" \
       "$dir/corpus/$target" "$dir/seeds/$target" 2>"$dir/$target.log"; then
    tail -n 60 "$dir/$target.log"
    failed+=("$target")
  else
    grep -E '^(stat::number_of_executed_units|stat::new_units_added|Done )' "$dir/$target.log" || true
  fi
done

if [ ${#failed[@]} -ne 0 ]; then
  echo "fuzz: failures in ${failed[*]} (inputs in $dir/findings/)" >&2
  exit 1
fi
echo "fuzz: ${#targets[@]} targets ran ${seconds}s each without a finding"
