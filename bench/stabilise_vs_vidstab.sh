#!/usr/bin/env bash
# plano track + plano stabilise beside ffmpeg's two-pass vid.stab (vidstabdetect, then
# vidstabtransform) on one synthetic shaky shot: 1280x720, 120 PNG frames of a photographed
# plane under a smooth camera path plus known jitter. Prints, per case, the residual jitter of
# scene points against the smooth path (RMS px over all frames; exact from plano's JSON and as
# measured by ECC on the rendered frames), its high-frequency part, the area kept, and the
# wall time per frame of the whole commands (PNG decoding and encoding included), medians of
# RUNS runs taken in the same session, then our best over vid.stab's best.
#
#   bench/stabilise_vs_vidstab.sh [BUILD_DIR] [WORK_DIR]
#
# BUILD_DIR (default build) holds tools/plano and bench/stabilise_vs_vidstab; WORK_DIR
# (default /tmp/plano-stabilise-bench) the frames and results. RUNS (default 3) timing runs.
# Needs ffmpeg with vid.stab (Debian's ffmpeg) and OpenCV for the measurements.
set -euo pipefail

ROOT=$(cd "$(dirname "$0")/.." && pwd)
BUILD=$(cd "${1:-$ROOT/build}" && pwd)
WORK=${2:-/tmp/plano-stabilise-bench}
RUNS=${RUNS:-3}
PLANO=$BUILD/tools/plano
MEASURE=$BUILD/bench/stabilise_vs_vidstab
FRAMES=120
for f in "$PLANO" "$MEASURE"; do
  [ -x "$f" ] || { echo "missing $f: build the plano_tool and stabilise_vs_vidstab targets" >&2; exit 1; }
done
ffmpeg -hide_banner -filters 2>/dev/null | grep -q vidstabdetect ||
  { echo "ffmpeg with vid.stab is needed (bash scripts/install-packages.sh ffmpeg)" >&2; exit 1; }
mkdir -p "$WORK"
cd "$WORK"

# The regions tracked on the first frame: most of the plane, and the middle quarter of the
# frame (a quarter of the pixels to match, so a faster track).
QUADS=(64,36,1216,36,1216,684,64,684 320,180,960,180,960,540,320,540)

# Our cases: plano stabilise options after the track. The first is the default, the others
# suit a shot with one smooth move: anchors at its ends and a geometric path between them, or
# the chosen components smoothed.
OURS_NAMES=("default" "every 119" "every 60" "every 119 transl,rot" "smooth 200, every 119"
  "every 119, middle region")
OURS_ARGS=("" "--every 119" "--every 60" "--every 119 --components translation,rotation" "--smooth 200 --every 119"
  "--every 119")
OURS_TRACK=(0 0 0 0 0 1)  # which region's track
OURS_FAST=(5)  # timed beside the default and the best

# vid.stab's cases: pass 1 options | pass 2 options. vid.stab 1.1 asserts on packed RGB, so
# both passes take planar 4:4:4 (no chroma loss); the first is the default.
VS_NAMES=("default" "smoothing 5" "smoothing 30" "smoothing 60" "optzoom 2 (adaptive)"
  "shakiness 10, stepsize 1")
VS_ARGS=("|" "|smoothing=5" "|smoothing=30" "|smoothing=60" "|optzoom=2" "shakiness=10:stepsize=1|")

if [ ! -f frames.done ]; then
  echo "rendering the shot to $WORK" >&2
  rm -f track*.json
  "$MEASURE" render "$WORK" "$ROOT/tests/data/coffee.png"
  touch frames.done
fi

now() { date +%s.%N; }
median() { sort -g | awk '{v[NR]=$1} END {print (NR % 2) ? v[(NR+1)/2] : (v[NR/2]+v[NR/2+1])/2}'; }
field() { sed -n "s/.*\b$1=\([^ ]*\).*/\1/p" <<<"$2"; }

