#!/bin/sh
# The tools the tests run come from the project's packages, installed by
# dpkg: both packages are installed at the sources' version, they own the
# tools, the installed tool answers as the build's does, and dpkg --verify
# finds every installed file as packaged (and notices one that is not).
#   installed_packages_test.sh SOURCE_DIR INSTALLED_TOOLS_DIR BUILD_TOOL
set -eu
source_dir=$1
installed=$2
build_tool=$3
scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT

fail() {
    echo "FAIL: $*" >&2
    exit 1
}

version=$(sed -n '1s/.*(\(.*\)).*/\1/p' "$source_dir/debian/changelog")
architecture=$(dpkg --print-architecture)
for package in migrate-settings libmigrate-settings-dev; do
    state=$(dpkg-query -W -f '${Status} ${Version} ${Architecture}' "$package") || fail "dpkg does not know $package"
    [ "$state" = "install ok installed $version $architecture" ] ||
        fail "$package: '$state', not 'install ok installed $version $architecture'"
done
for tool in migrate_settings inspect_store; do
    owner=$(dpkg-query -S "$installed/$tool") || fail "no package owns $installed/$tool"
    [ "$owner" = "migrate-settings: $installed/$tool" ] || fail "$installed/$tool belongs to '$owner'"
done

"$installed/migrate_settings" --help >"$scratch/installed" 2>&1 || true
"$build_tool" --help >"$scratch/built" 2>&1 || true
grep -q '^Usage: ' "$scratch/built" || fail "the build's tool printed no usage: $(cat "$scratch/built")"
# The usage line names the program as it was started.
sed "s|$installed/migrate_settings|migrate_settings|" "$scratch/installed" >"$scratch/installed.help"
sed "s|$build_tool|migrate_settings|" "$scratch/built" >"$scratch/built.help"
cmp "$scratch/built.help" "$scratch/installed.help" || fail "the installed tool's --help differs from the build's"

verify=$(dpkg --verify 2>&1) || fail "dpkg --verify failed: $verify"
[ -z "$verify" ] || fail "dpkg --verify: $verify"

# A changed file is noticed: one of the -dev package's headers, which
# nothing on the device reads, changed and put back.
header=$(dpkg-query -L libmigrate-settings-dev | grep '\.h$' | head -n 1)
cp -p "$header" "$scratch/header"
echo >>"$header"
changed=$(dpkg --verify libmigrate-settings-dev 2>&1 || true)
cp -p "$scratch/header" "$header"
[ "$changed" = "??5??????   $header" ] || fail "dpkg --verify did not notice the changed $header: '$changed'"
[ -z "$(dpkg --verify libmigrate-settings-dev 2>&1)" ] || fail "$header was not put back"
echo "installed: migrate-settings and libmigrate-settings-dev $version ($architecture), verified"
