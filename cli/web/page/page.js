// The page of "fileindex web". Everything that comes from the server may hold what stands in other
// people's files, so it is put into the page as text and never as markup.
//
// File names are bytes. Replies are read byte by byte, so each string here from the server is a "byte
// string", whose characters are bytes; shown() and escaped() make text and parts of addresses of it.
'use strict';

const kPageSize = 20;
const kFolderPage = 100;
const kStatusEvery = 2000;
const kPatience = 30000;
const kFilters = ['name', 'type', 'below', 'larger', 'smaller', 'newer', 'older', 'sort'];
const kFolderTypes = ['document', 'audio', 'video', 'photo'];

const byId = (id) => document.getElementById(id);

// ---- Bytes and text

const encoder = new TextEncoder();
const strictDecoder = new TextDecoder('utf-8', {fatal: true, ignoreBOM: true});

function bytesToString(bytes) {
  let text = '';
  for (let at = 0; at < bytes.length; at += 8192) {
    text += String.fromCharCode(...bytes.subarray(at, at + 8192));
  }
  return text;
}

const toBytes = (text) => bytesToString(encoder.encode(text));

// For an address: all but letters and digits as %XX, so that any byte comes through.
const escaped = (bytes) => bytes.replace(/[^A-Za-z0-9]/g,
    (c) => '%' + c.charCodeAt(0).toString(16).padStart(2, '0'));

// The other way round.
const unescaped = (text) => text.replace(/%([0-9A-Fa-f]{2})/g, (_, digits) => String.fromCharCode(parseInt(digits, 16)));

const kNotText = /[\u0000-\u001f\u007f-\u009f\u061c\u200e\u200f\u2028-\u202e\u2066-\u2069\ufeff]/u;
const octal = (byte) => '\\' + byte.toString(8).padStart(3, '0');

// Cuts a byte string into what can be shown as it is and what cannot: bytes that are no UTF-8, and
// characters that would drive the line (control characters and changes of direction).
function pieces(bytes) {
  const found = [];
  const add = (text, plain) => {
    const last = found.at(-1);
    if (last && last.plain === plain) {
      last.text += text;
    } else {
      found.push({text, plain});
    }
  };
  for (let at = 0; at < bytes.length;) {
    const first = bytes.charCodeAt(at);
    const length = first < 0x80 ? 1 : first < 0xe0 ? 2 : first < 0xf0 ? 3 : 4;
    const raw = bytes.slice(at, at + length);
    let text = null;
    try {
      text = strictDecoder.decode(Uint8Array.from(raw, (c) => c.charCodeAt(0)));
    } catch {
      // Not UTF-8.
    }
    if (text === null) {
      add(octal(first), false);
      at += 1;
    } else {
      if (kNotText.test(text)) {
        for (const c of raw) {
          add(octal(c.charCodeAt(0)), false);
        }
      } else {
        add(text, true);
      }
      at += length;
    }
  }
  return found;
}

const shown = (bytes) => pieces(bytes).map((piece) => piece.text).join('');

// ---- Elements

function make(tag, className, ...children) {
  const element = document.createElement(tag);
  if (className) {
    element.className = className;
  }
  element.append(...children);
  return element;
}

// A name or path, with a mark on what is no text.
function makeName(className, bytes) {
  const element = make('span', className);
  for (const piece of pieces(bytes)) {
    element.append(piece.plain ? piece.text : make('span', 'escape', piece.text));
  }
  return element;
}

// What was looked for stands between U+0002 and U+0003.
function makeSnippet(bytes) {
  const element = make('p', 'snippet');
  for (const part of bytes.split('\u0002')) {
    const end = part.indexOf('\u0003');
    if (end >= 0) {
      element.append(make('mark', '', shown(part.slice(0, end))));
    }
    element.append(shown(part.slice(end + 1)));
  }
  return element;
}

function makeButton(label, className, onClick) {
  const button = make('button', className, label);
  button.type = 'button';
  button.addEventListener('click', onClick);
  return button;
}

// A button that is `disabled` would lose the keyboard's focus.
function setUsable(button, usable) {
  button.setAttribute('aria-disabled', String(!usable));
}

const isUsable = (button) => button.getAttribute('aria-disabled') !== 'true';

const grouped = (number) => Number(number || 0).toLocaleString('en-US');
const counted = (number, noun) => `${grouped(number)} ${noun}${number === 1 ? '' : 's'}`;

