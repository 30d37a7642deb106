// The music remote: now playing, transport, queue, library, sources,
// players and equalizer. Status arrives pushed by the server; every control
// is a button or input with a data-action name.
import { get, post, query, listen, setLoginHandler } from './api.js';
import { el, time, spokenTime, button, row, empty } from './views.js';

const $ = (id) => document.getElementById(id);
const icons = document.querySelector('link[rel=stylesheet]').href.replace(/app\.css$/, 'icons.svg');
const QUEUE_PAGE = 50;

const state = {
  status: null,
  receivedAt: 0,
  seeking: false,
  volumeHeld: false,
  queueStart: 0,
  queueKey: '',
  tab: 'queue',
  crumbs: [],          // library position: [] | [{artist}] | [{artist},{album}]
  radioList: 'favorite',
  loaded: {},
};

// ---------------------------------------------------------------------------
// Errors are shown, never swallowed.
function showError(message) {
  $('alert-text').textContent = message;
  $('alert').hidden = false;
}
$('alert-close').addEventListener('click', () => { $('alert').hidden = true; });

async function act(fn) {
  try {
    return await fn();
  } catch (e) {
    showError(e.message);
    return null;
  }
}

// ---------------------------------------------------------------------------
// Password.
setLoginHandler(() => new Promise((resolve) => {
  const dialog = $('login');
  const form = $('login-form');
  $('login-error').textContent = '';
  const submit = async (ev) => {
    ev.preventDefault();
    try {
      await post('/api/login', { password: $('login-password').value });
      form.removeEventListener('submit', submit);
      dialog.close();
      $('login-password').value = '';
      resolve();
      connect();
    } catch (e) {
      $('login-error').textContent = e.message;
    }
  };
  form.addEventListener('submit', submit);
  if (!dialog.open) dialog.showModal();
}));

// ---------------------------------------------------------------------------
// Now playing.
function setIcon(useId, name) {
  $(useId).setAttribute('href', `${icons}#${name}`);
}

function currentPosition() {
  const s = state.status;
  if (!s) return 0;
  let p = s.position;
  if (s.state === 2 && !state.seeking) p += (performance.now() - state.receivedAt) / 1000;
  return s.duration > 0 ? Math.min(p, s.duration) : p;
}

function renderProgress() {
  const s = state.status;
  if (!s || state.seeking) return;
  const p = Math.floor(currentPosition());
  const seek = $('seek');
  seek.max = Math.max(s.duration, 0);
  seek.value = p;
  seek.disabled = !(s.duration > 0);
  seek.setAttribute('aria-valuetext', `${spokenTime(p)} of ${spokenTime(s.duration)}`);
  $('pos').textContent = time(p);
  $('dur').textContent = s.duration > 0 ? time(s.duration) : (s.uri ? 'live' : '0:00');
  if ('mediaSession' in navigator && navigator.mediaSession.setPositionState && s.duration > 0) {
    try {
      navigator.mediaSession.setPositionState({ duration: s.duration, position: Math.min(p, s.duration), playbackRate: 1 });
    } catch (e) { /* some browsers refuse while nothing plays */ }
  }
}

const repeatNames = { 1: 'off', 2: 'this song', 3: 'the whole queue' };

