// The page: sign-in, search with suggestions and filters, and folder administration, all through
// the daemon's JSON API. No framework and no build step.
'use strict';

const $ = (id) => document.getElementById(id);
const state = { me: null, from: 0, total: 0, loading: false, folder: '', seq: 0, poll: null,
                picker: '/', suggestIndex: -1 };
const PAGE = 30;

class ApiError extends Error {
  constructor(status, message) { super(message); this.status = status; }
}

async function api(method, path, body) {
  const headers = {};
  if (method !== 'GET') headers['X-CSRF-Token'] = state.me ? state.me.csrf : '';
  if (body !== undefined) headers['Content-Type'] = 'application/json';
  let res;
  try {
    res = await fetch(path, { method, headers, credentials: 'same-origin',
                              body: body === undefined ? undefined : JSON.stringify(body) });
  } catch (e) {
    throw new ApiError(0, 'The server cannot be reached. Check your connection and try again.');
  }
  let data = null;
  try { data = await res.json(); } catch (e) { data = null; }
  if (!res.ok) {
    if (res.status === 401 && path !== '/api/login' && path !== '/api/session') showSignIn();
    throw new ApiError(res.status, data && data.error ? data.error.message : res.statusText);
  }
  return data;
}

function debounce(fn, ms) {
  let t = null;
  return (...args) => { clearTimeout(t); t = setTimeout(() => fn(...args), ms); };
}

// ---- formatting in the browser's own locale

const sizeUnits = ['byte', 'kilobyte', 'megabyte', 'gigabyte', 'terabyte'];
function formatSize(bytes) {
  let v = Number(bytes) || 0, i = 0;
  while (v >= 1000 && i < sizeUnits.length - 1) { v /= 1024; ++i; }
  if (i === 0) return v.toLocaleString() + ' B';
  try {
    return new Intl.NumberFormat(undefined, { style: 'unit', unit: sizeUnits[i], unitDisplay: 'short',
                                              maximumFractionDigits: i === 0 ? 0 : 1 }).format(v);
  } catch (e) {
    return v.toFixed(i === 0 ? 0 : 1) + ' ' + ['B', 'KB', 'MB', 'GB', 'TB'][i];
  }
}
function formatDate(seconds) {
  return new Date(seconds * 1000).toLocaleString(undefined, { dateStyle: 'medium', timeStyle: 'short' });
}

function el(tag, props, ...children) {
  const node = document.createElement(tag);
  Object.assign(node, props || {});
  for (const c of children) if (c !== null && c !== undefined) node.append(c);
  return node;
}

// The engine marks matches with <b> and </b>; everything else is text, never markup.
function snippetNode(text) {
  const p = el('p', { className: 'snippet' });
  const parts = text.split(/(<b>|<\/b>)/);
  let inMark = false;
  for (const part of parts) {
    if (part === '<b>') { inMark = true; continue; }
    if (part === '</b>') { inMark = false; continue; }
    if (part) p.append(inMark ? el('mark', {}, part) : document.createTextNode(part));
  }
  return p;
}

// ---- views

function show(view) {
  for (const v of ['signin-view', 'search-view', 'admin-view']) $(v).hidden = v !== view;
  $('bar').hidden = view === 'signin-view';
  $('nav-search').classList.toggle('active', view === 'search-view');
  $('nav-admin').classList.toggle('active', view === 'admin-view');
  if (view !== 'admin-view' && state.poll) { clearInterval(state.poll); state.poll = null; }
}

function showSignIn() {
  state.me = null;
  show('signin-view');
  $('signin-user').focus();
}

function route() {
  if (!state.me) return showSignIn();
  $('who').textContent = state.me.user;
  $('nav-admin').hidden = !state.me.admin;
  if (location.hash === '#admin' && state.me.admin) {
    show('admin-view');
    refreshAdmin();
    browse(state.picker);
    state.poll = state.poll || setInterval(refreshAdmin, 2000);
  } else {
    show('search-view');
    $('q').focus();
  }
}

// ---- sign-in