function sizeText(bytes) {
  const units = ['bytes', 'KiB', 'MiB', 'GiB', 'TiB'];
  let power = 0;
  let size = bytes;
  while (size >= 1024 && power + 1 < units.length) {
    size /= 1024;
    power += 1;
  }
  return power === 0 ? counted(size, 'byte') : `${size.toFixed(size < 10 ? 1 : 0)} ${units[power]}`;
}

function timeText(seconds) {
  return new Date(seconds * 1000).toLocaleString([], {dateStyle: 'medium', timeStyle: 'short'});
}

// ---- The server

const kTokenKey = 'fileindex-token';
let token = sessionStorage.getItem(kTokenKey) || '';

function setToken(text) {
  token = text;
  sessionStorage.setItem(kTokenKey, text);
}

class Problem extends Error {}

// `query` maps names to byte strings. Throws Problem with words for people.
async function ask(method, path, query = {}) {
  const fields = Object.entries(query).filter(([, value]) => value !== '')
      .map(([name, value]) => `${name}=${escaped(String(value))}`);
  let response = null;
  let text = '';
  try {
    response = await fetch(path + (fields.length ? '?' + fields.join('&') : ''), {
      method,
      headers: {'X-Fileindex-Token': token},
      credentials: 'omit',
      cache: 'no-store',
      signal: AbortSignal.timeout(kPatience),
    });
    text = bytesToString(new Uint8Array(await response.arrayBuffer()));
  } catch (error) {
    throw new Problem(error.name === 'TimeoutError' ?
        'No answer came within half a minute.' :
        'Nobody answers any more: is ‘fileindex web’ still running?');
  }
  if (response.status === 401) {
    setToken('');
    showToken();
  }
  let reply = null;
  try {
    reply = JSON.parse(text);
  } catch {
    throw new Problem(`The answer cannot be read (status ${response.status}).`);
  }
  if (!response.ok) {
    const message = shown(reply?.error?.message ?? `status ${response.status}`);
    throw new Problem(message.charAt(0).toUpperCase() + message.slice(1) + '.');
  }
  return reply;
}

// One line for each cause, so that one that goes on does not hide another one's end.
const problems = new Map();

function setProblem(cause, error) {
  if (error && !(error instanceof Problem)) {
    throw error;
  }
  if (error) {
    problems.set(cause, error.message);
  } else {
    problems.delete(cause);
  }
  const text = [...new Set(problems.values())].join(' ');
  const line = byId('problem');
  if (line.textContent !== text) {
    line.textContent = text;
  }
  line.hidden = text === '';
}

// ---- What the address holds: the view, what is looked for, and the page, as #name=value&...

let place = {};

function readPlace() {
  const found = {};
  for (const field of location.hash.slice(1).split('&')) {
    const at = field.indexOf('=');
    if (at > 0) {
      found[field.slice(0, at)] = unescaped(field.slice(at + 1));
    }
  }
  return found;
}

function hashOf(fields) {
  return '#' + Object.entries(fields).filter(([, value]) => value !== '')
      .map(([name, value]) => `${name}=${escaped(String(value))}`).join('&');
}

function go(fields) {
  const hash = hashOf(fields);
  if (hash === location.hash) {
    show();
  } else {
    location.hash = hash;
  }
}

// ---- Search

// A folder whose name is no text cannot stand in a field; the field then shows it and this holds it.
let exactBelow = null;

function setBelow(bytes) {
  const text = shown(bytes);
  byId('below').value = text;
  exactBelow = toBytes(text) === bytes ? null : {text, bytes};
}

function readForm() {
  const fields = {view: 'search', words: toBytes(byId('words').value.trim())};
  for (const name of kFilters) {
    fields[name] = toBytes(byId(name).value.trim());
  }
  if (exactBelow && byId('below').value.trim() === exactBelow.text) {
    fields.below = exactBelow.bytes;
  }
  return fields;
}

function fillForm(fields) {
  byId('words').value = shown(fields.words || '');
  for (const name of kFilters) {
    if (name === 'below') {
      setBelow(fields.below || '');
    } else {
      byId(name).value = shown(fields[name] || '');
    }
  }
  countFilters(fields);
}

function countFilters(fields) {
  const count = kFilters.filter((name) => fields[name]).length;
  byId('filter-count').textContent = count ? ` (${count})` : '';
}

function splitPath(bytes) {
  const at = bytes.lastIndexOf('/');
  return [bytes.slice(0, at) || '/', bytes.slice(at + 1)];
}

