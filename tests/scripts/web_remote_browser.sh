#!/bin/sh
# The web remote in headless Chromium against a real daemon (run by ctest
# inside a private network namespace): BUILD_DIR SOURCE_DIR.
build=$1
src=$2
for need in /usr/bin/chromium /usr/bin/chromedriver; do
    if [ ! -x "$need" ]; then
        echo "web_remote_browser: $need is missing; run scripts/setup.sh (as root)" >&2
        exit 1
    fi
done
if ! /usr/bin/python3 -c 'import selenium' 2>/dev/null; then
    echo "web_remote_browser: python3-selenium is missing; run scripts/setup.sh (as root)" >&2
    exit 1
fi
exec /usr/bin/python3 "$src/tests/browser/test_remote.py" "$build"
