// The remote's JSON API: reads are GET, every change a POST with JSON.
// Errors come back as exceptions whose message is the server's reason.

export class ApiError extends Error {
  constructor(message, status) {
    super(message);
    this.status = status;
  }
}

let onLogin = null;
export function setLoginHandler(fn) { onLogin = fn; }

async function call(method, path, body) {
  const init = { method, headers: {}, credentials: 'same-origin' };
  if (body !== undefined) {
    init.headers['Content-Type'] = 'application/json';
    init.body = JSON.stringify(body);
  }
  let res;
  try {
    res = await fetch(path, init);
  } catch (e) {
    throw new ApiError('The music server cannot be reached', 0);
  }
  let data = null;
  try { data = await res.json(); } catch (e) { data = null; }
  if (res.status === 401 && onLogin) {
    await onLogin();
    return call(method, path, body);
  }
  if (!res.ok) throw new ApiError((data && data.error) || `The server answered ${res.status}`, res.status);
  return data;
}

export const get = (path) => call('GET', path);
export const post = (path, body = {}) => call('POST', path, body);

export function query(path, params) {
  const q = new URLSearchParams();
  for (const [k, v] of Object.entries(params)) if (v !== undefined && v !== null) q.set(k, v);
  const s = q.toString();
  return s ? `${path}?${s}` : path;
}

// Live status: Server-Sent Events; the browser reconnects by itself.
export function listen(handlers) {
  const es = new EventSource('/api/events');
  es.addEventListener('status', (e) => handlers.status(JSON.parse(e.data)));
  es.addEventListener('scan', (e) => handlers.scan && handlers.scan(JSON.parse(e.data)));
  es.addEventListener('open', () => handlers.open && handlers.open());
  es.addEventListener('error', () => handlers.error && handlers.error(es.readyState));
  return es;
}
