#!/usr/bin/env bash
# Builds a discovery source that includes lower layers (must compile) and a core source that
# includes discovery (must fail, for the missing header and nothing else).
set -u
build_dir=$1
cmake --build "$build_dir" --target layering_probe_downward >/dev/null 2>&1 || {
    echo "a source including only the layers below it did not compile"
    cmake --build "$build_dir" --target layering_probe_downward 2>&1 | tail -20
    exit 1
}
output=$(cmake --build "$build_dir" --target layering_probe_upward 2>&1)
if [ $? -eq 0 ]; then
    echo "core compiled a source that includes discovery/: the layers are not enforced"
    exit 1
fi
if ! grep -q 'discovery/SsdpDeviceManager.h: No such file' <<<"$output"; then
    echo "the upward include failed for another reason:"
    echo "$output" | tail -20
    exit 1
fi
echo "an upward include fails the build; includes of lower layers compile"