function makeHit(hit) {
  const [folder] = splitPath(hit.path);
  const item = make('li', '', make('h3', '', makeName('name', hit.name || hit.path)));
  const below = makeButton(makeName('path', folder), 'link',
      () => go({...readForm(), below: folder}));
  below.setAttribute('aria-label', `Search only in ${shown(folder)}`);
  below.title = 'Search only in this folder';
  item.append(make('p', '', below));
  if (hit.snippet) {
    item.append(makeSnippet(hit.snippet));
  }
  const facts = make('p', 'facts');
  if (hit.is_dir) {
    facts.append(make('span', '', 'folder'));
  } else if (Number.isFinite(hit.size)) {
    facts.append(make('span', '', sizeText(hit.size)));
  }
  if (hit.modified) {
    facts.append(make('span', '', timeText(hit.modified)));
  }
  const path = shown(hit.path);
  if (toBytes(path) === hit.path) {  // The clipboard takes text only.
    const copy = makeButton('Copy path', 'link', async () => {
      await navigator.clipboard.writeText(path);
      copy.textContent = 'Copied';
    });
    facts.append(copy);
  }
  item.append(facts);
  item.tabIndex = -1;
  return item;
}

function summaryOf(reply, from) {
  const count = reply.data.length;
  const total = Number(reply.total || 0);
  let text = total === 0 ? 'Nothing was found.' :
      count === 0 ? `${counted(total, 'file')} found, none on this page.` :
      total > count ? `${counted(total, 'file')} found, ${grouped(from + 1)} to ${grouped(from + count)} shown.` :
      `${counted(total, 'file')} found.`;
  for (const index of reply.skipped || []) {
    text += ` Not searched: ${shown(index.id)} (error ${index.code}).`;
  }
  return text;
}

let searches = 0;

async function search() {
  const {view, from: fromText, ...looked} = place;
  const from = Number(fromText) || 0;
  const mine = ++searches;
  const list = byId('results');
  if (Object.values(looked).every((value) => value === '')) {
    list.replaceChildren();
    byId('pages').hidden = true;
    byId('summary').textContent = 'Type what the files hold: words of their text, their names or their metadata.';
    setProblem('search', null);
    return;
  }
  list.classList.add('waiting');
  list.setAttribute('aria-busy', 'true');
  let reply = {data: [], total: 0};
  let summary = '';
  try {
    reply = await ask('GET', '/api/search', {...looked, from, limit: kPageSize});
    reply.data = reply.data || [];
    summary = summaryOf(reply, from);
    if (mine === searches) {
      setProblem('search', null);
    }
  } catch (error) {
    if (mine === searches) {
      setProblem('search', error);
    }
  }
  if (mine !== searches) {
    return;
  }
  list.classList.remove('waiting');
  list.removeAttribute('aria-busy');
  list.start = from + 1;
  list.replaceChildren(...reply.data.map(makeHit));
  if (list.firstElementChild) {
    list.firstElementChild.tabIndex = 0;
  }
  byId('summary').textContent = summary;
  const total = Number(reply.total || 0);
  byId('pages').hidden = total <= kPageSize;
  setUsable(byId('previous'), from > 0);
  setUsable(byId('next'), from + reply.data.length < total);
  byId('page-text').textContent = `Page ${grouped(Math.floor(from / kPageSize) + 1)} of ${grouped(Math.ceil(total / kPageSize))}`;
}

function turnPage(button, pages) {
  if (!isUsable(button)) {
    return;
  }
  const from = Math.max(0, (Number(place.from) || 0) + pages * kPageSize);
  go({...place, from: from || ''});
  byId('words').scrollIntoView();
}

function focusHit(item) {
  const list = byId('results');
  if (!item) {
    return;
  }
  for (const other of list.children) {
    other.tabIndex = other === item ? 0 : -1;
  }
  item.focus();
}

function onKey(event) {
  if (event.ctrlKey || event.altKey || event.metaKey) {
    return;
  }
  const target = event.target;
  const is_field = target.matches('input, select, textarea');
  if (event.key === '/' && !is_field) {
    event.preventDefault();
    if (place.view === 'folders') {
      go({...readForm()});
    }
    byId('words').focus();
    byId('words').select();
    return;
  }
  const step = {ArrowDown: 1, ArrowUp: -1}[event.key];
  const hit = target.closest('#results > li');
  if (!step || (!hit && (target.id !== 'words' || step < 0))) {
    return;
  }
  event.preventDefault();
  if (!hit) {
    focusHit(byId('results').firstElementChild);
  } else if (step < 0 && !hit.previousElementSibling) {
    byId('words').focus();
  } else {
    focusHit(step > 0 ? hit.nextElementSibling : hit.previousElementSibling);
  }
}