function renderStatus(s) {
  const before = state.status;
  state.status = s;
  state.receivedAt = performance.now();
  const title = s.title || (s.uri ? s.uri.split('/').pop() : 'Nothing playing');
  $('now-title').textContent = title;
  $('now-artist').textContent = s.radio && s.artist === s.radio ? `Radio: ${s.radio}` : s.artist;
  $('now-album').textContent = s.album;
  $('state').textContent = s.stateText;
  document.title = s.uri ? `${s.state === 2 ? '▶ ' : ''}${title}${s.artist ? ' – ' + s.artist : ''}` : 'Music';

  const playing = s.state === 2;
  setIcon('play-icon', playing ? 'pause' : 'play');
  $('play-pause').setAttribute('aria-label', playing ? 'Pause' : 'Play');

  if (!state.volumeHeld) {
    $('volume').value = s.volume;
    $('volume-out').textContent = s.volume;
  }
  const muted = s.mute === true;
  $('mute').setAttribute('aria-pressed', String(muted));
  setIcon('mute-icon', muted ? 'muted' : 'volume');
  $('repeat').setAttribute('aria-label', `Repeat: ${repeatNames[s.repeat] || 'off'}`);
  $('repeat').classList.toggle('on', s.repeat !== 1);
  setIcon('repeat-icon', s.repeat === 2 ? 'repeat-one' : 'repeat');
  $('shuffle').setAttribute('aria-pressed', String(!!s.shuffle));

  const player = s.player || {};
  $('player-name').textContent = player.name || 'No player';
  $('player-chip').setAttribute('aria-label', `Playing on ${player.name || 'no player'}; choose another`);

  if (!before || before.art !== s.art) {
    const img = $('cover');
    if (s.art) {
      img.onload = () => { img.hidden = false; $('cover-none').hidden = true; };
      img.onerror = () => { img.hidden = true; $('cover-none').hidden = false; };
      img.alt = `Cover of ${s.album || title}`;
      img.src = s.art;
    } else {
      img.hidden = true;
      $('cover-none').hidden = false;
    }
  }
  if (s.error && (!before || before.error !== s.error)) showError(s.error);
  if (!s.daemon) showError(s.stateText);
  else if (before && !before.daemon) $('alert').hidden = true;

  renderProgress();
  updateMediaSession(s, title);

  // The queue follows the player: reload it when its shape changes.
  const key = `${player.kind}:${player.index}:${s.total}:${s.index}`;
  if (key !== state.queueKey) {
    const playerChanged = !before || !before.player || before.player.index !== player.index;
    state.queueKey = key;
    if (playerChanged) state.queueStart = Math.floor(s.index / QUEUE_PAGE) * QUEUE_PAGE;
    loadQueue();
    if (playerChanged && state.tab === 'players') loadPlayers();
  }
}

let lastMeta = '';
function updateMediaSession(s, title) {
  if (!('mediaSession' in navigator)) return;
  const key = `${title}|${s.artist}|${s.album}|${s.art}`;
  if (key !== lastMeta) {
    lastMeta = key;
    navigator.mediaSession.metadata = new MediaMetadata({
      title, artist: s.artist, album: s.album,
      artwork: s.art ? [{ src: new URL(s.art, location.href).href, sizes: '512x512' }] : [],
    });
  }
  navigator.mediaSession.playbackState = s.state === 2 ? 'playing' : (s.state === 3 ? 'paused' : 'none');
}

if ('mediaSession' in navigator) {
  const ms = navigator.mediaSession;
  const safe = (name, fn) => { try { ms.setActionHandler(name, fn); } catch (e) { /* not offered */ } };
  safe('play', () => { if (!state.status || state.status.state !== 2) control('play-pause'); });
  safe('pause', () => { if (state.status && state.status.state === 2) control('play-pause'); });
  safe('stop', () => control('stop'));
  safe('previoustrack', () => control('previous'));
  safe('nexttrack', () => control('next'));
  safe('seekto', (d) => act(() => post('/api/player/seek', { position: Math.floor(d.seekTime) })));
}

// ---------------------------------------------------------------------------
// Transport.
function control(action) {
  return act(() => post(`/api/player/${action}`));
}

const seek = $('seek');
seek.addEventListener('input', () => { state.seeking = true; $('pos').textContent = time(seek.value); });
seek.addEventListener('change', async () => {
  const position = Number(seek.value);
  await act(() => post('/api/player/seek', { position }));
  if (state.status) { state.status.position = position; state.receivedAt = performance.now(); }
  state.seeking = false;
  renderProgress();
});

