#!/usr/bin/env bash
# usage: check_exports.sh BUILD_DIR
# Installs the library into a temporary prefix and checks that the installed
# libzeparelayd.so exports its public interface only: names of namespace
# ZEPA::Relay that the installed headers declare (with their vtables and type
# information), FileLock, and the three C entry points.
set -euo pipefail
build=$1
work=$(mktemp -d /tmp/zepa-exports.XXXXXX)
trap 'rm -rf "$work"' EXIT

cmake --install "$build" --prefix "$work/prefix" >/dev/null
lib=$(find "$work/prefix" -name 'libzeparelayd.so' | head -n 1)
[ -n "$lib" ] || { echo "check_exports: libzeparelayd.so was not installed" >&2; exit 1; }
headers=("$work/prefix"/include/zeparelayd/*.h)

nm -DC --defined-only "$lib" | cut -d' ' -f3- > "$work/symbols"
[ -s "$work/symbols" ] || { echo "check_exports: no exported symbols at all" >&2; exit 1; }

bad=0
while IFS= read -r sym; do
  name=${sym#vtable for }
  name=${name#typeinfo name for }
  name=${name#typeinfo for }
  case "$name" in
    VLIBRelaydLogStart | VLIBRelaydLogStop | VLIBRelaydGetServerId) continue ;;
    FileLock | FileLock::*) word=FileLock ;;
    ZEPA::Relay::operator*)
      word=${name#ZEPA::Relay::}
      word=${word%%(*}
      ;;
    ZEPA::Relay::*)
      word=${name#ZEPA::Relay::}
      word=${word%%[:(<[]*}
      ;;
    *)
      echo "exported but not public: $sym" >&2
      bad=1
      continue
      ;;
  esac
  if ! grep -qwF -- "$word" "${headers[@]}"; then
    echo "exported but declared in no installed header: $sym" >&2
    bad=1
  fi
done < "$work/symbols"

for entry in VLIBRelaydLogStart VLIBRelaydLogStop VLIBRelaydGetServerId 'FileLock::Lock(int)' \
  'ZEPA::Relay::RelaydConf::RelaydConf(char const*)'; do
  grep -qxF "$entry" "$work/symbols" || { echo "public symbol missing: $entry" >&2; bad=1; }
done

if [ "$bad" -ne 0 ]; then
  echo "check_exports: the installed library exports more (or less) than its public interface;" >&2
  echo "check_exports: mark only public declarations ZEPARELAYD_API and see src/zeparelayd.map" >&2
  exit 1
fi
echo "check_exports: $(wc -l < "$work/symbols") exported symbols, all public"
