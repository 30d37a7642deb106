"""The web remote in a real browser (headless Chromium driven by Selenium)
against a real daemon, library and tarnweb in a temporary root.

    scripts/netns-run /usr/bin/python3 tests/browser/test_remote.py BUILD_DIR

What the daemon does is checked on its own control socket, not through the
page or the API; what a renderer does, by asking the renderer itself.
"""
import http.server
import os
import struct
import sys
import tempfile
import threading
import time
import unittest

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
import stack  # noqa: E402

from selenium import webdriver  # noqa: E402
from selenium.common.exceptions import StaleElementReferenceException  # noqa: E402
from selenium.webdriver.chrome.service import Service  # noqa: E402
from selenium.webdriver.common.by import By  # noqa: E402
from selenium.webdriver.common.keys import Keys  # noqa: E402

BUILD = os.path.join(stack.SRC, 'build')


def media_info(path, title, artist='Tarn Demo Band', album='Tarn Demo Tones', duration=30.0):
    """A song record (TARN_MEDIA_INFO, 7336 bytes) as the daemon takes it."""
    rec = bytearray(7336)
    rec[4:4 + len(path)] = path.encode()
    rec[4112:4112 + len(title)] = title.encode()
    rec[4367:4367 + len(album)] = album.encode()
    rec[4622:4622 + len(artist)] = artist.encode()
    struct.pack_into('=f', rec, 6236, duration)
    return bytes(rec)


def browser(width=1280, height=900):
    opts = webdriver.ChromeOptions()
    opts.binary_location = '/usr/bin/chromium'
    for a in ('--headless=new', '--no-sandbox', '--disable-gpu', '--disable-dev-shm-usage',
              '--window-size=%d,%d' % (width, height), '--no-first-run', '--disable-extensions',
              '--user-data-dir=' + tempfile.mkdtemp(prefix='tarn-chromium.')):
        opts.add_argument(a)
    return webdriver.Chrome(service=Service('/usr/bin/chromedriver'), options=opts)


def wait_for(what, check, timeout=10.0, interval=0.1):
    deadline = time.time() + timeout
    last = None
    while time.time() < deadline:
        try:
            last = check()
            if last:
                return last
        except Exception as e:  # the page may be mid-update
            last = e
        time.sleep(interval)
    raise AssertionError('timed out waiting for %s (last: %r)' % (what, last))


def wait_equal(what, want, get, timeout=10.0):
    """Waits until get() returns want; the failure names the last value seen."""
    seen = []

    def check():
        seen[:] = [get()]
        return seen[0] == want
    try:
        wait_for(what, check, timeout)
    except AssertionError as e:
        raise AssertionError('%s; wanted %r, last seen %r' % (e, want, seen[0] if seen else None)) from None