const volume = $('volume');
let volumeTimer = 0;
volume.addEventListener('input', () => {
  state.volumeHeld = true;
  $('volume-out').textContent = volume.value;
  clearTimeout(volumeTimer);
  // While the slider moves, at most 4 changes a second reach the player.
  volumeTimer = setTimeout(sendVolume, 250);
});
volume.addEventListener('change', () => { clearTimeout(volumeTimer); sendVolume(); });
async function sendVolume() {
  await act(() => post('/api/player/volume', { volume: Number(volume.value) }));
  state.volumeHeld = false;
}

// ---------------------------------------------------------------------------
// Queue.
async function loadQueue() {
  const list = $('queue-list');
  const q = await act(() => get(query('/api/queue', { start: state.queueStart, limit: QUEUE_PAGE })));
  if (!q) return;
  if (q.total > 0 && state.queueStart >= q.total) {
    state.queueStart = Math.max(0, Math.floor((q.total - 1) / QUEUE_PAGE) * QUEUE_PAGE);
    return loadQueue();
  }
  $('queue-count').textContent = q.total ? `(${q.total})` : '';
  const current = state.status ? state.status.index : q.current;
  const playing = state.status && state.status.uri;
  if (!q.items.length) {
    empty(list, 'The queue is empty. Add songs from the library or pick a source.');
  } else {
    list.replaceChildren(...q.items.map((it) => {
      const isCurrent = playing && it.index === current;
      const sub = [it.artist, it.album].filter(Boolean).join(' · ') + (it.duration ? ` · ${time(it.duration)}` : '');
      return row(it.title, sub,
        { dataAction: 'queue-play', dataIndex: it.index, 'aria-label': `Play ${it.title}` },
        [
          button('Next', 'queue-next', { dataIndex: it.index }, { aria: `Play ${it.title} next`, class: 'btn small extra' }),
          button('↑', 'queue-up', { dataIndex: it.index }, { aria: `Move ${it.title} up` }),
          button('↓', 'queue-down', { dataIndex: it.index }, { aria: `Move ${it.title} down` }),
          button('✕', 'queue-remove', { dataIndex: it.index }, { aria: `Remove ${it.title}` }),
        ],
        { dataIndex: it.index, class: isCurrent ? 'current' : null, 'aria-current': isCurrent ? 'true' : null });
    }));
  }
  const pager = $('queue-pager');
  pager.hidden = q.total <= QUEUE_PAGE;
  $('queue-range').textContent = `${q.start + 1}–${Math.min(q.total, q.start + QUEUE_PAGE)} of ${q.total}`;
}

// ---------------------------------------------------------------------------
// Library.
function crumbBar() {
  const bar = $('crumbs');
  const parts = [el('button', { type: 'button', dataAction: 'lib-home', text: 'Artists' })];
  if (state.crumbs[0]) {
    parts.push(el('span', { text: '›' }), el('button', { type: 'button', dataAction: 'lib-artist', dataArtist: state.crumbs[0].artist, text: state.crumbs[0].artist || 'Unknown artist' }));
  }
  if (state.crumbs[1]) parts.push(el('span', { text: '›' }), el('span', { text: state.crumbs[1].album || 'Unknown album' }));
  if (state.crumbs.search) parts.splice(1, parts.length, el('span', { text: '›' }), el('span', { text: `Results for “${state.crumbs.search}”` }));
  bar.replaceChildren(...parts);
}

function songActions(song) {
  return [
    button('Play', 'lib-add', { dataIds: song.id, dataWhere: 'play' }, { aria: `Play ${song.title} now` }),
    button('Next', 'lib-add', { dataIds: song.id, dataWhere: 'next' }, { aria: `Play ${song.title} next`, class: 'btn small extra' }),
    button('Add', 'lib-add', { dataIds: song.id, dataWhere: 'end' }, { aria: `Add ${song.title} to the queue` }),
  ];
}

function showSongs(songs, emptyText) {
  const list = $('library-list');
  if (!songs.length) return empty(list, emptyText);
  list.replaceChildren(...songs.map((s) => row(s.title,
    [s.artist, s.album].filter(Boolean).join(' · ') + (s.duration ? ` · ${time(s.duration)}` : ''),
    { dataAction: 'lib-add', dataIds: s.id, dataWhere: 'play', 'aria-label': `Play ${s.title} now` },
    songActions(s), { dataSong: s.id })));
}