// ---- Folders, shares, daemons

const kWords = {
  finished: ['good', 'finished'],
  idle: ['good', 'up to date'],
  processing: ['', 'being indexed'],
  crawling: ['', 'being compared with the disk'],
  paused: ['warn', 'paused'],
  need_reindex: ['warn', 'needs a reindex'],
  unavailable: ['warn', 'cannot be reached'],
  failing: ['bad', 'failing'],
  error: ['bad', 'cannot be indexed'],
};

function makeState(word) {
  const [className, text] = kWords[word] || ['', shown(word)];
  return make('span', className, text);
}

// So that what is read or focused is not pulled away by an equal one.
function replaceList(list, items) {
  const now = make('div', '', ...items);
  if (list.textContent !== now.textContent || list.childElementCount !== items.length) {
    list.replaceChildren(...items);
  }
}

function makeFolder(folder) {
  const status = folder.additional?.status || {};
  const types = kFolderTypes.filter((type) => folder[type]);
  const item = make('li', '', make('h3', '', makeName('name', folder.name || folder.path), makeState(status.text || '')),
      make('p', '', makeName('path', folder.full_path || folder.path)),
      make('p', 'facts', make('span', '', types.length ? `contents of: ${types.join(', ')}` : 'names only')));
  if (folder.group) {
    item.lastElementChild.append(make('span', '', 'group ', makeName('name', folder.group)));
  }
  if (status.desc) {
    item.append(make('p', 'bad', status.desc === 'invalid_path' ?
        '‘fileindex explain’ says why the path cannot be indexed.' : shown(status.desc)));
  }
  if (folder.full_path) {
    item.append(make('p', '', makeButton('Search in this folder', 'link',
        () => go({view: 'search', below: folder.full_path}))));
  }
  if (status.text === 'need_reindex') {
    item.append(make('p', 'hint', '‘fileindex folder reindex’ makes up for what was missed.'));
  }
  return item;
}

let foldersShown = kFolderPage;

async function loadFolders() {
  const reply = await ask('GET', '/api/folders', {limit: Math.min(foldersShown, 1000)});
  const folders = reply.folder || [];
  replaceList(byId('folders'), folders.map(makeFolder));
  byId('no-folders').hidden = folders.length > 0;
  byId('more-folders').hidden = folders.length >= Number(reply.total || 0);
}

function makeShare(share) {
  const item = make('li', '', make('h3', '', makeName('name', share.share), makeState(share.state)));
  const done = Number(share.progress?.done || 0);
  const found = Number(share.progress?.found || 0);
  if (share.state === 'crawling' && found > 0) {
    const bar = make('progress');
    bar.max = found;
    bar.value = done;
    bar.setAttribute('aria-label', 'paths compared');
    item.append(bar, make('p', 'facts', `${grouped(done)} of ${grouped(found)} paths found so far`));
  }
  const facts = make('p', 'facts',
      make('span', '', `${counted(Number(share.operations || 0), 'change')} and ${counted(Number(share.files || 0), 'file')} done`));
  if (share.queue_lines) {
    facts.append(make('span', '', `about ${counted(share.queue_lines, 'change')} wait`));
  }
  if (share.rate > 0) {
    facts.append(make('span', '', `${grouped(Math.round(share.rate))} files a second`));
  }
  item.append(facts);
  const watch = share.watch;
  if (!watch || watch.reason) {
    item.append(make('p', 'warn', watch ? `Watching is ${shown(watch.state || '')}: ${shown(watch.reason)}` : 'Changes are not watched.'));
  }
  if (share.last_error) {
    item.append(make('p', 'warn', `Last error: ${shown(share.last_error)}`));
  }
  return item;
}

let isPaused = false;

