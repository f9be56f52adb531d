#!/bin/bash
# Unpacks the built Debian packages into a scratch root and uses them as a node
# administrator and a plug-in author would: which package holds what, the
# dependencies that let the platform's own libraries replace the stand-ins, a
# C consumer built with pkg-config together with a plug-in compiled outside
# the tree, a C++ consumer built with find_package, and the installed oxidm.
# The consumers run in a private mount namespace whose /var and /opt are the
# packaged example configuration (the host's directories are not touched).
# Usage: test_install.sh DEB_DIR SOURCE_DIR
set -euo pipefail
debs=$(cd "$1" && pwd) src=$(cd "$2" && pwd)
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
root=$work/root ma=$(dpkg-architecture -qDEB_HOST_MULTIARCH)
fail() { echo "FAIL: $*" >&2; exit 1; }
deb() { ls "$debs/$1"_*.deb; }

packages=(libox-idm1 libox-idm-dev libox-platform-standins libox-platform-standins-dev oxidm krb5-localauth-oxidm)
for p in "${packages[@]}"; do dpkg-deb -x "$(deb "$p")" "$root"; done

# Which package holds what (every package also its copyright file).
contents() {
  for p in "${packages[@]}"; do echo "$p usr/share/doc/$p/copyright"; done
  cat <<'EOF'
libox-idm1 usr/lib/MA/libox_idm.so.1
libox-idm1 usr/lib/MA/libox_idm.so.1.0.0
libox-idm-dev usr/lib/MA/libox_idm.so
libox-idm-dev usr/include/oxidm.h
libox-idm-dev usr/include/oxmpm_host.h
libox-idm-dev usr/include/oxmpm_principal.h
libox-idm-dev usr/lib/MA/pkgconfig/oxidm.pc
libox-idm-dev usr/lib/MA/cmake/oxidm/oxidmConfig.cmake
libox-platform-standins usr/lib/MA/libox_cu.so.1
libox-platform-standins usr/lib/MA/libox_tr.so.1
libox-platform-standins usr/lib/MA/libox_mss.so.1
libox-platform-standins-dev usr/lib/MA/libox_cu.so
libox-platform-standins-dev usr/include/ox_cu.h
oxidm usr/bin/oxidm
oxidm usr/share/man/man1/oxidm.1.gz
oxidm usr/lib/MA/oxidm/mpm/liboxmpm_host.so
oxidm usr/lib/MA/oxidm/mpm/liboxmpm_principal.so
oxidm usr/share/doc/oxidm/examples/var/ox/cfg/oxsec_map.local
krb5-localauth-oxidm usr/lib/MA/krb5/plugins/localauth/oxidm.so
EOF
}
while read -r pkg path; do
  listing=$(dpkg-deb -c "$(deb "$pkg")" | awk '{print $6}')
  grep -qFx "./${path//MA/$ma}" <<<"$listing" || fail "$pkg lacks $path"
done < <(contents)

# Relations: +NAME must be in the field, -NAME must not.  The library and the
# Kerberos module accept any provider of the platform libraries; only oxidm
# (which reads the stand-ins' inspection interface) needs the stand-ins.
while read -r pkg field want; do
  value=", $(dpkg-deb -f "$(deb "$pkg")" "$field"),"
  for w in $want; do
    case $w in
      +*) [[ $value =~ ,\ ${w#+}[\ ,] ]] || fail "$pkg $field lacks ${w#+}: $value" ;;
      -*) [[ ! $value =~ ,\ ${w#-}[\ ,] ]] || fail "$pkg $field has ${w#-}: $value" ;;
    esac
  done
done <<'EOF'
libox-idm1 Depends +libox-cu1 +libox-tr1 +libox-mss1 -libox-platform-standins
krb5-localauth-oxidm Depends +libox-idm1 -libox-platform-standins
libox-idm-dev Depends +libox-idm1 -libox-platform-standins -libox-platform-standins-dev
libox-platform-standins Provides +libox-cu1 +libox-tr1 +libox-mss1
libox-platform-standins Conflicts +libox-cu1 +libox-tr1 +libox-mss1
libox-platform-standins Replaces +libox-cu1 +libox-tr1 +libox-mss1
libox-platform-standins-dev Provides +libox-cu-dev +libox-tr-dev +libox-mss-dev
oxidm Depends +libox-idm1 +libox-platform-standins
EOF
echo "packages: contents and relations ok"

# The scratch root's libraries, for the linker's dependency checks and at run time.
export LD_LIBRARY_PATH=$root/usr/lib/$ma:$work PKG_CONFIG_LIBDIR=$root/usr/lib/$ma/pkgconfig
in_examples() {  # program...: run with /var and /opt of the packaged examples
  local unsh=(unshare -m)
  [[ $(id -u) == 0 ]] || unsh=(unshare -rm)
  "${unsh[@]}" sh -c 'mount --bind "$0/var" /var && mount --bind "$0/opt" /opt && exec "$@"' \
    "$root/usr/share/doc/oxidm/examples" "$@"
}

flags=$(pkg-config --cflags --libs oxidm)
[[ $flags != *rpath* ]] || fail "pkg-config hands out an rpath: $flags"
[[ $(realpath -m "$(pkg-config --variable=mpmdir oxidm)") == "$root/usr/lib/$ma/oxidm/mpm" ]] || fail "mpmdir"
cp "$src/mpm/oxmpm_host.c" "$work/"
# shellcheck disable=SC2086
cc -shared -fPIC -Wl,--no-undefined -o "$work/liboxmpm_host.so" "$work/oxmpm_host.c" $flags
# shellcheck disable=SC2086
cc -o "$work/consumer-c" "$src/tests/tool/consumer/consumer.c" $flags -L"$work" -loxmpm_host
in_examples "$work/consumer-c"

cmake -S "$src/tests/tool/consumer" -B "$work/consumer-cxx" -G Ninja -DCMAKE_PREFIX_PATH="$root/usr" >/dev/null
cmake --build "$work/consumer-cxx" >/dev/null
in_examples "$work/consumer-cxx/consumer"

# The installed command finds its libraries and plug-ins by itself.
env -u LD_LIBRARY_PATH "$root/usr/bin/oxidm" --version | grep -q "1\.0\.0" || fail "installed oxidm --version"
env -u LD_LIBRARY_PATH "$root/usr/bin/oxidm" mechanisms | grep -q princ || fail "installed oxidm: no princ"
echo "installed oxidm: ok"