class RemoteInBrowser(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        # Every address of the private namespace: a renderer fetches songs
        # at the daemon's network address.
        cls.s = stack.Stack(BUILD, song_seconds=40, bind='0.0.0.0')
        cls.songs = [('tone-440.mp3', 'Demo Tone A440'), ('tone-660.flac', 'Demo Tone E660'),
                     ('tone-880.ogg', 'Demo Tone A880')]
        for f, title in cls.songs:
            cls.queue_add(os.path.join(cls.s.music, f), title)
        cls.s.daemon(stack.ACT_PLAY_INDEX, '0')
        cls.b = browser()
        cls.b.get(cls.s.url('/'))

    @classmethod
    def tearDownClass(cls):
        try:
            cls.b.quit()
        finally:
            cls.s.stop()

    @classmethod
    def queue_add(cls, path, title):
        import socket
        req = struct.pack('=i', stack.ACT_QUEUE_ADD) + media_info(path, title).ljust(8192, b'\0')
        with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as c:
            c.settimeout(5)
            c.connect(os.path.join(cls.s.root, 'tmp/tarnaudiod.sock'))
            c.sendall(req)
            c.recv(8192)

    def text(self, css):
        return self.b.find_element(By.CSS_SELECTOR, css).text

    def uri(self):
        return self.s.daemon_status().get('CurrentUri', '')

    def test_1_page_shows_the_playing_song_and_its_progress_moves(self):
        wait_for('the playing title', lambda: self.text('#now-title') == 'Demo Tone A440')
        wait_for('the state word', lambda: self.text('#state') == 'PLAYING' or self.text('#state') == 'Playing')
        seek = self.b.find_element(By.CSS_SELECTOR, 'input[data-action=seek]')
        first = int(seek.get_attribute('value'))
        shown = self.text('#pos')
        wait_for('the progress bar to move', lambda: int(seek.get_attribute('value')) >= first + 2, timeout=8)
        self.assertNotEqual(shown, self.text('#pos'))
        self.assertEqual('40', seek.get_attribute('max'))
        rows = self.b.find_elements(By.CSS_SELECTOR, '#queue-list li[data-index]')
        self.assertEqual(['0', '1', '2'], [r.get_attribute('data-index') for r in rows])
        self.assertIn('current', rows[0].get_attribute('class'))

    def test_2_next_clicked_in_the_page_changes_the_daemons_song(self):
        wait_for('the first song', lambda: self.uri().endswith('tone-440.mp3'))
        self.b.find_element(By.CSS_SELECTOR, 'button[data-action=next]').click()
        wait_for('the daemon to play the second song', lambda: self.uri().endswith('tone-660.flac'), timeout=5)
        wait_for('the page to follow', lambda: self.text('#now-title') == 'Demo Tone E660', timeout=3)

    def test_3_space_plays_and_pauses(self):
        wait_for('playing', lambda: self.s.daemon_status().get('PlayerState') == 2)
        self.b.find_element(By.TAG_NAME, 'body').send_keys(Keys.SPACE)
        wait_for('paused by space', lambda: self.s.daemon_status().get('PlayerState') == 3, timeout=5)
        wait_for('the page to say so', lambda: self.text('#state').lower() == 'paused', timeout=3)
        self.b.find_element(By.TAG_NAME, 'body').send_keys(Keys.SPACE)
        wait_for('playing again', lambda: self.s.daemon_status().get('PlayerState') == 2, timeout=5)

    def test_4_search_finds_a_scanned_song_and_adds_it(self):
        before = self.s.daemon_queue()['total']
        self.b.find_element(By.CSS_SELECTOR, '[data-tab=library]').click()
        box = self.b.find_element(By.CSS_SELECTOR, 'input[type=search]')
        box.send_keys('A880')
        row = wait_for('the search result', lambda: [
            r for r in self.b.find_elements(By.CSS_SELECTOR, '#library-list li[data-song]')
            if 'Demo Tone A880' in r.text])[0]
        self.assertEqual(1, len(self.b.find_elements(By.CSS_SELECTOR, '#library-list li[data-song]')))
        row.find_element(By.CSS_SELECTOR, 'button[data-where=end]').click()
        q = wait_for('the song in the daemon\'s queue', lambda: (
            lambda q: q if q['total'] == before + 1 else None)(self.s.daemon_queue()))
        last = q['uris'][-1]
        self.assertEqual('Demo Tone A880', last['title'])
        self.assertEqual(os.path.join(self.s.music, 'tone-880.ogg'), last['res'])
        self.b.find_element(By.CSS_SELECTOR, '[data-tab=queue]').click()
        wait_for('the queue to show it', lambda: len(
            self.b.find_elements(By.CSS_SELECTOR, '#queue-list li[data-index]')) == before + 1, timeout=3)

    def test_5_a_cross_site_post_is_refused(self):
        # Another origin (another port) whose page posts to the remote: a
        # form and a fetch that needs no preflight.
        target = self.s.url('/api/player/')
        page = ('<!doctype html><form id=f method=post action="%sstop" target=sink>'
                '<input name=x value=1></form><iframe name=sink></iframe><script>'
                'fetch("%snext",{method:"POST",mode:"no-cors",body:"{}",headers:{"Content-Type":"text/plain"}})'
                '.finally(()=>{document.getElementById("f").submit();document.title="sent"});</script>'
                % (target, target))
        d = tempfile.mkdtemp(prefix='tarn-evil.')
        with open(os.path.join(d, 'index.html'), 'w') as f:
            f.write(page)
        handler = lambda *a, **k: http.server.SimpleHTTPRequestHandler(*a, directory=d, **k)  # noqa: E731
        evil = http.server.ThreadingHTTPServer(('127.0.0.1', 0), handler)
        threading.Thread(target=evil.serve_forever, daemon=True).start()
        try:
            wait_for('playing', lambda: self.s.daemon_status().get('PlayerState') == 2)
            uri = self.uri()
            self.b.get('http://127.0.0.1:%d/index.html' % evil.server_address[1])
            wait_for('the page to send', lambda: self.b.title == 'sent')
            wait_for('both refusals in the log', lambda: 'Refused cross-site POST /api/player/next' in self.s.log()
                     and 'Refused cross-site POST /api/player/stop' in self.s.log(), timeout=5)
            time.sleep(0.5)
            st = self.s.daemon_status()
            self.assertEqual(uri, st['CurrentUri'])
            self.assertEqual(2, st['PlayerState'])
        finally:
            evil.shutdown()
            self.b.get(self.s.url('/'))
        # The browser's next requests, on the connections the refused ones
        # came on, are answered.
        wait_for('the remote\'s page again', lambda: self.text('#now-title') == 'Demo Tone E660', timeout=5)

    def shown_player(self):
        """The player the page names at its top and the rows of the Players
        tab marked as selected (pressed, current, saying so)."""
        marked = [li.find_element(By.CSS_SELECTOR, '.row-title').text
                  for li in self.b.find_elements(By.CSS_SELECTOR, '#player-list li.current')
                  if li.find_element(By.CSS_SELECTOR, 'button[data-action=player-select]').get_attribute(
                      'aria-pressed') == 'true' and 'selected' in li.text]
        return self.text('#player-name'), marked

    def click_player(self, name):
        """Clicks the player's row in the Players tab once it shows (the tab
        draws its list again as it opens: a row gone before the click is
        looked for again)."""
        self.b.find_element(By.CSS_SELECTOR, '[data-tab=players]').click()

        def click():
            [b for b in self.b.find_elements(By.CSS_SELECTOR, '#player-list button[data-action=player-select]')
             if b.find_element(By.CSS_SELECTOR, '.row-title').text == name][0].click()
            return True
        wait_for('%s in the players list, clicked' % name, click)

    def test_6_a_renderer_chosen_in_the_page_plays_and_this_device_comes_back(self):
        name = 'Tarn Browser Gmr'
        renderer = stack.Renderer(self.s.root, name, '5c0ffee0-7a1b-4c2d-9e3f-b0b1c2d3e4f6')
        try:
            self.renderer_plays(renderer, name)
        except BaseException:
            print('gmediarender log:\n' + renderer.log(), file=sys.stderr)
            raise
        finally:
            renderer.stop()

    def renderer_plays(self, renderer, name):
        # Found through the page: its search button until the row shows.
        self.b.find_element(By.CSS_SELECTOR, '[data-tab=players]').click()
        def titles():
            try:
                return [t.text for t in self.b.find_elements(
                    By.CSS_SELECTOR, '#player-list button[data-action=player-select] .row-title')]
            except StaleElementReferenceException:  # the list was drawn again
                return []
        deadline = time.time() + 40
        asked = 0
        while name not in titles() and time.time() < deadline:
            if time.time() - asked >= 5:
                self.b.find_element(By.CSS_SELECTOR, 'button[data-action=players-refresh]').click()
                asked = time.time()
            time.sleep(0.2)
        self.assertIn(name, titles(), 'the renderer (on %s) was not listed in the page within 40 s; the daemon '
                      'lists %r' % (renderer.ip, self.s.api('/api/players')[1]))

        self.click_player(name)
        wait_for('the daemon to select the renderer', lambda: self.s.daemon_status().get(
            'RendererFriendlyName') == name, timeout=10)
        wait_equal('the page to show the renderer as the player, its row alone marked', (name, [name]),
                   self.shown_player)

        # The renderer's own queue starts empty: a song from the library, then
        # the play button.
        self.assertEqual(0, self.s.daemon_queue()['total'])
        self.b.find_element(By.CSS_SELECTOR, '[data-tab=library]').click()
        box = self.b.find_element(By.CSS_SELECTOR, 'input[type=search]')
        box.clear()
        box.send_keys('E660')
        wait_for('the search result, its add button clicked', lambda: [
            r for r in self.b.find_elements(By.CSS_SELECTOR, '#library-list li[data-song]')
            if 'Demo Tone E660' in r.text][0].find_element(By.CSS_SELECTOR, 'button[data-where=end]').click()
            or True)
        q = wait_for('the song in the renderer\'s queue', lambda: (
            lambda q: q if q['total'] == 1 else None)(self.s.daemon_queue()))
        self.assertEqual(os.path.join(self.s.music, 'tone-660.flac'), q['uris'][0]['res'])
        self.b.find_element(By.CSS_SELECTOR, '#play-pause').click()

        st = wait_for('the daemon to report the renderer PLAYING the song', lambda: (
            lambda st: st if st.get('TransportState') == 'PLAYING' and st.get('CurrentURI', '').endswith('.flac')
            else None)(self.s.daemon_status()), timeout=30)
        self.assertEqual(name, st['RendererFriendlyName'])
        self.assertEqual('', st['last_error'])
        info = wait_for('the renderer itself to say PLAYING', lambda: (
            lambda i: i if i.get('CurrentTransportState') == 'PLAYING' else None)(renderer.transport_info()),
            timeout=15)
        self.assertEqual('OK', info['CurrentTransportStatus'])
        # Its position moves: it plays, not just says so.
        start = self.s.daemon_status()['RelTime']
        wait_for('the renderer\'s position to move', lambda: self.s.daemon_status()['RelTime'] >= start + 2,
                 timeout=15)
        shown = lambda: (self.text('#now-title'), self.text('#state').lower(), self.text('#player-name'))  # noqa: E731
        wait_equal('the page to show the song playing on the renderer', ('Demo Tone E660', 'playing', name), shown)

        # The page's stop reaches the renderer.
        self.b.find_element(By.CSS_SELECTOR, 'button[data-action=stop]').click()
        wait_for('the renderer to stop', lambda: renderer.transport_info().get('CurrentTransportState') == 'STOPPED',
                 timeout=15)

        # This device again: the daemon's own player, with its own queue.
        self.click_player('This device')
        wait_for('the daemon to select this device', lambda: 'RendererIndex' not in self.s.daemon_status()
                 and 'PlayerState' in self.s.daemon_status(), timeout=10)
        self.b.find_element(By.CSS_SELECTOR, '[data-tab=players]').click()
        wait_equal('the page to show this device as the player, its row alone marked',
                   ('This device', ['This device']), self.shown_player)
        self.assertEqual(4, self.s.daemon_queue()['total'])


if __name__ == '__main__':
    if len(sys.argv) > 1 and os.path.isdir(sys.argv[1]):
        BUILD = sys.argv.pop(1)
    unittest.main(verbosity=2)
