"""Speed of the web remote, measured in headless Chromium on loopback
against a real daemon and tarnweb in a temporary root:

  first render     first contentful paint, and the moment the playing song's
                   title is on the page (cold cache), median of runs
  page weight      bytes of every file the page loads, before and after
                   compression (cover art aside)
  status latency   a change made on the daemon's control socket by another
                   client, until the page shows it; and a click in the page
                   until the page shows the new song
  idle CPU         tarnweb's CPU time over 30 s with one page open and
                   nothing playing

    scripts/netns-run /usr/bin/python3 bench/web_remote.py [BUILD_DIR] [--quick]
"""
import os
import statistics
import sys
import time

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, '..', 'tests', 'browser'))
import stack  # noqa: E402
from test_remote import browser, media_info, wait_for  # noqa: E402

ACT_NEXT = 6
ACT_STOP = 5


def cpu_seconds(pid):
    with open('/proc/%d/stat' % pid) as f:
        fields = f.read().rsplit(')', 1)[1].split()
    return (int(fields[11]) + int(fields[12])) / os.sysconf('SC_CLK_TCK')


def pct(values, p):
    values = sorted(values)
    return values[min(len(values) - 1, int(round(p / 100.0 * (len(values) - 1))))]


def main():
    quick = '--quick' in sys.argv
    args = [a for a in sys.argv[1:] if a != '--quick']
    build = args[0] if args else os.path.join(stack.SRC, 'build')
    s = stack.Stack(build, song_seconds=600)
    b = None
    try:
        import socket
        import struct
        titles = []
        for i in range(40):
            f, t = [('tone-440.mp3', 'A440'), ('tone-660.flac', 'E660'), ('tone-880.ogg', 'A880')][i % 3]
            title = 'Song %02d %s' % (i, t)
            titles.append(title)
            req = struct.pack('=i', stack.ACT_QUEUE_ADD) + media_info(os.path.join(s.music, f), title).ljust(8192, b'\0')
            with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as c:
                c.connect(os.path.join(s.root, 'tmp/tarnaudiod.sock'))
                c.sendall(req)
                c.recv(8192)
        s.daemon(25, '3')  # repeat the whole queue: every next has a song to go to
        s.daemon(stack.ACT_PLAY_INDEX, '0')
        wait_for('playing', lambda: s.daemon_status().get('CurrentUri'))

        b = browser()
        b.execute_cdp_cmd('Network.enable', {})
        # -- first render, cold cache -------------------------------------------
        fcp = []
        runs = 3 if quick else 10
        for _ in range(runs):
            b.execute_cdp_cmd('Network.clearBrowserCache', {})
            b.get('about:blank')
            b.get(s.url('/'))
            wait_for('the title', lambda: b.execute_script(
                "return document.getElementById('now-title').textContent.startsWith('Song')"), timeout=10, interval=0.02)
            fcp.append(b.execute_script("""
                const p = performance.getEntriesByName('first-contentful-paint')[0];
                return p ? p.startTime : -1;"""))
        # When the title is on the page: an observer set before the page loads.
        shown = []
        for _ in range(runs):
            b.execute_cdp_cmd('Network.clearBrowserCache', {})
            b.get('about:blank')
            b.execute_cdp_cmd('Page.addScriptToEvaluateOnNewDocument', {'source': """
                new MutationObserver((m, o) => {
                  const t = document.getElementById('now-title');
                  if (t && t.textContent.startsWith('Song')) { window.__shown = performance.now(); o.disconnect(); }
                }).observe(document, {subtree: true, childList: true, characterData: true});"""})
            b.get(s.url('/'))
            shown.append(wait_for('the title', lambda: b.execute_script('return window.__shown'), interval=0.02))

        # -- page weight ---------------------------------------------------------
        b.execute_cdp_cmd('Network.clearBrowserCache', {})
        b.get('about:blank')
        b.get(s.url('/'))
        wait_for('the title', lambda: b.execute_script('return window.__shown'), interval=0.02)
        time.sleep(0.5)
        entries = b.execute_script("""
            const nav = performance.getEntriesByType('navigation')[0];
            const all = [nav, ...performance.getEntriesByType('resource')];
            return all.map(e => [e.name, e.decodedBodySize, e.encodedBodySize, e.initiatorType]);""")
        files = [e for e in entries if '/api/' not in e[0]]
        raw = sum(e[1] for e in files)
        packed = sum(e[2] for e in files)

        # -- status change latency ---------------------------------------------------
        b.execute_script("""
            window.__changes = [];
            new MutationObserver(() => window.__changes.push([Date.now(),
                document.getElementById('now-title').textContent]))
              .observe(document.getElementById('now-title'), {childList: true, characterData: true, subtree: true});""")
        other, click = [], []
        rounds = 5 if quick else 20
        for i in range(rounds):
            before = b.execute_script("return document.getElementById('now-title').textContent")
            n = len(b.execute_script('return window.__changes'))
            time.sleep(0.37 + (i % 5) * 0.05)  # spread the start over the reading interval
            t0 = time.time() * 1000
            s.daemon(ACT_NEXT)
            changed = wait_for('the page to show the next song', lambda: [
                c for c in b.execute_script('return window.__changes')[n:] if c[1] != before], interval=0.01)
            other.append(changed[0][0] - t0)
        btn = b.find_element('css selector', 'button[data-action=next]')
        for i in range(rounds):
            before = b.execute_script("return document.getElementById('now-title').textContent")
            n = len(b.execute_script('return window.__changes'))
            time.sleep(0.3)
            t0 = time.time() * 1000
            btn.click()
            changed = wait_for('the page to show the next song', lambda: [
                c for c in b.execute_script('return window.__changes')[n:] if c[1] != before], interval=0.01)
            click.append(changed[0][0] - t0)

        # -- idle CPU ----------------------------------------------------------------
        s.daemon(ACT_STOP)
        wait_for('stopped', lambda: b.execute_script(
            "return document.getElementById('state').textContent.toLowerCase().includes('nothing')"
            " || document.getElementById('state').textContent.toLowerCase().includes('stopped')"))
        time.sleep(8)  # idle connections of the browser time out first
        window = 10 if quick else 30
        c0 = cpu_seconds(s.web.pid)
        time.sleep(window)
        idle = (cpu_seconds(s.web.pid) - c0) * 30.0 / window

        print('web remote (headless Chromium, loopback, %d runs)' % runs)
        print('  first contentful paint, cold cache   median %.0f ms  (min %.0f, max %.0f)' % (
            statistics.median(fcp), min(fcp), max(fcp)))
        print('  playing title shown, cold cache      median %.0f ms  (min %.0f, max %.0f)' % (
            statistics.median(shown), min(shown), max(shown)))
        print('  page weight                          %d bytes (%.1f KB) before compression, %d bytes sent, %d files' % (
            raw, raw / 1024.0, packed, len(files)))
        for name, dec, enc, _ in files:
            print('    %-40s %7d  %7d' % (name.split('/')[-1] or '/', dec, enc))
        print('  status change by another client      median %.0f ms, p95 %.0f ms, max %.0f ms  (%d changes)' % (
            statistics.median(other), pct(other, 95), max(other), len(other)))
        print('  status change after a click          median %.0f ms, p95 %.0f ms, max %.0f ms  (%d clicks)' % (
            statistics.median(click), pct(click, 95), max(click), len(click)))
        print('  tarnweb CPU, one page open, idle     %.3f s per 30 s (measured over %d s)' % (idle, window))
    finally:
        if b:
            b.quit()
        s.stop()


if __name__ == '__main__':
    main()
