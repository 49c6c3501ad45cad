#!/usr/bin/env bash
# Installs the release build into a directory of its own and compiles a host against what lies there:
# every public header, and the library.
set -euo pipefail
cd "$(dirname "$0")/.."

root=$(mktemp -d)
trap 'rm -rf "$root"' EXIT
cmake --install build/release --prefix "$root" > /dev/null

for file in bin/zrd bin/zrctl bin/zrctl.entitlements; do
    [ -e "$root/$file" ] || { echo "error: $file was not installed" >&2; exit 1; }
done
{
    (cd "$root/include/zorvan" && find Zorvan platform -name '*.h' | sort | sed 's/.*/#include "&"/')
    echo 'int main() { return zorvan::ZRErrorWithCode(0).code; }'
} > "$root/host.cpp"
library=$(dirname "$(find "$root" -name libzorvan.so)")
"${CXX:-c++}" -std=c++20 -Wall -Wextra -Werror -I "$root/include/zorvan" "$root/host.cpp" \
    -L "$library" -Wl,-rpath,"$library" -lzorvan -lfmt -o "$root/host"
"$root/host"
"$root/bin/zrctl" --version

# The examples, as somebody who has nothing but the installation would build them.
cp -R examples "$root/examples"
cmake -G Ninja -S "$root/examples" -B "$root/examples-build" -DCMAKE_PREFIX_PATH="$root" > /dev/null
cmake --build "$root/examples-build" > /dev/null
# It finds its library beside it, and is no plug-in of a host here.
status=0
"$root/examples-build/Applications/Scribe.app/PlugIns/TitleCase.appex/title-case" 2> /dev/null || status=$?
[ "$status" = 2 ]