async function libraryHome() {
  state.crumbs = [];
  crumbBar();
  const r = await act(() => get('/api/library/artists'));
  if (!r) return;
  const list = $('library-list');
  if (!r.artists.length) return empty(list, 'The library is empty. Scan the music folder with Rescan.');
  list.replaceChildren(...r.artists.map((a) => row(a.name || 'Unknown artist',
    `${a.albums} album${a.albums === 1 ? '' : 's'} · ${a.songs} song${a.songs === 1 ? '' : 's'}`,
    { dataAction: 'lib-artist', dataArtist: a.name, 'aria-label': `Albums of ${a.name || 'unknown artist'}` },
    [button('Add all', 'lib-add-set', { dataArtist: a.name, dataWhere: 'end' }, { aria: `Add every song of ${a.name}` })])));
}

async function libraryArtist(artist) {
  state.crumbs = [{ artist }];
  crumbBar();
  const r = await act(() => get(query('/api/library/albums', { artist })));
  if (!r) return;
  const list = $('library-list');
  list.replaceChildren(...r.albums.map((a) => {
    const li = row(a.name || 'Unknown album', `${a.songs} song${a.songs === 1 ? '' : 's'}${a.year ? ' · ' + a.year : ''}`,
      { dataAction: 'lib-album', dataArtist: artist, dataAlbum: a.name, 'aria-label': `Songs of ${a.name || 'unknown album'}` },
      [button('Play', 'lib-add-set', { dataArtist: artist, dataAlbum: a.name, dataWhere: 'play' }, { aria: `Play ${a.name}` }),
       button('Add', 'lib-add-set', { dataArtist: artist, dataAlbum: a.name, dataWhere: 'end' }, { aria: `Add ${a.name} to the queue` })]);
    const img = el('img', { class: 'thumb', alt: '', loading: 'lazy', src: a.cover, width: 40, height: 40 });
    img.addEventListener('error', () => { img.style.visibility = 'hidden'; });
    li.prepend(img);
    return li;
  }));
}

async function libraryAlbum(artist, album) {
  state.crumbs = [{ artist }, { album }];
  crumbBar();
  const r = await act(() => get(query('/api/library/songs', { artist, album })));
  if (r) showSongs(r.songs, 'No songs.');
}

let searchTimer = 0;
async function search() {
  const q = $('search').value.trim();
  if (!q) return libraryHome();
  state.crumbs = [];
  state.crumbs.search = q;
  crumbBar();
  const r = await act(() => get(query('/api/library/search', { q, field: $('search-field').value })));
  if (r && $('search').value.trim() === q) showSongs(r.songs, `Nothing found for “${q}”.`);
}
$('search').addEventListener('input', () => { clearTimeout(searchTimer); searchTimer = setTimeout(search, 250); });
$('search-field').addEventListener('change', search);
$('search-form').addEventListener('submit', (e) => { e.preventDefault(); clearTimeout(searchTimer); search(); });

function renderScan(s) {
  const box = $('scan');
  box.hidden = false;
  $('scan-progress').max = Math.max(1, s.total || 0);
  $('scan-progress').value = s.done || 0;
  if (s.running) $('scan-text').textContent = `Scanning ${s.done || 0} of ${s.total || '?'}`;
  else if (s.ok === false) { $('scan-text').textContent = 'Scan failed'; showError(s.error || 'The scan failed'); }
  else {
    $('scan-text').textContent = `Done: ${s.total} songs, ${s.added} new, ${s.updated} changed, ${s.removed} removed${s.failed ? `, ${s.failed} unreadable` : ''}`;
    if (state.tab === 'library' && !state.crumbs.length && !state.crumbs.search) libraryHome();
  }
}

