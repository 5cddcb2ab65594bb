#!/bin/sh
# Installs the Debian packages heft needs to build and test, when any is missing.
set -e
packages="cmake g++ clang clang-format clang-tidy make rapidjson-dev libgtest-dev libgmock-dev libbenchmark-dev libclang-rt-dev groff-base"
missing=""
for p in $packages; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing="$missing $p"
done
[ -z "$missing" ] && exit 0
echo "setup: installing$missing"
if [ "$(id -u)" -eq 0 ]; then sudo=""; else sudo="sudo"; fi
$sudo apt-get update -qq
DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq $missing
