#!/usr/bin/env bash
# Fails when a source of the product includes a header of a higher layer, or
# of a peer on its own layer. The layers, bottom up:
#   0 util        bytes, hex, endian, whole-file reads, scope guards, secrets, status,
#                 owned handles
#   1 crypto      hashing, the owned libcrypto handles and the crypto services
#   2 verdict     the boot verdict's measurement and its event log's codec
#   3 eeprom      the EEPROM library    3 tpm     the platform key manager
#   4 bootlog     the boot status log and the security-feature test
#   5 integrity   the manifest          5 kmm     the key-management module
#   6 cli         the keymgr driver     6 tools   kmm-host, keymgr-eeprom, and bench
# Headers are included as "folder/header.h". The public C header <kmm/kmm.h>
# is the interface the whole module is built on; it includes nothing of the
# project and may be included from any layer.
set -euo pipefail
cd "$(dirname "$0")/.."

declare -A rank=([util]=0 [crypto]=1 [verdict]=2 [policy]=2 [eeprom]=3 [tpm]=4 [bootlog]=4 [integrity]=5
                 [kmm]=5 [cli]=6 [tools]=6 [bench]=6)
status=0
for dir in "${!rank[@]}"; do
  while IFS= read -r hit; do
    file=${hit%%:*}
    rest=${hit#*:}
    target=$(sed -E 's/^[0-9]+:#include "([a-z_]+)\/.*/\1/' <<<"$rest")
    [ "$target" = "$dir" ] && continue
    if [ -z "${rank[$target]+set}" ]; then
      echo "$file:${rest%%:*}: includes \"$target/...\", which is not a layer" >&2
      status=1
    elif (( rank[$target] >= rank[$dir] )); then
      echo "$file:${rest%%:*}: $dir (layer ${rank[$dir]}) includes $target (layer ${rank[$target]})" >&2
      status=1
    fi
  done < <(grep -Hn '^#include "[a-z_]*/' "$dir"/*.h "$dir"/*.cpp 2>/dev/null || true)
done
if grep -n '#include' include/kmm/*.h.in | grep -v '<stdint.h>'; then
  echo "include/kmm: the public header includes more than <stdint.h>" >&2
  status=1
fi
exit $status