// ---------------------------------------------------------------------------
// Sources and radio.
async function loadSources() {
  const r = await act(() => get('/api/sources'));
  if (r) {
    const pl = $('playlists');
    if (!r.playlists.length) empty(pl, 'No saved playlists in the library.');
    else pl.replaceChildren(...r.playlists.map((p) => row(p.title, p.path,
      { dataAction: 'play-list', dataPath: p.path, 'aria-label': `Play the playlist ${p.title}` }, [])));
    const sm = $('smart');
    if (!r.smart.length) empty(sm, 'No smart playlists.');
    else sm.replaceChildren(...r.smart.map((n) => row(n, '', { dataAction: 'play-smart', dataName: n, 'aria-label': `Play the smart playlist ${n}` }, [])));
    $('slots').replaceChildren(...r.slots.map((s) => row(`Slot ${s.slot}`, s.type ? `${s.type}: ${s.name}` : 'empty',
      { dataAction: 'slot-load', dataSlot: s.slot, 'aria-label': `Play slot ${s.slot}`, disabled: !s.type },
      [button('Save current', 'slot-save', { dataSlot: s.slot }, { aria: `Save the current source in slot ${s.slot}` })])));
  }
  loadRadio();
}

async function loadRadio() {
  const r = await act(() => get(query('/api/radio', { list: state.radioList })));
  if (!r) return;
  const list = $('radio-stations');
  if (!r.stations.length) return empty(list, 'No stations in this list yet.');
  list.replaceChildren(...r.stations.map((s, i) => row(s.name, s.bitrate ? `${Math.round(s.bitrate / 1000)} kbit/s · ${s.url}` : s.url,
    { dataAction: 'radio-play', dataIndex: i, 'aria-label': `Play ${s.name}` },
    [button('Rename', 'radio-rename', { dataIndex: i, dataName: s.name }, { aria: `Rename ${s.name}`, class: 'btn small extra' }),
     button('✕', 'radio-remove', { dataIndex: i, dataName: s.name }, { aria: `Remove ${s.name}` })])));
}
$('radio-list').addEventListener('change', () => { state.radioList = $('radio-list').value; loadRadio(); });
$('radio-add').addEventListener('submit', async (e) => {
  e.preventDefault();
  const ok = await act(() => post('/api/radio/add', { list: state.radioList, name: $('radio-name').value.trim(), url: $('radio-url').value.trim() }));
  if (ok) { $('radio-name').value = ''; $('radio-url').value = ''; loadRadio(); }
});

// ---------------------------------------------------------------------------
// Players.
async function loadPlayers() {
  const r = await act(() => get('/api/players'));
  if (!r) return;
  const sel = r.selected ? r.selected.index : -1;
  const players = [{ index: -1, name: 'This device', address: 'the appliance’s own output' }, ...r.renderers];
  $('player-list').replaceChildren(...players.map((p) => row(p.name, p.address,
    { dataAction: 'player-select', dataIndex: p.index, 'aria-pressed': String(p.index === sel), 'aria-label': `Play on ${p.name}` },
    p.index === sel ? [el('span', { class: 'row-sub', text: 'selected' })] : [],
    { class: p.index === sel ? 'current' : null })));
  if (!r.renderers.length) $('player-list').append(el('li', { class: 'empty', text: 'No renderers found yet. Look for players to search the network.' }));
}

// ---------------------------------------------------------------------------
// Equalizer.
const BANDS = ['31', '62', '125', '250', '500', '1k', '2k', '4k', '8k', '16k'];
async function loadEq() {
  const r = await act(() => get('/api/equalizer'));
  if (!r) return;
  $('eq-profiles').replaceChildren(...r.profiles.map((p) => el('button', {
    type: 'button', class: 'btn small', dataAction: 'eq-profile', dataName: p.name,
    'aria-pressed': String(r.enabled && p.name === r.current), text: p.name })));
  const current = r.profiles.find((p) => p.name === r.current);
  const gains = (r.enabled && current) ? current.gains : new Array(10).fill(0);
  $('eq-bands').replaceChildren(...BANDS.map((b, i) => {
    const input = el('input', { type: 'range', min: -12, max: 12, step: 0.5, value: gains[i] || 0, name: `band${i}`, 'aria-label': `${b}Hz gain in dB` });
    const out = el('span', { text: String(gains[i] || 0) });
    input.addEventListener('input', () => { out.textContent = input.value; });
    return el('label', {}, out, input, el('span', { text: b }));
  }));
}
$('eq-bands').addEventListener('submit', async (e) => {
  e.preventDefault();
  const gains = [...$('eq-bands').querySelectorAll('input')].map((i) => Number(i.value));
  await act(() => post('/api/equalizer', { gains }));
});

