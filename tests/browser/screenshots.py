"""Screenshots of the web remote at phone and desktop widths (PNG, headless
Chromium) against a real daemon with the demo songs playing:

    scripts/netns-run /usr/bin/python3 tests/browser/screenshots.py BUILD_DIR OUT_DIR

Writes web-remote-phone.png (360 px, light), web-remote-phone-dark.png,
web-remote-desktop.png (1280 px, dark) and web-remote-library.png.
"""
import base64
import os
import sys
import time

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
import stack  # noqa: E402
from test_remote import browser, wait_for  # noqa: E402


def shot(b, path, width, height, mobile, dark):
    b.execute_cdp_cmd('Emulation.setDeviceMetricsOverride', {
        'width': width, 'height': height, 'deviceScaleFactor': 2 if mobile else 1, 'mobile': mobile})
    b.execute_cdp_cmd('Emulation.setEmulatedMedia', {
        'features': [{'name': 'prefers-color-scheme', 'value': 'dark' if dark else 'light'}]})
    time.sleep(0.6)
    data = b.execute_cdp_cmd('Page.captureScreenshot', {'format': 'png'})['data']
    with open(path, 'wb') as f:
        f.write(base64.b64decode(data))
    print('wrote', path)


def main():
    build, out = sys.argv[1], sys.argv[2]
    os.makedirs(out, exist_ok=True)
    s = stack.Stack(build, song_seconds=240)
    b = None
    try:
        # A cover image beside the songs, as an album folder would have.
        b = browser()
        b.get('data:text/html,<canvas id=c width=300 height=300></canvas>')
        png = b.execute_script("""
            const c = document.getElementById('c'), g = c.getContext('2d');
            const grad = g.createLinearGradient(0, 0, 300, 300);
            grad.addColorStop(0, '#1f4fa8'); grad.addColorStop(1, '#d0487c');
            g.fillStyle = grad; g.fillRect(0, 0, 300, 300);
            g.strokeStyle = 'rgba(255,255,255,.8)'; g.lineWidth = 6;
            for (let r = 30; r < 140; r += 22) { g.beginPath(); g.arc(150, 150, r, 0, 7); g.stroke(); }
            return c.toDataURL('image/png').split(',')[1];""")
        with open(os.path.join(s.music, 'cover.png'), 'wb') as f:
            f.write(base64.b64decode(png))
        status, r = s.api('/api/library/search?q=demo')
        s.api('/api/library/add', {'ids': [x['id'] for x in r['songs']], 'where': 'play'})
        wait_for('playing', lambda: s.daemon_status().get('CurrentUri'))
        time.sleep(3)
        b.get(s.url('/'))
        wait_for('the title', lambda: b.execute_script(
            "return document.getElementById('now-title').textContent.startsWith('Demo')"))
        wait_for('the cover', lambda: b.execute_script("return !document.getElementById('cover').hidden"))
        shot(b, os.path.join(out, 'web-remote-phone.png'), 360, 780, True, False)
        shot(b, os.path.join(out, 'web-remote-phone-dark.png'), 360, 780, True, True)
        shot(b, os.path.join(out, 'web-remote-desktop.png'), 1280, 800, False, True)
        b.find_element('css selector', '[data-tab=library]').click()
        b.find_element('css selector', '[data-action=lib-artist]').click()
        time.sleep(0.5)
        shot(b, os.path.join(out, 'web-remote-library.png'), 1280, 800, False, False)
    finally:
        if b:
            b.quit()
        s.stop()


if __name__ == '__main__':
    main()
