// Small DOM helpers and the list rows of the page.

export function el(tag, attrs = {}, ...children) {
  const e = document.createElement(tag);
  for (const [k, v] of Object.entries(attrs)) {
    if (v === undefined || v === null || v === false) continue;
    if (k === 'class') e.className = v;
    else if (k === 'text') e.textContent = v;
    else if (k.startsWith('data')) e.setAttribute(k.replace(/[A-Z]/g, (c) => '-' + c.toLowerCase()), v);
    else e.setAttribute(k, v === true ? '' : v);
  }
  for (const c of children) if (c !== null && c !== undefined) e.append(c);
  return e;
}

export function time(seconds) {
  seconds = Math.max(0, Math.floor(seconds || 0));
  const h = Math.floor(seconds / 3600), m = Math.floor(seconds / 60) % 60, s = seconds % 60;
  const ss = String(s).padStart(2, '0');
  return h ? `${h}:${String(m).padStart(2, '0')}:${ss}` : `${m}:${ss}`;
}

export function spokenTime(seconds) {
  seconds = Math.max(0, Math.floor(seconds || 0));
  const m = Math.floor(seconds / 60), s = seconds % 60;
  return m ? `${m} minutes ${s} seconds` : `${s} seconds`;
}

export function button(label, action, data = {}, opts = {}) {
  return el('button', { type: 'button', class: opts.class || 'btn small', dataAction: action,
    'aria-label': opts.aria, title: opts.aria, ...data, text: label });
}

// One row: a main button (title and subtitle) and action buttons.
export function row(title, sub, main, actions = [], attrs = {}) {
  const mainBtn = el('button', { type: 'button', class: 'row-main', ...main },
    el('span', { class: 'row-title', text: title || '(untitled)' }),
    sub ? el('span', { class: 'row-sub', text: sub }) : null);
  return el('li', attrs, mainBtn, el('div', { class: 'row-actions' }, ...actions));
}

export function empty(list, text) {
  list.replaceChildren(el('li', { class: 'empty', text }));
}