// ---------------------------------------------------------------------------
// Tabs.
const loaders = { queue: loadQueue, library: () => (state.crumbs.length || state.crumbs.search ? null : libraryHome()), sources: loadSources, players: loadPlayers, eq: loadEq };
function showTab(name, focus) {
  state.tab = name;
  for (const t of document.querySelectorAll('[role=tab]')) {
    const on = t.dataset.tab === name;
    t.setAttribute('aria-selected', String(on));
    t.tabIndex = on ? 0 : -1;
    $(t.getAttribute('aria-controls')).hidden = !on;
    if (on && focus) t.focus();
  }
  if (!state.loaded[name] || name !== 'library') loaders[name]();
  state.loaded[name] = true;
}
document.querySelector('.tabs').addEventListener('keydown', (e) => {
  const tabs = [...document.querySelectorAll('[role=tab]')];
  const i = tabs.findIndex((t) => t.dataset.tab === state.tab);
  if (e.key === 'ArrowRight' || e.key === 'ArrowLeft') {
    e.preventDefault();
    showTab(tabs[(i + (e.key === 'ArrowRight' ? 1 : tabs.length - 1)) % tabs.length].dataset.tab, true);
  }
});

// ---------------------------------------------------------------------------
// One click handler for every data-action.
const actions = {
  'play-pause': () => control('play-pause'),
  stop: () => control('stop'),
  next: () => control('next'),
  previous: () => control('previous'),
  mute: () => control('mute'),
  shuffle: () => control('shuffle'),
  repeat: () => act(() => post('/api/player/repeat', { mode: ((state.status ? state.status.repeat : 1) % 3) + 1 })),
  'queue-play': (d) => act(() => post('/api/queue/play', { index: Number(d.index) })),
  'queue-remove': async (d) => { await act(() => post('/api/queue/remove', { index: Number(d.index) })); loadQueue(); },
  'queue-next': async (d) => { await act(() => post('/api/queue/move', { from: Number(d.index), next: true })); loadQueue(); },
  'queue-up': async (d) => { if (Number(d.index) > 0) { await act(() => post('/api/queue/move', { from: Number(d.index), to: Number(d.index) - 1 })); loadQueue(); } },
  'queue-down': async (d) => {
    const total = state.status ? state.status.total : 0;
    if (Number(d.index) + 1 < total) { await act(() => post('/api/queue/move', { from: Number(d.index), to: Number(d.index) + 1 })); loadQueue(); }
  },
  'queue-clear': async () => { if (confirm('Remove every song from the queue?')) { await act(() => post('/api/queue/clear')); loadQueue(); } },
  'queue-page': (d) => { state.queueStart = Math.max(0, state.queueStart + Number(d.dir) * QUEUE_PAGE); loadQueue(); },
  'lib-home': () => { $('search').value = ''; libraryHome(); },
  'lib-artist': (d) => libraryArtist(d.artist),
  'lib-album': (d) => libraryAlbum(d.artist, d.album),
  'lib-add': async (d) => {
    const r = await act(() => post('/api/library/add', { ids: String(d.ids).split(',').map(Number), where: d.where }));
    if (r) flash(`${r.added === 1 ? 'Song' : r.added + ' songs'} ${d.where === 'play' ? 'playing' : d.where === 'next' ? 'playing next' : 'added'}`);
  },
  'lib-add-set': async (d) => {
    const body = { where: d.where };
    if (d.artist !== undefined) body.artist = d.artist;
    if (d.album !== undefined) body.album = d.album;
    const r = await act(() => post('/api/library/add', body));
    if (r) flash(`${r.added} songs ${d.where === 'play' ? 'playing' : 'added'}`);
  },
  rescan: async () => { const r = await act(() => post('/api/library/rescan')); if (r) renderScan({ running: true, done: 0, total: 0 }); },
  source: (d) => act(() => post('/api/source', { kind: d.kind })),
  'play-list': (d) => act(() => post('/api/source/list', { path: d.path })),
  'play-smart': (d) => act(() => post('/api/source/list', { smart: d.name })),
  'slot-load': (d) => act(() => post('/api/source', { kind: 'custom', slot: Number(d.slot) })),
  'slot-save': async (d) => { if (await act(() => post('/api/source/save', { slot: Number(d.slot) }))) loadSources(); },
  'radio-play': (d) => act(() => post('/api/radio/play', { list: state.radioList, index: Number(d.index) })),
  'radio-rename': async (d) => {
    const name = prompt('New name of the station', d.name);
    if (name && name.trim() && await act(() => post('/api/radio/rename', { list: state.radioList, index: Number(d.index), name: name.trim() }))) loadRadio();
  },
  'radio-remove': async (d) => {
    if (confirm(`Remove ${d.name} from the list?`) && await act(() => post('/api/radio/remove', { list: state.radioList, index: Number(d.index) }))) loadRadio();
  },
  'player-select': async (d) => { if (await act(() => post('/api/players/select', { index: Number(d.index) }))) loadPlayers(); },
  'players-refresh': async () => {
    if (await act(() => post('/api/players/refresh'))) {
      flash('Looking for players…');
      setTimeout(loadPlayers, 3000);
    }
  },
  'eq-profile': async (d) => { if (await act(() => post('/api/equalizer', { name: d.name }))) loadEq(); },
  'eq-off': async () => { if (await act(() => post('/api/equalizer', { enabled: false }))) loadEq(); },
};