$('signin-form').addEventListener('submit', async (ev) => {
  ev.preventDefault();
  $('signin-error').textContent = '';
  $('signin-button').disabled = true;
  try {
    state.me = await api('POST', '/api/login', { user: $('signin-user').value,
                                                 password: $('signin-password').value });
    $('signin-password').value = '';
    route();
  } catch (e) {
    $('signin-error').textContent = e.message;
  } finally {
    $('signin-button').disabled = false;
  }
});

$('signout').addEventListener('click', async () => {
  try { await api('POST', '/api/logout'); } catch (e) { /* signed out either way */ }
  $('results').replaceChildren();
  $('q').value = '';
  showSignIn();
});

// ---- search

function queryText() {
  const text = $('q').value.trim();
  if (!text) return '';
  // While a word is being typed it is searched as a prefix, so results follow the keys.
  return /\s$/.test($('q').value) ? text : text + '*';
}

function searchParams(from) {
  const p = new URLSearchParams();
  const q = queryText();
  if (q) p.set('q', q);
  if ($('f-kind').value) p.set('kind', $('f-kind').value);
  if ($('f-ext').value.trim()) p.set('ext', $('f-ext').value.trim());
  const size = $('f-size').value;
  if (size) {
    const [lo, hi] = size.split('-');
    if (lo) p.set('min_size', lo);
    if (hi) p.set('max_size', hi);
  }
  const days = Number($('f-date').value);
  if (days) p.set('after', String(Math.floor(Date.now() / 1000) - days * 86400));
  if (state.folder) p.set('folder', state.folder);
  const [sort, order] = $('f-sort').value.split(':');
  if (sort && sort !== 'relevance') p.set('sort', sort);
  if (order) p.set('order', order);
  p.set('from', String(from));
  p.set('size', String(PAGE));
  return p;
}

function setStatus(text, bad) {
  $('status').textContent = text;
  $('status').classList.toggle('bad', !!bad);
}

async function search(more) {
  const p = searchParams(more ? state.from : 0);
  if (!p.has('q') && !p.has('kind') && !p.has('ext') && !p.has('folder') && !p.has('min_size') &&
      !p.has('max_size') && !p.has('after')) {
    $('results').replaceChildren();
    $('more').hidden = true;
    setStatus('');
    return;
  }
  const seq = ++state.seq;
  state.loading = true;
  try {
    const res = await api('GET', '/api/search?' + p.toString());
    if (seq !== state.seq) return;  // a newer search is on its way
    if (!more) { $('results').replaceChildren(); state.from = 0; }
    for (const hit of res.hits) $('results').append(hitNode(hit));
    state.from += res.hits.length;
    state.total = res.total;
    const shown = state.from;
    if (res.total === 0) {
      setStatus(state.folder ? 'No files in this folder match. Try searching everywhere.'
                             : 'No files match. Check the spelling or remove a filter.');
    } else {
      const total = res.total.toLocaleString() + (res.total_exact ? '' : '+');
      setStatus(`${shown.toLocaleString()} of ${total} file${res.total === 1 ? '' : 's'}`);
    }
    $('more').hidden = shown >= res.total || res.hits.length === 0;
  } catch (e) {
    if (seq !== state.seq) return;
    if (!more) $('results').replaceChildren();
    $('more').hidden = true;
    setStatus(e.status === 503 ? 'Search is unavailable right now: the search engine is not ' +
                                 'running. Please tell your administrator.' : e.message, true);
  } finally {
    if (seq === state.seq) state.loading = false;
  }
}

function openFolder(folder) {
  state.folder = folder;
  $('f-folder-text').textContent = 'In ' + folder;
  $('f-folder').hidden = false;
  search(false);
}

