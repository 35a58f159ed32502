#!/bin/sh
# Builds the Debian package from a build tree and checks it: the files it must hold,
# that the units and bus files name programs it holds, its conffiles, its maintainer
# scripts, its dependencies, and lintian (no errors, clean manual pages).
# Usage: package_test.sh BUILD_DIR CPACK VERSION
set -eu
build=$1 cpack=$2 version=$3

for tool in dpkg-deb lintian; do
    command -v "$tool" >/dev/null || { echo "package_test: no $tool, skipped"; exit 77; }
done
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
fail() { echo "package_test: $*" >&2; status=1; }
status=0

# gzip: quicker than xz, and the archive's compression is not under test.
if ! "$cpack" -G DEB --config "$build/CPackConfig.cmake" -B "$work/out" \
        -D CPACK_DEBIAN_COMPRESSION_TYPE=gzip >"$work/cpack.log" 2>&1; then
    cat "$work/cpack.log" >&2
    exit 1
fi
deb=$(ls "$work"/out/vireo_*.deb)
echo "package_test: $deb"

dpkg-deb -c "$deb" | awk '{ print $6 }' | sed 's|^\./|/|' >"$work/contents"
for pattern in \
    '/usr/bin/vireo-reportingd' \
    '/usr/bin/vireoctl' \
    '/usr/bin/vireo-forwarder' \
    '/usr/lib/systemd/system/vireo-forwarder\.service' \
    '/usr/share/vireo/clickhouse\.sql' \
    '/usr/share/bash-completion/completions/vireoctl' \
    '/usr/lib[^ ]*/libvireo-client\.(so\.[0-9]+|a)' \
    '/usr/lib[^ ]*/pkgconfig/vireo-client\.pc' \
    '/usr/include/vireo/client\.h' \
    '/usr/lib/systemd/system/vireo-reportingd\.service' \
    '/usr/lib/sysusers\.d/vireo\.conf' \
    '/usr/lib/tmpfiles\.d/vireo\.conf' \
    '/usr/share/dbus-1/system\.d/com\.orvane\.vireo\.Reporting1\.conf' \
    '/usr/share/dbus-1/system-services/com\.orvane\.vireo\.Reporting1\.service' \
    '/usr/share/dbus-1/interfaces/com\.orvane\.vireo\.Reporting1\.xml' \
    '/usr/share/man/man8/vireo-reportingd\.8\.gz' \
    '/usr/share/man/man8/vireo-forwarder\.8\.gz' \
    '/usr/share/man/man1/vireoctl\.1\.gz' \
    '/usr/share/man/man5/vireo\.conf\.5\.gz' \
    '/usr/share/doc/vireo/copyright' \
    '/usr/share/doc/vireo/changelog\.Debian\.gz'; do
    grep -Eqx "$pattern" "$work/contents" || fail "missing $pattern"
done

# The unit and the activation file must start a program the package installs.
dpkg-deb -x "$deb" "$work/root"
for file in usr/lib/systemd/system/vireo-reportingd.service \
            usr/lib/systemd/system/vireo-forwarder.service \
            usr/share/dbus-1/system-services/com.orvane.vireo.Reporting1.service; do
    [ -f "$work/root/$file" ] || continue
    program=$(sed -n 's/^\(ExecStart\|Exec\)=\([^ ]*\).*/\2/p' "$work/root/$file")
    grep -qx "$program" "$work/contents" || fail "$file starts $program, which the package does not hold"
done

dpkg-deb -e "$deb" "$work/control"
# Exactly the files under /etc are conffiles.
grep '^/etc/.*[^/]$' "$work/contents" | sort >"$work/etc-files" || true
sort "$work/control/conffiles" 2>/dev/null >"$work/conffiles" || true
cmp -s "$work/etc-files" "$work/conffiles" || fail "conffiles differ from the files under /etc:
$(diff "$work/etc-files" "$work/conffiles")"
for script in postinst prerm postrm; do
    [ -x "$work/control/$script" ] || { fail "no executable $script"; continue; }
    sh -n "$work/control/$script" || fail "$script does not parse"
done
[ "$(dpkg-deb -f "$deb" Version)" = "$version-1" ] || fail "version $(dpkg-deb -f "$deb" Version), not $version-1"
depends=$(dpkg-deb -f "$deb" Depends)
for library in libsystemd0 libsqlite3-0 libstdc++6; do
    echo "$depends" | grep -q "$library" || fail "Depends lacks $library: $depends"
done

# Errors, and any complaint about the manual pages.
lintian --tag-display-limit 0 "$deb" >"$work/lintian" 2>&1 || true
cat "$work/lintian"
if grep -E '^E: |manpage|groff-message' "$work/lintian" >/dev/null; then
    fail "lintian errors or manual page problems"
fi
exit $status
