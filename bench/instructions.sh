#!/usr/bin/env bash
# Instructions a frame on the IPv4 common path, counted by callgrind: the
# module (linked into the program, and the image as deployed with --image)
# and its IPv6 agent on the IPv6 common path (UDP from bound sources),
# the minimal loops, the floor and BPF at 1, 2, 16 and 32 bindings, with the
# ratios the targets name. Counts do not depend on how busy the machine is,
# so they settle what noisy timings cannot. Builds the profile flavour
# (release for x86-64-v3: valgrind rejects AVX-512) unless SWSEC_BUILD_DIR
# names a tree already built. Needs valgrind; not part of CI.
#
#   bash bench/instructions.sh [--image]
set -euo pipefail
cd "$(dirname "$0")/.."

command -v valgrind >/dev/null || { echo "instructions: valgrind missing (apt-get install valgrind)" >&2; exit 2; }
if [[ -n "${SWSEC_BUILD_DIR:-}" ]]; then
   build=$SWSEC_BUILD_DIR
else
   build=build/profile
   bash scripts/build.sh profile swsec_bench swsec_module >/dev/null
fi
bench=$build/bench/swsec_bench
[[ -x "$bench" ]] || { echo "instructions: no $bench" >&2; exit 2; }
module_args=()
what="module linked into the program"
if [[ "${1:-}" == "--image" ]]; then
   module_args=(--module "$build/swsec.so")
   what="module image $build/swsec.so"
fi

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
valgrind --tool=callgrind --callgrind-out-file="$work/cg.%p" "$bench" --count-instructions "${module_args[@]}" \
   >"$work/out" 2>"$work/err" || { cat "$work/err" >&2; exit 2; }

# Each dump names its contender and frames; its total over them is the count a frame.
for f in "$work"/cg.*; do
   awk '/^desc: Trigger: Client Request: / { sub(/^desc: Trigger: Client Request: /, ""); name = $1; split($2, kv, "="); frames = kv[2] }
        /^summary: / { if (name != "") printf "%s %.1f\n", name, $2 / frames }' "$f"
done | sort >"$work/counts"
[[ -s "$work/counts" ]] || { echo "instructions: callgrind wrote no counts" >&2; exit 2; }

awk -v what="$what" '
   { split($1, p, "/"); ir[p[1] "/" p[3]] = $2; if (!(p[3] in seen)) { seen[p[3]] = 1; order[++n] = p[3] } }
   END {
      printf "instructions a frame, IPv4 common path (ipv6: the IPv6 agent on the IPv6 one), %s (callgrind)\n", what
      printf "%-9s %8s %8s %8s %12s %8s %8s %15s %11s %10s\n", "bindings", "module", "ipv6", "minimal", "minimal-hdr", "floor", "bpf", "module/minimal", "bpf/module", "ipv6/ipv4"
      # Binding counts in numeric order.
      for (i = 1; i <= n; i++) for (j = i + 1; j <= n; j++) if (order[j] + 0 < order[i] + 0) { t = order[i]; order[i] = order[j]; order[j] = t }
      worst = 0; worst6 = 0
      for (i = 1; i <= n; i++) {
         b = order[i]; m = ir["module/" b]; mi = ir["minimal/" b]; v6 = ir["ipv6/" b]
         r = mi > 0 ? m / mi : 0; if (r > worst) worst = r
         r6 = m > 0 ? v6 / m : 0; if (r6 > worst6) worst6 = r6
         printf "%-9s %8.0f %8.0f %8.0f %12.0f %8.0f %8.0f %15.2f %11.2f %10.2f\n", b, m, v6, mi, ir["minimal-hdr/" b], ir["floor/" b], ir["bpf/" b], r, (m > 0 ? ir["bpf/" b] / m : 0), r6
      }
      printf "module / minimal loop, instructions (worst): %.2f (target <= 3.0: %s)\n", worst, (worst > 0 && worst <= 3) ? "met" : "MISSED"
      printf "IPv6 common path / IPv4 common path, instructions (worst): %.2f (target <= 1.5: %s)\n", worst6, (worst6 > 0 && worst6 <= 1.5) ? "met" : "MISSED"
   }' "$work/counts"