// A folder, or a file's extension on a tile coloured by its kind.
const EXT_KINDS = {
  photo: ['jpg', 'jpeg', 'png', 'gif', 'webp', 'heic', 'tif', 'tiff', 'bmp', 'svg', 'raw'],
  audio: ['mp3', 'flac', 'ogg', 'wav', 'm4a', 'aac', 'opus'],
  video: ['mp4', 'mkv', 'mov', 'avi', 'webm', 'm4v'],
  document: ['pdf', 'doc', 'docx', 'odt', 'txt', 'md', 'rtf', 'xls', 'xlsx', 'ods', 'csv', 'ppt',
             'pptx', 'odp', 'html', 'htm'],
};
function typeIcon(hit) {
  const ext = (hit.ext || '').toLowerCase();
  let kind = 'other';
  for (const [k, list] of Object.entries(EXT_KINDS)) if (list.includes(ext)) kind = k;
  const icon = el('span', { className: 'icon ' + (hit.is_dir ? 'folder' : kind),
                            textContent: hit.is_dir ? '' : (ext || 'file').slice(0, 4) });
  icon.setAttribute('aria-hidden', 'true');
  return icon;
}

function hitNode(hit) {
  const li = el('li', { className: 'hit' });
  const icon = typeIcon(hit);
  let name;
  if (hit.is_dir) {
    name = el('a', { href: '#search', textContent: hit.name, className: 'open-folder' });
    name.addEventListener('click', (ev) => { ev.preventDefault(); openFolder(hit.path); });
  } else {
    name = el('a', { href: '/api/download?path=' + encodeURIComponent(hit.path),
                     textContent: hit.name, className: 'download' });
    name.setAttribute('download', hit.name);
  }
  const folder = el('a', { href: '#search', textContent: hit.folder, className: 'hit-folder',
                           title: 'Show the files of this folder' });
  folder.addEventListener('click', (ev) => { ev.preventDefault(); openFolder(hit.folder); });
  const meta = el('div', { className: 'hit-meta' }, folder,
                  hit.is_dir ? null : el('span', { textContent: formatSize(hit.size) }),
                  el('span', { textContent: formatDate(hit.mtime) }));
  li.append(el('div', { className: 'hit-name' }, icon, name), meta);
  if (hit.snippet) li.append(snippetNode(hit.snippet));
  return li;
}

const searchSoon = debounce(() => search(false), 250);

// ---- suggestions

function lastWord() {
  const m = $('q').value.match(/(\S+)$/);
  return m ? m[1] : '';
}

async function suggest() {
  const word = lastWord();
  if (word.length < 2) return hideSuggestions();
  try {
    const res = await api('GET', '/api/suggest?prefix=' + encodeURIComponent(word));
    if (lastWord() !== word) return;
    const list = $('suggestions');
    list.replaceChildren();
    state.suggestIndex = -1;
    for (const s of res.suggestions || []) {
      if (s.toLowerCase() === word.toLowerCase()) continue;
      const li = el('li', { textContent: s, role: 'option' });
      li.addEventListener('mousedown', (ev) => { ev.preventDefault(); takeSuggestion(s); });
      list.append(li);
    }
    list.hidden = list.children.length === 0;
  } catch (e) {
    hideSuggestions();
  }
}

function hideSuggestions() { $('suggestions').hidden = true; state.suggestIndex = -1; }

function takeSuggestion(word) {
  $('q').value = $('q').value.replace(/(\S+)$/, word) + ' ';
  hideSuggestions();
  search(false);
  $('q').focus();
}

const suggestSoon = debounce(suggest, 150);

$('q').addEventListener('input', () => { suggestSoon(); searchSoon(); });
$('q').addEventListener('blur', () => setTimeout(hideSuggestions, 100));
$('q').addEventListener('keydown', (ev) => {
  const items = $('suggestions').children;
  const open = !$('suggestions').hidden && items.length > 0;
  if (ev.key === 'ArrowDown' && open) {
    ev.preventDefault();
    state.suggestIndex = Math.min(items.length - 1, state.suggestIndex + 1);
  } else if (ev.key === 'ArrowUp' && open) {
    ev.preventDefault();
    state.suggestIndex = Math.max(-1, state.suggestIndex - 1);
  } else if (ev.key === 'Enter') {
    ev.preventDefault();
    if (open && state.suggestIndex >= 0) return takeSuggestion(items[state.suggestIndex].textContent);
    hideSuggestions();
    search(false);
    return;
  } else if (ev.key === 'Escape') {
    hideSuggestions();
    return;
  } else if (ev.key === 'ArrowDown') {
    // Down from the box walks into the results.
    const first = document.querySelector('.results a');
    if (first) { ev.preventDefault(); first.focus(); }
    return;
  } else {
    return;
  }
  [...items].forEach((li, i) => li.classList.toggle('active', i === state.suggestIndex));
});