function flash(text) {
  $('state').textContent = text;
  setTimeout(() => { if (state.status) $('state').textContent = state.status.stateText; }, 2000);
}

document.addEventListener('click', (e) => {
  const tab = e.target.closest('[data-tab]');
  if (tab) return showTab(tab.dataset.tab);
  const go = e.target.closest('[data-tab-go]');
  if (go) return showTab(go.dataset.tabGo, true);
  const t = e.target.closest('button[data-action]');
  if (t && actions[t.dataset.action]) {
    e.preventDefault();
    actions[t.dataset.action](t.dataset);
  }
});

// Space plays and pauses unless a field or button has the key.
document.addEventListener('keydown', (e) => {
  if (e.defaultPrevented || e.ctrlKey || e.metaKey || e.altKey) return;
  const tag = e.target.tagName;
  const typing = tag === 'INPUT' || tag === 'SELECT' || tag === 'TEXTAREA' || tag === 'BUTTON' || e.target.isContentEditable;
  if (e.key === ' ' && !typing) { e.preventDefault(); control('play-pause'); }
  if (typing) return;
  if (e.key === 'n') control('next');
  if (e.key === 'p') control('previous');
  if (e.key === '/') { e.preventDefault(); showTab('library'); $('search').focus(); }
});

// ---------------------------------------------------------------------------
// Live status.
let events = null;
function connect() {
  if (events) events.close();
  events = listen({
    status: renderStatus,
    scan: renderScan,
    open: () => { if (state.status && state.status.daemon) $('alert').hidden = true; },
    error: (rs) => { if (rs === EventSource.CLOSED) { events = null; reconnect(); } },
  });
}

// The shown position moves on between updates while a song plays.
setInterval(() => { if (state.status && state.status.state === 2) renderProgress(); }, 1000);

// A stream the server refused: a password to give, or the server is away.
async function reconnect() {
  const s = await act(() => get('/api/session'));
  if (s && s.password && !s.ok) {
    await get('/api/status').catch(() => null);  // asks for the password, then connects
    loaders[state.tab]();
  } else {
    setTimeout(connect, 3000);
  }
}

connect();
showTab('queue');
