"""The whole system in a temporary root for the web remote's tests and
benchmark: tarnaudiod, tarnweb, a scanned library of demo songs.

Only inside a private network namespace (scripts/netns-run): the daemon
sends SSDP searches when it starts.
"""
import json
import os
import shutil
import signal
import socket
import struct
import subprocess
import tempfile
import time
import urllib.error
import urllib.request
import xml.etree.ElementTree as ET

ACT_PLAY_INDEX = 8
ACT_GET_STATUS = 19
ACT_QUEUE_ADD = 20
ACT_QUEUE_LIST = 27
ACT_SELECT_PLAYER = 18

SRC = os.path.abspath(os.path.join(os.path.dirname(__file__), '..', '..'))


def in_private_netns():
    return os.environ.get('TARN_IN_NETNS') == '1'


def free_port():
    s = socket.socket()
    s.bind(('127.0.0.1', 0))
    port = s.getsockname()[1]
    s.close()
    return port


class Stack:
    """Starts the daemon and tarnweb under a fresh root; stop() ends both."""

    def __init__(self, build, song_seconds=30, conf_extra='', songs=True, threads=None, bind='127.0.0.1'):
        if not in_private_netns():
            raise RuntimeError('run under scripts/netns-run (the daemon sends SSDP)')
        self.build = os.path.abspath(build)
        self.bin = os.path.join(self.build, 'bin')
        self.root = tempfile.mkdtemp(prefix='tarn-web.')
        self.port = free_port()
        self.procs = []
        self.env = dict(os.environ)
        self.env.update({
            'TARN_ROOT': self.root,
            'TARN_LOG_FILE': os.path.join(self.root, 'log.txt'),
            'TARN_AUDIO_OUT': 'null',
            # A key of our own: runs never share status segments.
            'TARN_SHM_KEY': str(0x2000000 + (os.getpid() % 100000) * 2),
        })
        for d in ('tmp', 'var/run', 'etc', 'usr/tarn/bin', 'usr/tarn/etc/audio', 'usr/tarn/etc.defaults/audio',
                  'usr/tarn/var'):
            os.makedirs(os.path.join(self.root, d), exist_ok=True)
        shutil.copy(os.path.join(self.bin, 'mplayer-daemon'), os.path.join(self.root, 'usr/tarn/bin/mplayer-daemon'))
        shutil.copy(os.path.join(SRC, 'data/equalizer.system'),
                    os.path.join(self.root, 'usr/tarn/etc.defaults/audio/equalizer.system'))
        for f in os.listdir(os.path.join(SRC, 'data/radio')):
            if f.endswith('.asx'):
                shutil.copy(os.path.join(SRC, 'data/radio', f), os.path.join(self.root, 'usr/tarn/etc/audio', f))
        self.music = os.path.join(self.root, 'music')
        with open(self.conf_path(), 'w') as f:
            f.write('admin_port=%d\nmusic_dir=%s\n%s' % (self.port, self.music, conf_extra))
        if songs:
            self.run(['sh', os.path.join(SRC, 'scripts/make-demo-songs.sh'), self.music, str(song_seconds)])
            self.run([os.path.join(self.bin, 'tarnlib'), 'scan', self.music])
        self.start_daemon()
        self.start_web(threads, bind)

    def conf_path(self):
        return os.path.join(self.root, 'etc/tarninfo.conf')

    def run(self, argv, timeout=120):
        return subprocess.run(argv, env=self.env, check=True, timeout=timeout, stdout=subprocess.PIPE,
                              stderr=subprocess.STDOUT, text=True).stdout

    def start_daemon(self):
        subprocess.run([os.path.join(self.bin, 'tarnaudiod')], env=self.env, check=True, timeout=30)
        deadline = time.time() + 15
        while time.time() < deadline:
            if self.ctl('status', check=False).returncode == 0:
                return
            time.sleep(0.1)
        raise RuntimeError('tarnaudiod did not come up: ' + self.log())

    def start_web(self, threads=None, bind='127.0.0.1'):
        # A renderer fetches songs at the daemon's network address: a stack
        # that plays on one binds every address (of the private namespace).
        argv = [os.path.join(self.bin, 'tarnweb'), '--bind', bind]
        if threads:
            argv += ['--threads', str(threads)]
        self.web_out = open(os.path.join(self.root, 'tarnweb.out'), 'w')
        self.web = subprocess.Popen(argv, env=self.env, stdout=self.web_out, stderr=subprocess.STDOUT)
        self.procs.append(self.web)
        deadline = time.time() + 15
        while time.time() < deadline:
            try:
                urllib.request.urlopen(self.url('/api/session'), timeout=2).read()
                return
            except (urllib.error.URLError, ConnectionError):
                time.sleep(0.05)
        raise RuntimeError('tarnweb did not listen on %d' % self.port)

    def url(self, path='/'):
        return 'http://127.0.0.1:%d%s' % (self.port, path)

    def ctl(self, *args, check=True):
        r = subprocess.run([os.path.join(self.bin, 'tarnctl')] + list(args), env=self.env, timeout=30,
                           stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True)
        if check and r.returncode != 0:
            raise RuntimeError('tarnctl %s: %s' % (' '.join(args), r.stdout))
        return r

    def daemon(self, action, text=''):
        """One request on the daemon's control socket, as its clients send
        it: the parsed JSON reply."""
        request = struct.pack('=i', action) + text.encode().ljust(8192, b'\0')
        with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as s:
            s.settimeout(5)
            s.connect(os.path.join(self.root, 'tmp/tarnaudiod.sock'))
            s.sendall(request)
            reply = b''
            while len(reply) < 8192:
                chunk = s.recv(8192)
                if not chunk:
                    break
                reply += chunk
        return json.loads(reply.split(b'\0', 1)[0].decode())

    def daemon_status(self):
        return self.daemon(ACT_GET_STATUS)

    def daemon_queue(self):
        return self.daemon(ACT_QUEUE_LIST, '0 64')

    def api(self, path, body=None, headers=None):
        """One API request: (HTTP status, parsed JSON or None)."""
        data = None if body is None else json.dumps(body).encode()
        req = urllib.request.Request(self.url(path), data=data, method='GET' if body is None else 'POST')
        if body is not None:
            req.add_header('Content-Type', 'application/json')
        for k, v in (headers or {}).items():
            req.add_header(k, v)
        try:
            with urllib.request.urlopen(req, timeout=30) as r:
                text = r.read()
                return r.status, json.loads(text) if text else None
        except urllib.error.HTTPError as e:
            text = e.read()
            try:
                return e.code, json.loads(text)
            except ValueError:
                return e.code, None

    def log(self):
        try:
            with open(os.path.join(self.root, 'log.txt')) as f:
                return f.read()
        except OSError:
            return ''

    def stop(self):
        self.web_out.close()
        for p in self.procs:
            if p.poll() is None:
                p.send_signal(signal.SIGTERM)
                try:
                    p.wait(10)
                except subprocess.TimeoutExpired:
                    p.kill()
                    p.wait()
        pidfile = os.path.join(self.root, 'var/run/tarnaudiod.pid')
        try:
            with open(pidfile) as f:
                pid = int(f.read().strip())
            os.kill(pid, signal.SIGTERM)
            for _ in range(150):
                # Reap it when it is our child's child that we inherited.
                try:
                    os.waitpid(pid, os.WNOHANG)
                except ChildProcessError:
                    pass
                try:
                    with open('/proc/%d/stat' % pid) as f:
                        if f.read().split()[2] == 'Z':
                            break
                except OSError:
                    break
                time.sleep(0.1)
        except (OSError, ValueError):
            pass
        # The segments go with the root.
        for key in (int(self.env['TARN_SHM_KEY']), int(self.env['TARN_SHM_KEY']) + 1):
            subprocess.run(['ipcrm', '-M', str(key)], stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        shutil.rmtree(self.root, ignore_errors=True)


def listening_address(port):
    """The IPv4 address a process here listens on at a TCP port, or None:
    libupnp's HTTP server shows which address a control point took."""
    with open('/proc/net/tcp') as f:
        for line in f.readlines()[1:]:
            local, state = line.split()[1], line.split()[3]
            addr, lport = local.split(':')
            if int(lport, 16) == port and state == '0A':
                return socket.inet_ntoa(struct.pack('=I', int(addr, 16)))
    return None


# The daemon's UPnP stack listens on libupnp's first port.
DAEMON_UPNP_PORT = 49152
AVT = 'urn:schemas-upnp-org:service:AVTransport:1'


class Renderer:
    """gmediarender playing into a fakesink, on the veth end (scripts/netns-run)
    the daemon's UPnP is not on, so that their traffic crosses the pair.
    stop() ends it."""

    BINARY = '/usr/bin/gmediarender'

    def __init__(self, root, name, udn, port=49494, timeout=30):
        deadline = time.time() + timeout
        daemon_ip = None
        while daemon_ip is None and time.time() < deadline:
            daemon_ip = listening_address(DAEMON_UPNP_PORT)
            if daemon_ip is None:
                time.sleep(0.1)
        if daemon_ip is None:
            raise RuntimeError('the daemon\'s UPnP did not listen on port %d within %d s'
                               % (DAEMON_UPNP_PORT, timeout))
        first = daemon_ip == '10.77.0.1'
        self.ip, self.iface = ('10.77.0.2', 'tveth1') if first else ('10.77.0.1', 'tveth0')
        self.name = name
        self.port = port
        self.log_path = os.path.join(root, 'tmp/gmediarender.log')
        self.out = open(os.path.join(root, 'tmp/gmediarender.out'), 'w')
        self.proc = subprocess.Popen([self.BINARY, '-I', self.iface, '-p', str(port), '-f', name, '-u', udn,
                                      '--gstout-audiopipe', 'fakesink sync=true', '--logfile', self.log_path],
                                     stdout=self.out, stderr=subprocess.STDOUT)
        self.control = None
        while time.time() < deadline:
            if self.proc.poll() is not None:
                raise RuntimeError('gmediarender ended (%s) at its start: %s' % (self.proc.returncode, self.log()))
            try:
                self.control = self.control_url()
                return
            except (OSError, ValueError, ET.ParseError):
                time.sleep(0.1)
        self.stop()
        raise RuntimeError('gmediarender did not serve its description on %s:%d within %d s: %s'
                           % (self.ip, port, timeout, self.log()))

    def control_url(self):
        base = 'http://%s:%d' % (self.ip, self.port)
        with urllib.request.urlopen(base + '/description.xml', timeout=5) as r:
            doc = ET.fromstring(r.read())
        for svc in doc.iter('{urn:schemas-upnp-org:device-1-0}service'):
            if svc.findtext('{urn:schemas-upnp-org:device-1-0}serviceType') == AVT:
                return base + svc.findtext('{urn:schemas-upnp-org:device-1-0}controlURL')
        raise ValueError('no AVTransport in the description')

    def transport_info(self):
        """The renderer's own answer to GetTransportInfo: a dict of its
        CurrentTransportState and CurrentTransportStatus."""
        body = ('<?xml version="1.0"?><s:Envelope xmlns:s="http://schemas.xmlsoap.org/soap/envelope/" '
                's:encodingStyle="http://schemas.xmlsoap.org/soap/encoding/"><s:Body>'
                '<u:GetTransportInfo xmlns:u="%s"><InstanceID>0</InstanceID></u:GetTransportInfo>'
                '</s:Body></s:Envelope>' % AVT).encode()
        req = urllib.request.Request(self.control, data=body, method='POST')
        req.add_header('Content-Type', 'text/xml; charset="utf-8"')
        req.add_header('SOAPACTION', '"%s#GetTransportInfo"' % AVT)
        with urllib.request.urlopen(req, timeout=5) as r:
            doc = ET.fromstring(r.read())
        out = {}
        for e in doc.iter():
            if e.tag in ('CurrentTransportState', 'CurrentTransportStatus'):
                out[e.tag] = e.text or ''
        return out

    def log(self):
        try:
            with open(self.log_path, errors='replace') as f:
                return f.read()[-4000:]
        except OSError:
            return ''

    def stop(self):
        if self.proc.poll() is None:
            self.proc.send_signal(signal.SIGTERM)
            try:
                self.proc.wait(10)
            except subprocess.TimeoutExpired:
                self.proc.kill()
                self.proc.wait()
        self.out.close()