// Up and down move between hits; "/" goes back to the box.
document.addEventListener('keydown', (ev) => {
  if (ev.key === '/' && document.activeElement !== $('q') &&
      !['INPUT', 'SELECT', 'TEXTAREA'].includes(document.activeElement.tagName)) {
    ev.preventDefault();
    $('q').focus();
    return;
  }
  const a = document.activeElement;
  if (!a || !a.closest || !a.closest('.results') || !['ArrowDown', 'ArrowUp'].includes(ev.key)) return;
  const links = [...document.querySelectorAll('.results .hit-name a')];
  const i = links.indexOf(a.closest('li').querySelector('.hit-name a'));
  ev.preventDefault();
  if (ev.key === 'ArrowUp' && i <= 0) return $('q').focus();
  const next = links[ev.key === 'ArrowDown' ? i + 1 : i - 1];
  if (next) next.focus();
});

for (const id of ['f-kind', 'f-size', 'f-date', 'f-sort']) $(id).addEventListener('change', () => search(false));
$('f-ext').addEventListener('input', searchSoon);
$('f-folder-clear').addEventListener('click', () => {
  state.folder = '';
  $('f-folder').hidden = true;
  search(false);
});
$('more').addEventListener('click', () => search(true));
// Endless scroll: the next page comes when the button scrolls into view.
if ('IntersectionObserver' in window) {
  new IntersectionObserver((entries) => {
    if (entries.some((e) => e.isIntersecting) && !$('more').hidden && !state.loading) search(true);
  }).observe($('more'));
}

// ---- administration

const KINDS = ['document', 'photo', 'audio', 'video'];
const KIND_NAMES = { document: 'Documents', photo: 'Photos', audio: 'Audio', video: 'Video' };

function adminError(e) { $('admin-error').textContent = e ? e.message : ''; }

async function adminCall(method, path, body) {
  adminError(null);
  try {
    await api(method, path, body);
    await refreshAdmin();
  } catch (e) {
    adminError(e);
  }
}

function folderRow(f, shares) {
  const status = (f.additional && f.additional.status) || {};
  const text = status.text || 'unknown';
  const share = shares.find((s) => f.path.startsWith('/' + s.share + '/') || f.path === '/' + s.share) || {};
  const kinds = el('div', { className: 'kinds' });
  for (const k of KINDS) {
    const box = el('input', { type: 'checkbox', checked: !!f[k] });
    box.addEventListener('change', () => adminCall('PUT', '/api/admin/folders', { path: f.path, [k]: box.checked }));
    kinds.append(el('label', {}, box, ' ' + KIND_NAMES[k]));
  }
  const badge = el('span', { className: 'badge ' + text, textContent: text.replace('_', ' ') });
  badge.dataset.path = f.path;
  const statusCell = el('td', { className: 'status-cell' }, badge);
  if (text === 'processing') {
    const done = Number(share.ops_done || 0), pending = Number(share.ops_pending || 0) + Number(share.queued || 0);
    const bar = el('div', { className: 'progress' }, el('div'));
    const pct = done + pending > 0 ? Math.round(100 * done / (done + pending)) : 0;
    bar.firstChild.style.width = pct + '%';
    statusCell.append(bar, el('div', { className: 'hit-meta', textContent:
      `${done.toLocaleString()} done, ${pending.toLocaleString()} waiting` }));
  }
  if (status.desc) statusCell.append(el('div', { className: 'err-text', textContent: status.desc }));
  const reindex = el('button', { type: 'button', textContent: 'Re-index' });
  reindex.addEventListener('click', () => adminCall('POST', '/api/admin/reindex', { paths: [f.path] }));
  const remove = el('button', { type: 'button', textContent: 'Remove', className: 'danger' });
  remove.addEventListener('click', () => {
    if (confirm(`Stop indexing ${f.path}? Its files leave the search results.`)) {
      adminCall('DELETE', '/api/admin/folders', { paths: [f.path] });
    }
  });
  return el('tr', {},
            el('td', {}, el('strong', { textContent: f.name }), el('div', { className: 'hit-meta', textContent: f.path })),
            el('td', {}, kinds), statusCell,
            el('td', {}, el('div', { className: 'actions' }, reindex, remove)));
}