function showStatus(status) {
  const until = Number(status.resume_time);
  isPaused = until === 0 || until * 1000 > Date.now();
  const silent = (status.daemons || []).filter((daemon) => daemon.running === false).map((daemon) => daemon.name);
  const text = isPaused ? (until === 0 ? 'Indexing is paused.' : `Indexing is paused until ${timeText(until)}.`) :
      status.status === 'finished' ? 'Everything can be found.' : 'Changes are being indexed.';
  const state = byId('state');
  const line = silent.length ? `Not running: ${silent.join(', ')}.` : text;
  if (state.textContent !== line) {
    state.textContent = line;
  }
  state.className = 'state ' + (silent.length ? 'bad' : isPaused ? 'warn' : '');
  byId('pause-text').textContent = isPaused ? `${text} Changes are collected and wait.` : text;
  byId('pause-for').hidden = isPaused;
  byId('pause').textContent = isPaused ? 'Resume' : 'Pause';
  replaceList(byId('shares'), (status.shares || []).map(makeShare));
  replaceList(byId('daemons'), (status.daemons || []).map((daemon) =>
      make('li', '', make('span', '', daemon.name + ' '),
          daemon.running === null ? make('span', '', 'is closed to you') :
              make('span', daemon.running ? 'good' : 'bad', daemon.running ? 'runs' : 'does not answer'))));
}

async function changePause() {
  if (!isUsable(byId('pause'))) {
    return;
  }
  setUsable(byId('pause'), false);
  try {
    showStatus(isPaused ? await ask('POST', '/api/resume') :
        await ask('POST', '/api/pause', {hours: byId('hours').value}));
    setProblem('pause', null);
  } catch (error) {
    setProblem('pause', error);
  }
  setUsable(byId('pause'), true);
  loadFolders().catch((error) => setProblem('status', error));
}

async function follow() {
  if (token !== '' && document.visibilityState === 'visible') {
    try {
      showStatus(await ask('GET', '/api/status'));
      if (place.view === 'folders') {
        await loadFolders();
      }
      setProblem('status', null);
    } catch (error) {
      setProblem('status', error);
    }
  }
  setTimeout(follow, kStatusEvery);
}

async function suggestFolders() {
  try {
    const reply = await ask('GET', '/api/folders', {limit: 1000});
    byId('known-folders').replaceChildren(...(reply.folder || []).filter((folder) => folder.full_path).map((folder) => {
      const option = make('option');
      option.value = shown(folder.full_path);
      return option;
    }));
  } catch {
    // The field does without, and what is wrong is said where it matters.
  }
}

// ---- Views

function showToken() {
  byId('token-form').hidden = false;
  byId('search-view').hidden = true;
  byId('folders-view').hidden = true;
  byId('token').focus();
}

function show() {
  const found = readPlace();
  if (found.token) {
    // Out of the address and the history, so that it is not copied along with them.
    setToken(found.token);
    delete found.token;
    history.replaceState(null, '', location.pathname + hashOf(found));
    problems.clear();
    setProblem('status', null);
  }
  place = {view: 'search', ...found};
  if (token === '') {
    showToken();
    return;
  }
  const wantsFolders = place.view === 'folders';
  byId('token-form').hidden = true;
  byId('search-view').hidden = wantsFolders;
  byId('folders-view').hidden = !wantsFolders;
  const [here, away] = wantsFolders ? ['to-folders', 'to-search'] : ['to-search', 'to-folders'];
  byId(here).setAttribute('aria-current', 'page');
  byId(away).removeAttribute('aria-current');
  if (wantsFolders) {
    searches += 1;  // What is still looked for is not wanted any more.
    setProblem('search', null);
    loadFolders().then(() => setProblem('status', null), (error) => setProblem('status', error));
  } else {
    byId('to-search').hash = hashOf(place);  // The way back from the folders.
    fillForm(place);
    search();
  }
}

byId('token-form').addEventListener('submit', (event) => {
  event.preventDefault();
  // The whole address will do, too.
  setToken(byId('token').value.trim().replace(/^.*token=/, ''));
  byId('token').value = '';
  show();
});
byId('search').addEventListener('submit', (event) => {
  event.preventDefault();
  if (matchMedia('(max-width: 34rem)').matches) {
    byId('filters').open = false;  // They would hide what is found.
  }
  go(readForm());
});
byId('filters').addEventListener('change', () => countFilters(readForm()));
byId('filters').addEventListener('toggle', suggestFolders);
byId('clear').addEventListener('click', () => go({view: 'search', words: readForm().words}));
byId('previous').addEventListener('click', (event) => turnPage(event.currentTarget, -1));
byId('next').addEventListener('click', (event) => turnPage(event.currentTarget, 1));
byId('pausing').addEventListener('submit', (event) => {
  event.preventDefault();
  changePause();
});
byId('more-folders').addEventListener('click', () => {
  foldersShown += kFolderPage;
  loadFolders().catch((error) => setProblem('status', error));
});
document.addEventListener('keydown', onKey);
window.addEventListener('hashchange', show);
show();
if (token !== '' && place.view === 'search') {
  byId('words').focus();
}
follow();