track() { "$PLANO" track -s shaky/%04d.png --quad "${QUADS[$1]}" -o "track$1.json" -q -j "$2"; }
stabilise() {  # case, threads, output pattern or ""
  # shellcheck disable=SC2086
  "$PLANO" stabilise -t "track${OURS_TRACK[$1]}.json" --crop crop -q -j "$2" ${OURS_ARGS[$1]} --json "ours$1.json" \
    ${3:+-o "$3"}
}
vidstab() {  # case, output folder, extra ffmpeg options (threads)
  local detect=${VS_ARGS[$1]%%|*} transform=${VS_ARGS[$1]#*|} threads=${3:-}
  # shellcheck disable=SC2086
  ffmpeg -hide_banner -loglevel error -y $threads -framerate 25 -i shaky/%04d.png \
    -vf "format=yuv444p,vidstabdetect=result=vs$1.trf${detect:+:$detect}" -f null -
  mkdir -p "$2"
  # shellcheck disable=SC2086
  ffmpeg -hide_banner -loglevel error -y $threads -framerate 25 -i shaky/%04d.png \
    -vf "format=yuv444p,vidstabtransform=input=vs$1.trf${transform:+:$transform}" -start_number 1 "$2/%04d.png"
}
ONE_THREAD="-threads 1 -filter_threads 1"

# Measurements.
declare -A R
for t in "${!QUADS[@]}"; do [ -f "track$t.json" ] || track "$t" 2; done
for i in "${!OURS_NAMES[@]}"; do
  stabilise "$i" 2 ""
  R["ours$i.exact"]=$("$MEASURE" exact "ours$i.json" "ours$i.exact.csv")
done
for i in "${!VS_NAMES[@]}"; do
  rm -rf "vs$i"; vidstab "$i" "vs$i"
  echo "measuring vid.stab ${VS_NAMES[$i]} by ECC" >&2
  R["vs$i.ecc"]=$("$MEASURE" ecc "$WORK" "vs$i/%04d.png" "vs$i.ecc.csv")
done

# The best of each side, by residual RMS, is timed beside the defaults (and our faster
# track), interleaved run by run so that the cases share the machine's state.
best() {  # prefix, result kind, indices
  local b="" v="" x
  for i in "${@:3}"; do
    x=$(field rms "${R[$1$i.$2]}")
    if [ -z "$b" ] || awk -v x="$x" -v v="$v" 'BEGIN {exit !(x < v)}'; then b=$i; v=$x; fi
  done
  echo "$b"
}
ob=$(best ours exact "${!OURS_NAMES[@]}")
vb=$(best vs ecc "${!VS_NAMES[@]}")
OURS_TIMED=($(printf '%s\n' 0 "$ob" "${OURS_FAST[@]}" | awk '!seen[$0]++'))
VS_TIMED=($(printf '%s\n' 0 "$vb" | awk '!seen[$0]++'))
for i in "${OURS_TIMED[@]}"; do
  [ -n "${R[ours$i.ecc]:-}" ] && continue
  stabilise "$i" 2 "ours$i/%04d.png"
  echo "measuring plano ${OURS_NAMES[$i]} by ECC" >&2
  R["ours$i.ecc"]=$("$MEASURE" ecc "$WORK" "ours$i/%04d.png" "ours$i.ecc.csv")
done
declare -A T
for ((run = 1; run <= RUNS; run++)); do
  echo "timing run $run of $RUNS" >&2
  for j in 1 2; do
    for t in "${!QUADS[@]}"; do
      t0=$(now); track "$t" $j; t1=$(now)
      for i in "${OURS_TIMED[@]}"; do
        [ "${OURS_TRACK[$i]}" = "$t" ] || continue
        rm -rf "ours$i"; s0=$(now); stabilise "$i" $j "ours$i/%04d.png"; s1=$(now)
        T["ours$i.$j"]+="$(awk -v a="$t0" -v b="$t1" -v c="$s0" -v d="$s1" 'BEGIN {print b - a + d - c}') "
      done
    done
  done
  for i in "${VS_TIMED[@]}"; do
    rm -rf "vs$i"; t0=$(now); OMP_NUM_THREADS=1 vidstab "$i" "vs$i" "$ONE_THREAD"; t1=$(now)
    T["vs$i.1"]+="$(awk -v a="$t0" -v b="$t1" 'BEGIN {print b - a}') "
    rm -rf "vs$i"; t0=$(now); vidstab "$i" "vs$i"; t1=$(now)
    T["vs$i.2"]+="$(awk -v a="$t0" -v b="$t1" 'BEGIN {print b - a}') "
  done
done
ms() {  # median ms per frame of a timing key, or -
  [ -n "${T[$1]:-}" ] || { echo "-"; return; }
  tr ' ' '\n' <<<"${T[$1]}" | grep . | median | awk -v n=$FRAMES '{printf "%.0f", 1000 * $1 / n}'
}

# The table. Residuals: RMS over all frames and scene points after the one best similarity
# from the smooth view onto the output; high frequency: after each point's +-7-frame average;
# middle: the RMS without the 15 frames at either end; worst frame: the largest frame RMS.
printf '\n%-34s %13s %15s %7s %7s %15s %6s %6s\n' "case" "RMS px" "high-freq px" "middle" "worst" "kept area" "ms/f" "ms/f"
printf '%-34s %13s %15s %7s %7s %15s %6s %6s\n' "" "exact / ECC" "exact / ECC" "RMS px" "frame" "box / ECC" "1 thr" "2 thr"
row() {  # name, exact result or "", ECC result or "", timing key
  local e=$2 c=$3 r=${2:-$3}
  pair() {  # key, decimals
    printf '%s / %s' "$([ -n "$e" ] && printf "%.$2f" "$(field "$1" "$e")" || echo -)" \
      "$([ -n "$c" ] && printf "%.$2f" "$(field "$1" "$c")" || echo -)"
  }
  printf '%-34s %13s %15s %7.3f %7.3f %15s %6s %6s\n' "$1" "$(pair rms 3)" "$(pair high 3)" "$(field middle "$r")" \
    "$(field worst_frame "$r")" "$(pair kept 4)" "$(ms "$4.1")" "$(ms "$4.2")"
}
for i in "${!OURS_NAMES[@]}"; do
  row "plano ${OURS_NAMES[$i]}" "${R[ours$i.exact]}" "${R[ours$i.ecc]:-}" "ours$i"
done
for i in "${!VS_NAMES[@]}"; do
  row "vid.stab ${VS_NAMES[$i]}" "" "${R[vs$i.ecc]}" "vs$i"
done
echo "plano: track + stabilise -o PNG --crop crop, -j1 / -j2; vid.stab: both passes, one thread / ffmpeg's default"
echo "kept area: plano's crop box (JSON); by ECC, on either side: the largest box that every output frame shows"
echo "  (pixel centres within the plate's outermost pixel centres), in plate pixels, over the frame's area"

# Our best against vid.stab's best.
o=${R[ours$ob.exact]} oe=${R[ours$ob.ecc]} v=${R[vs$vb.ecc]}
ratio() {  # a, b, decimals (2)
  awk -v a="$1" -v b="$2" -v d="${3:-2}" 'BEGIN {if (b == "-" || a == "-" || b == 0) print "-"; else printf "%.*f", d, a / b}'
}
echo
echo "plano ${OURS_NAMES[$ob]} over vid.stab ${VS_NAMES[$vb]}:"
echo "  residual RMS   $(ratio "$(field rms "$o")" "$(field rms "$v")") (target <= 0.5); middle of the shot $(ratio "$(field middle "$o")" "$(field middle "$v")")"
echo "  high-frequency $(ratio "$(field high "$o")" "$(field high "$v")")"
echo "  kept area      $(ratio "$(field kept "$o")" "$(field kept "$v")" 3) (our box), $(ratio "$(field kept "$oe")" "$(field kept "$v")" 3) (both by ECC) (target >= 1)"
echo "  time per frame $(ratio "$(ms "ours$ob.1")" "$(ms "vs$vb.1")") one thread, $(ratio "$(ms "ours$ob.2")" "$(ms "vs$vb.2")") two (target <= 1)"
echo "per-frame figures: $WORK/*.csv"