async function refreshAdmin() {
  let st;
  try {
    st = await api('GET', '/api/admin/status');
  } catch (e) {
    adminError(e);
    return;
  }
  const rows = $('folder-rows');
  rows.replaceChildren();
  for (const f of st.folders) rows.append(folderRow(f, st.shares));
  if (st.folders.length === 0) {
    rows.append(el('tr', {}, el('td', { colSpan: 4, className: 'hit-meta',
                                        textContent: 'No folders are indexed yet: add one below.' })));
  }
  const shares = $('share-rows');
  shares.replaceChildren();
  for (const s of st.shares) {
    const errs = el('td', {}, String(s.errors === undefined ? '–' : s.errors));
    if (s.last_error) errs.append(el('div', { className: 'err-text', textContent: s.last_error }));
    for (const [flag, text] of [['queue_no_space', 'queue volume full'], ['watch_limit', 'watch limit reached'],
                                ['need_reindex', 'needs re-index'], ['out_of_space', 'out of space']]) {
      if (s[flag]) errs.append(el('div', { className: 'err-text', textContent: text }));
    }
    shares.append(el('tr', {}, el('td', { textContent: s.share }),
                     el('td', { textContent: Number(s.queued || 0).toLocaleString() }),
                     el('td', { textContent: s.ops_done === undefined ? '–' : Number(s.ops_done).toLocaleString() }),
                     el('td', { textContent: s.documents_written === undefined ? '–' : Number(s.documents_written).toLocaleString() }),
                     errs));
  }
  if (!st.indexer_running) adminError({ message: 'The indexing daemon (fileindexd) is not running: changes wait until it starts.' });
  const paused = st.paused;
  $('pause').hidden = paused;
  $('pause-until').parentElement.hidden = paused;
  $('resume').hidden = !paused;
  $('pause-state').textContent = paused
    ? 'Indexing is paused' + (st.resume_time > 0 ? ' until ' + formatDate(st.resume_time) : '') + '.'
    : 'Indexing is running.';
}

async function browse(path) {
  try {
    const res = await api('GET', '/api/admin/browse?path=' + encodeURIComponent(path));
    state.picker = res.path;
    $('picker-path').textContent = res.path;
    $('picker-up').disabled = res.path === '/';
    $('add-button').disabled = res.path === '/';
    const list = $('picker-list');
    list.replaceChildren();
    for (const f of res.folders) {
      const b = el('button', { type: 'button' }, el('span', { className: 'icon folder' }),
                   f.substring(f.lastIndexOf('/') + 1));
      b.addEventListener('click', () => browse(f));
      list.append(el('li', {}, b));
    }
    if (res.folders.length === 0) list.append(el('li', { className: 'hit-meta', textContent: '   no folders below' }));
  } catch (e) {
    adminError(e);
  }
}

$('picker-up').addEventListener('click', () => {
  const p = state.picker;
  browse(p.lastIndexOf('/') <= 0 ? '/' : p.substring(0, p.lastIndexOf('/')));
});

$('add-form').addEventListener('submit', (ev) => {
  ev.preventDefault();
  const body = { path: state.picker };
  for (const k of KINDS) body[k] = $('add-' + k).checked;
  adminCall('POST', '/api/admin/folders', body);
});

$('pause').addEventListener('click', () => {
  const until = $('pause-until').value;
  const body = until ? { until: Math.floor(new Date(until).getTime() / 1000) } : { hours: 0 };
  adminCall('POST', '/api/admin/pause', body);
});
$('resume').addEventListener('click', () => adminCall('POST', '/api/admin/resume', {}));

window.addEventListener('hashchange', route);

(async () => {
  try {
    state.me = await api('GET', '/api/session');
  } catch (e) {
    state.me = null;
  }
  route();
})();
