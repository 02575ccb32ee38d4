# shellcheck shell=bash
# Installs Debian packages that are missing. Sourced: . scripts/prerequisites.sh; need PACKAGE...
#
# Nothing is asked of the network, and no rights are needed, when everything is there.

need() {
  local missing=() package
  for package in "$@"; do
    dpkg-query -W -f '${db:Status-Status}' "$package" 2>/dev/null | grep -qx installed ||
      missing+=("$package")
  done
  [ ${#missing[@]} -eq 0 ] && return 0
  local root=()
  if [ "$(id -u)" -ne 0 ]; then
    if ! command -v sudo >/dev/null; then
      echo "Missing packages: ${missing[*]}. Install them as root: apt-get install ${missing[*]}" >&2
      return 1
    fi
    root=(sudo)
  fi
  echo "Installing ${missing[*]} ..." >&2
  "${root[@]}" apt-get -qq update &&
    "${root[@]}" env DEBIAN_FRONTEND=noninteractive \
      apt-get -qq install -y --no-install-recommends "${missing[@]}" >/dev/null
}
