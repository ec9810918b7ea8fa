# Sourced by the other scripts. install_missing PACKAGE...: installs with apt-get those of the
# given Debian packages that are not installed yet (needs root when any are missing).
install_missing() {
  local missing=() p
  for p in "$@"; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
  done
  if [ ${#missing[@]} -gt 0 ]; then
    echo "installing: ${missing[*]}"
    export DEBIAN_FRONTEND=noninteractive
    # Scripts that run at once take turns: two apt-get runs would collide on dpkg's lock.
    (
      flock 9
      apt-get update -qq
      apt-get install -y -qq "${missing[@]}" >/dev/null
    ) 9>/tmp/rb-install-missing.lock
  fi
}
