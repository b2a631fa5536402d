// The document browser.

import { h, icon, button, paced, later } from './dom.js';
import * as format from './format.js';
import { call, listen, signIn, signOut, fileAddress, archiveAddress, ROOT, SignedOut } from './rpc.js';
import { openFolder, FolderWatch, QuerySource } from './sources.js';
import { Rows } from './rows.js';
import { Works, entriesOf, entriesOfFiles } from './works.js';
import * as dialogs from './dialogs.js';

const app = document.getElementById('app');
const WRITE = 2;
const CAN = { move: 4, rename: 8, trash: 16, delete: 32 };
const ITEMS = 'application/x-cindral-items';
const REFRESH_INTERVAL = 120;
const SEARCH_DELAY = 150;
const PLACES_DELAY = 250;

const settings = {
  get layout() { return localStorage.getItem('layout') ?? 'list'; },
  set layout(value) { localStorage.setItem('layout', value); },
  get sort() { return JSON.parse(localStorage.getItem('sort') ?? 'null') ?? { by: 'name', descending: false }; },
  set sort(value) { localStorage.setItem('sort', JSON.stringify(value)); },
};

let view = null; // {kind, container, title, ...} of what is shown.
let source = null;
let opening = 0;
let knownTags = [];
let clipboard = null; // {items, isCut}
let hasSession = false;

// MARK: The page's parts

const status = h('p', { class: 'unseen', role: 'status', 'aria-live': 'polite' });
const places = h('nav', { class: 'places', id: 'places', 'aria-label': 'Places' });
const path = h('nav', { class: 'path', 'aria-label': 'Path' });
const search = h('input', { type: 'search', id: 'search', placeholder: 'Search', 'aria-label': 'Search all documents', autocomplete: 'off' });
const toolbar = h('div', { class: 'toolbar', role: 'toolbar', 'aria-label': 'Works' });
const state = h('div', { class: 'state' });
const information = h('aside', { class: 'details', 'aria-label': 'Information', hidden: true, tabIndex: 0 });
const messages = h('div', { class: 'messages' });
const works = h('div', { class: 'works', role: 'region', 'aria-label': 'Works under way', hidden: true });
const files = h('input', { type: 'file', multiple: true, hidden: true, 'aria-label': 'Documents to upload', id: 'files' });
const folders = h('input', { type: 'file', webkitdirectory: true, hidden: true, 'aria-label': 'Folder to upload', id: 'folders' });
const placesButton = button('Places', () => {
  const isOpen = document.body.classList.toggle('places-open');
  placesButton.setAttribute('aria-expanded', isOpen);
}, { class: 'places-button', 'aria-expanded': 'false', 'aria-controls': 'places' });

const rows = new Rows({
  open: (item) => open(item),
  selectionChanged: () => drawSelection(),
  menu: (x, y) => showMenu(x, y),
  rename: (item, name) => work.rename(item, name),
  sort: (by) => sortBy(by),
  failed: (error) => failed(error),
  dragStart: (event) => {
    event.dataTransfer.setData(ITEMS, JSON.stringify(chosen().map((item) => item.identifier)));
    event.dataTransfer.effectAllowed = 'copyMove';
    dragged = chosen();
  },
  dragOver,
  drop: (event, target) => drop(event, target),
  released: () => { if (source) refresh(source); },
});
let dragged = [];

const SORTS = [['name', 'Name'], ['date', 'Changed'], ['size', 'Size'], ['kind', 'Kind']];
const sortField = h('select', { id: 'sort', 'aria-label': 'Sort by', onchange: () => setSort(sortField.value ? { by: sortField.value, descending: downByNature(sortField.value) } : null) });
const sortWay = button('', () => setSort({ ...sortOf(view), descending: !sortOf(view).descending }), { class: 'tool', 'aria-label': 'Descending' });

const work = new Works({ shown: drawWorks, say });

function chosen() { return [...rows.selected.values()]; }

function mayWriteHere() { return view?.kind === 'folder'; }

// MARK: What was done, and what goes on

function say(text, undo, isFailure = false) {
  const message = h('div', { class: `message${isFailure ? ' failure' : ''}`, role: isFailure ? 'alert' : 'status' }, h('span', {}, text));
  const away = () => message.remove();
  if (undo) message.append(button('Undo', () => { away(); work.undo(undo); }));
  message.append(button('×', away, { 'aria-label': 'Close the message', class: 'close' }));
  messages.append(message);
  while (messages.children.length > 4) messages.firstChild.remove();
  if (!isFailure) setTimeout(away, 12_000);
}

function failed(error) {
  if (error instanceof SignedOut) showSignedOut();
  else say(error.message, null, true);
}

const workElements = new Map();

function drawWorks(running) {
  for (const [each, element] of workElements) {
    if (!running.has(each)) {
      element.remove();
      workElements.delete(each);
    }
  }
  for (const each of running) {
    let element = workElements.get(each);
    if (!element) {
      element = h('div', { class: 'work' }, h('span', {}), h('progress', { max: 1, 'aria-label': each.title }), button('Cancel', () => each.cancel(), { 'aria-label': `Cancel: ${each.title}` }));
      workElements.set(each, element);
      works.append(element);
    }
    element.children[0].textContent = each.total > 1 ? `${each.title}: ${each.completed} of ${each.total}` : each.title;
    element.children[1].value = (each.completed + each.part) / Math.max(each.total, 1);
  }
  works.hidden = running.size === 0;
}

// MARK: Where one is

function addressOf(next) {
  if (next.kind === 'folder') return next.container === ROOT ? '#' : `#folder=${encodeURIComponent(next.container)}`;
  if (next.kind === 'tag') return `#tag=${encodeURIComponent(next.tag)}`;
  if (next.kind === 'search') return `#search=${encodeURIComponent(next.text)}`;
  return `#${next.kind}`;
}

function viewOfAddress() {
  const [kind, value] = location.hash.slice(1).split('=');
  const text = decodeURIComponent(value ?? '');
  if (kind === 'folder') return { kind, container: text };
  if (kind === 'tag') return { kind, tag: text, title: text };
  if (kind === 'search' && text) return { kind, text, title: `Found: ${text}` };
  if (['recents', 'favorites', 'trash'].includes(kind)) return { kind, title: { recents: 'Recents', favorites: 'Favourites', trash: 'Trash' }[kind] };
  return { kind: 'folder', container: ROOT, title: 'Documents' };
}

function go(next) {
  document.body.classList.remove('places-open');
  placesButton.setAttribute('aria-expanded', 'false');
  if (location.hash === addressOf(next) || (addressOf(next) === '#' && location.hash === '')) show(next);
  else location.hash = addressOf(next);
}

addEventListener('hashchange', () => { if (hasSession) show(viewOfAddress()); });

// What is found comes in an order of its own, until somebody wants another.
function sortOf(next) { return next.kind === 'folder' ? settings.sort : next.sort ?? null; }

function sourceOf(next) {
  const sort = sortOf(next);
  switch (next.kind) {
    case 'folder': return openFolder(next.container, sort);
    case 'search': return opened(new QuerySource('search', { text: next.text }, { sort }));
    case 'recents': return opened(new QuerySource('recents', {}, { sort }));
    case 'favorites': return opened(new QuerySource('favorites', {}, { sort }));
    case 'tag': return opened(new QuerySource('taggedItems', { tag: next.tag }, { sort }));
    default: return opened(new QuerySource('trashedItems', {}, { sort }));
  }
}

async function opened(made) {
  try {
    await made.open();
  } catch (error) {
    made.stop();
    throw error;
  }
  return made;
}

async function show(next, { keepsFocus = false } = {}) {
  opening += 1;
  const turn = opening;
  const slow = setTimeout(() => drawState('Loading…'), 250);
  source?.stop();
  source = null;
  view = next;
  followTrail([]);
  if (next.kind !== 'search') search.value = '';
  try {
    const [made, trail] = await Promise.all([sourceOf(next), trailOf(next)]);
    if (turn !== opening) return made.stop();
    source = made;
    if (trail.length) next.title = trail.at(-1).filename;
    source.onchange = paced(REFRESH_INTERVAL, () => refresh(made));
    made.better?.then((better) => takeBetter(made, better), (error) => { if (made === source) failed(error); });
    rows.show(source, { layout: settings.layout, sort: sortOf(next), label: next.title });
    drawSort();
    drawPath(trail);
    followTrail(trail);
    drawPlaces();
    drawState();
    status.textContent = `${next.title}, ${format.count(source.total)}`;
    if (!keepsFocus) rows.scroller.focus({ preventScroll: true });
  } catch (error) {
    if (turn !== opening) return undefined;
    if (error instanceof SignedOut) return showSignedOut();
    drawPath([]);
    if (error.isNoSuchItem) drawState('This folder is not there any more.', () => go({ kind: 'folder', container: ROOT }), 'To the documents');
    else drawState(`This can’t be shown: ${error.message}`, () => show(next));
  } finally {
    clearTimeout(slow);
  }
  return undefined;
}

function takeBetter(made, better) {
  if (made !== source) return better.stop();
  made.stop();
  source = better;
  source.onchange = paced(REFRESH_INTERVAL, () => refresh(better));
  rows.replace(better);
  return drawState();
}

// A change that comes while another is looked at is looked at next.
let refreshing = null;
let again = false;

async function refresh(of) {
  if (of !== source || rows.isHeld) return;
  if (refreshing) {
    again = true;
    return;
  }
  do {
    again = false;
    refreshing = rows.refresh();
    try {
      await refreshing;
      if (of === source) {
        drawState();
        drawInformation();
      }
    } catch (error) {
      if (of === source && error.isNoSuchItem) showGone();
      else if (of === source) failed(error);
    }
    refreshing = null;
  } while (again && of === source);
}

async function trailOf(next) {
  if (next.kind !== 'folder') return [];
  const trail = [];
  let identifier = next.container;
  while (identifier && identifier !== ROOT && trail.length < 64) {
    const item = await call('itemForIdentifier', { identifier });
    trail.unshift(item);
    identifier = item.parentIdentifier;
  }
  return [{ identifier: ROOT, filename: 'Documents' }, ...trail];
}

// Any folder on the way may get another name or another place, or go.
let trailWatches = [];

function followTrail(trail) {
  for (const each of trailWatches.splice(0)) each.stop();
  const of = view;
  const changed = later(PLACES_DELAY, () => retrace(of, trail).catch(failed));
  trailWatches = trail.slice(0, -1).map(({ identifier }) => new FolderWatch(identifier, changed));
}

async function retrace(of, before) {
  if (of !== view) return;
  let trail;
  try {
    trail = await trailOf(of);
  } catch (error) {
    if (of !== view) return;
    if (!error.isNoSuchItem) throw error;
    showGone();
    return;
  }
  const isSame = trail.length === before.length && trail.every(({ identifier, filename }, index) => identifier === before[index].identifier && filename === before[index].filename);
  if (of !== view || isSame) return;
  of.title = trail.at(-1).filename;
  rows.scroller.setAttribute('aria-label', of.title);
  drawPath(trail);
  followTrail(trail);
}

// Where somebody has taken the folder away that is shown.
function showGone() {
  const ways = path.trail.slice(0, -1).map(({ identifier }) => identifier).reverse();
  source?.stop();
  source = null;
  followTrail([]);
  rows.clear();
  const nearest = async () => {
    for (const identifier of ways) {
      if (identifier === ROOT || await call('itemForIdentifier', { identifier }).then(() => true, () => false)) return go({ kind: 'folder', container: identifier });
    }
    return undefined;
  };
  drawState('This folder is not there any more.', nearest, 'To the folder that it was in');
}

function drawPath(trail) {
  const crumbs = trail.length ? trail : [{ filename: view.title ?? 'Folder' }];
  path.replaceChildren(h('ol', {}, crumbs.map((item, index) => {
    const isLast = index === crumbs.length - 1;
    const crumb = isLast ? h('h1', { 'aria-current': 'page', dir: 'auto' }, item.filename)
      : button(item.filename, () => go({ kind: 'folder', container: item.identifier, title: item.filename }), { class: 'crumb', dir: 'auto' });
    if (item.identifier) {
      crumb.addEventListener('dragover', (event) => dragOver(event, crumb, item.identifier));
      crumb.addEventListener('drop', (event) => drop(event, item.identifier));
    }
    return h('li', {}, crumb);
  })));
  path.trail = trail;
  document.title = `${crumbs.at(-1).filename} – Cindral`;
}

const EMPTY = {
  folder: 'This folder is empty. Upload documents, or drop them here.',
  search: 'Nothing of that name. Search for another part of it.',
  recents: 'No document was used yet. What you open shows here.',
  favorites: 'There are no favourites yet. Choose an item, then “Favourite”.',
  tag: 'No item has this tag any more.',
  trash: 'The trash is empty.',
};

function drawState(text = null, way = null, label = 'Try again') {
  const isEmpty = source?.total === 0 && source.isComplete !== false;
  const shown = text ?? (isEmpty ? EMPTY[view.kind] : null);
  state.hidden = !shown;
  rows.element.hidden = Boolean(text);
  if (!shown) return;
  state.replaceChildren(h('p', { role: way ? 'alert' : 'status' }, shown));
  if (way) state.append(button(label, way, { class: 'main' }));
}

// MARK: Places

let anchor = null;

// Whether the applications are others than they were. A listing says which there were when somebody last asked for changes.
async function takeUpLibraries() {
  let isOther = anchor === null;
  for (let moreComing = !isOther; moreComing;) {
    try {
      const changes = await call('enumerateChanges', { container: ROOT, anchor });
      ({ anchor, moreComing } = changes);
      isOther ||= changes.updated.some((item) => item.isAppLibrary) || changes.deleted.some((identifier) => identifier.startsWith('#'));
    } catch {
      anchor = null; // Expired: the next one begins with now.
      return takeUpLibraries();
    }
  }
  if (anchor === null) ({ anchor } = await call('currentSyncAnchor', { container: ROOT }));
  return isOther;
}

async function readLibraries() {
  if (!await takeUpLibraries()) return;
  const libraries = [];
  let page = null;
  do {
    const answer = await call('enumerateItems', { container: ROOT, ...(page ? { page } : {}) });
    libraries.push(...answer.items.filter((item) => item.isAppLibrary));
    page = answer.nextPage;
  } while (page);
  places.libraries = libraries;
  drawPlaces();
}

async function readTags() {
  const { tags } = await call('tags');
  knownTags = tags.map(({ tag }) => tag);
  places.tags = tags;
  drawPlaces();
}

function drawPlaces() {
  const entry = (label, symbol, next, count) => {
    const isHere = view && addressOf(view) === addressOf(next);
    const made = button('', () => go(next), { 'aria-current': isHere ? 'page' : undefined, class: 'place' });
    made.append(symbol, h('span', { dir: 'auto' }, label));
    if (count !== undefined) made.append(h('span', { class: 'count' }, String(count)));
    if (next.kind === 'folder') {
      made.addEventListener('dragover', (event) => dragOver(event, made, next.container));
      made.addEventListener('drop', (event) => drop(event, next.container));
    }
    return h('li', {}, made);
  };
  const focused = places.contains(document.activeElement) ? document.activeElement.textContent : null;
  const group = (title, entries) => (entries.length ? [h('h2', {}, title), h('ul', {}, entries)] : []);
  places.replaceChildren(
    ...group('Places', [
      entry('Documents', icon('folder'), { kind: 'folder', container: ROOT, title: 'Documents' }),
      entry('Recents', icon('clock'), { kind: 'recents', title: 'Recents' }),
      entry('Favourites', icon('star'), { kind: 'favorites', title: 'Favourites' }),
      entry('Trash', icon('trash'), { kind: 'trash', title: 'Trash' })]),
    ...group('Applications', (places.libraries ?? []).map((item) => entry(item.filename,
      h('img', { class: 'icon', alt: '', src: `/thumbnail/${encodeURIComponent(item.identifier)}?size=64`, onerror: (event) => event.target.replaceWith(icon('app')) }),
      { kind: 'folder', container: item.identifier, title: item.filename }))),
    ...group('Tags', (places.tags ?? []).map(({ tag, count }) => entry(tag, icon('tag'), { kind: 'tag', tag, title: tag }, count))));
  if (focused) [...places.querySelectorAll('button')].find((each) => each.textContent === focused)?.focus();
}

// MARK: What can be done

function may(bit) {
  const items = chosen();
  return items.length > 0 && items.every((item) => item.capabilities & bit);
}

// `isThere` says in which views a command stands in the bar; whether it can be used now is said by `when`. So the bar stays as
// it is while items are chosen, and nothing moves under the pointer.
const notInTrash = () => view?.kind !== 'trash';
const inTrash = () => view?.kind === 'trash';

const commands = {
  open: { label: 'Open', when: () => chosen().length === 1, run: () => open(chosen()[0]) },
  newFolder: { label: 'New folder', isThere: mayWriteHere, when: mayWriteHere, run: newFolder },
  upload: { label: 'Upload', isThere: mayWriteHere, when: mayWriteHere, run: () => files.click() },
  uploadFolder: { label: 'Upload folder', isThere: mayWriteHere, when: mayWriteHere, run: () => folders.click() },
  download: { label: 'Download', isThere: notInTrash, when: () => chosen().length > 0 && view.kind !== 'trash', run: () => download(chosen()) },
  rename: { label: 'Rename', isThere: notInTrash, when: () => chosen().length === 1 && may(CAN.rename) && view.kind !== 'trash', run: () => rows.edit(chosen()[0]) },
  move: { label: 'Move…', isThere: notInTrash, when: () => may(CAN.move) && view.kind !== 'trash', run: moveByDialog },
  copy: { label: 'Copy…', isThere: notInTrash, when: () => chosen().length > 0 && view.kind !== 'trash', run: copyByDialog },
  tags: { label: 'Tags…', isThere: notInTrash, when: () => chosen().length > 0 && view.kind !== 'trash', run: changeTags },
  favorite: { label: 'Favourite', isThere: notInTrash, when: () => chosen().length > 0 && view.kind !== 'trash', run: toggleFavorite },
  trash: { label: 'Move to trash', isThere: notInTrash, when: () => may(CAN.trash) && view.kind !== 'trash', run: () => work.trash(chosen()) },
  putBack: { label: 'Put back', isThere: inTrash, when: () => view?.kind === 'trash' && chosen().length > 0, run: () => work.putBack(chosen()) },
  delete: { label: 'Delete…', isThere: inTrash, when: () => view?.kind === 'trash' && may(CAN.delete), run: deleteChosen },
  information: { label: 'Information', when: () => true, run: toggleInformation, isPressed: () => !information.hidden },
  layout: { label: 'Icons', when: () => true, run: toggleLayout, isPressed: () => settings.layout === 'icons' },
};

const toolButtons = new Map(Object.entries(commands).map(([name, command]) => [name,
  button(command.label, () => run(name), { class: `tool ${name}` })]));
toolbar.append(...toolButtons.values());
// How it is shown stays together at the end of the bar.
toolbar.append(h('span', { class: 'showing' }, sortField, sortWay, toolButtons.get('information'), toolButtons.get('layout')));

async function run(name) {
  const command = commands[name];
  if (!command.when()) return;
  try {
    await command.run();
  } catch (error) {
    failed(error);
  }
}

function drawSelection() {
  if (!view) return;
  for (const [name, command] of Object.entries(commands)) {
    const element = toolButtons.get(name);
    element.hidden = command.isThere !== undefined && !command.isThere();
    element.disabled = !command.when();
    if (command.isPressed) element.setAttribute('aria-pressed', command.isPressed());
  }
  const favorites = chosen();
  toolButtons.get('favorite').setAttribute('aria-pressed', favorites.length > 0 && favorites.every((item) => item.favoriteRank !== undefined));
  if (rows.selected.size > 1) status.textContent = `${format.count(rows.selected.size)} chosen`;
  drawInformation();
}

function open(item) {
  if (format.isFolder(item)) return go({ kind: 'folder', container: item.identifier, title: item.filename });
  call('setLastUsedDate', { identifier: item.identifier, date: new Date().toISOString() }).catch(() => {});
  return dialogs.preview(item, () => download([item]).catch(failed));
}

// A document as it is; folders, and several items, as an archive.
async function download(items) {
  const isDocument = items.length === 1 && items[0].documentSize !== undefined && !format.isFolder(items[0]);
  const address = isDocument ? fileAddress(items[0], true) : await archiveAddress(items);
  const link = h('a', { href: address, download: '', hidden: true });
  document.body.append(link);
  link.click();
  link.remove();
}

async function newFolder() {
  const name = await dialogs.askText('New folder', 'Name', 'New folder', 'Make');
  if (!name) return;
  const [made] = await work.newFolder(view.container, name);
  if (made) choose(made);
}

async function choose(item) {
  await refresh(source);
  await rows.reveal(item.identifier);
}

async function moveByDialog() {
  const items = chosen();
  const target = await dialogs.askFolder(`Move ${items.length === 1 ? items[0].filename : format.count(items.length)}`, 'Move here', view.container ?? ROOT);
  if (target) await work.move(items, target);
}

async function copyByDialog() {
  const items = chosen();
  const target = await dialogs.askFolder(`Copy ${items.length === 1 ? items[0].filename : format.count(items.length)}`, 'Copy here', view.container ?? ROOT);
  if (target) await work.copy(items, target);
}

async function changeTags() {
  const changes = await dialogs.askTags(chosen(), knownTags);
  if (changes) await work.tag(changes);
}

function toggleFavorite() {
  const items = chosen();
  return work.favorite(items, !items.every((item) => item.favoriteRank !== undefined));
}

async function deleteChosen() {
  const items = chosen();
  const what = items.length === 1 ? `“${items[0].filename}”` : format.count(items.length);
  if (await dialogs.confirm(`Delete ${what}?`, 'What is deleted is gone for good.', 'Delete')) await work.delete(items);
}

async function emptyChosenOrTrash() {
  if (view.kind === 'trash') await run('delete');
  else await run('trash');
}

function toggleLayout() {
  settings.layout = settings.layout === 'list' ? 'icons' : 'list';
  const items = chosen();
  if (!source) return;
  rows.show(source, { layout: settings.layout, sort: sortOf(view), label: view.title });
  if (items.length) rows.reveal(items[0].identifier);
}

const downByNature = (by) => by === 'date' || by === 'size';

function sortBy(by) {
  const before = sortOf(view);
  return setSort({ by, descending: before?.by === by ? !before.descending : downByNature(by) });
}

async function setSort(sort) {
  if (view.kind === 'folder') settings.sort = sort;
  else view.sort = sort;
  const heading = rows.header.contains(document.activeElement) ? document.activeElement.closest('.cell').classList[1] : null;
  await show(view, { keepsFocus: true });
  if (heading) rows.header.querySelector(`.cell.${heading} button`)?.focus();
}

function drawSort() {
  const sort = sortOf(view);
  const entries = view.kind === 'folder' ? SORTS : [['', 'As found'], ...SORTS];
  sortField.replaceChildren(...entries.map(([value, label]) => h('option', { value, selected: value === (sort?.by ?? '') }, label)));
  sortWay.disabled = !sort;
  sortWay.textContent = sort?.descending ? '↓' : '↑';
  sortWay.setAttribute('aria-pressed', sort?.descending ?? false);
}

// MARK: Information

const FIELDS = [
  ['typeIdentifier', 'Type'], ['documentSize', 'Size', (value) => `${format.size(value)} (${value.toLocaleString()})`], ['childItemCount', 'Items'],
  ['creationDate', 'Made', format.date], ['contentModificationDate', 'Changed', format.date], ['lastUsedDate', 'Used', format.date],
  ['tags', 'Tags', (tags) => tags.join(', ')], ['favoriteRank', 'Favourite', String], ['fileURL', 'Place', (url) => decodePlace(url)], ['bundleIdentifier', 'Application'],
  ['isAppLibrary', 'Documents of an application', () => 'Yes'], ['isTrashed', 'In the trash', (value) => (value ? 'Yes' : 'No')], ['isUbiquitous', 'Synchronised', (value) => (value ? 'Yes' : 'No')], ['capabilities', 'May be', (bits) => capabilitiesText(bits)],
  ['identifier', 'Identifier'], ['parentIdentifier', 'Folder'], ['docID', 'Document number'], ['fileID', 'File number'], ['versionIdentifier', 'Version']];

function decodePlace(url) {
  try {
    return decodeURIComponent(url.replace('file://', ''));
  } catch {
    return url; // Not every name is text.
  }
}

function capabilitiesText(bits) {
  return ['read', 'written', 'moved', 'renamed', 'trashed', 'deleted'].filter((_, bit) => bits & (1 << bit)).join(', ') || 'nothing';
}

function toggleInformation() {
  information.hidden = !information.hidden;
  drawSelection();
}

async function drawInformation() {
  if (information.hidden) return;
  const items = chosen();
  if (items.length !== 1) {
    const text = items.length ? `${format.count(items.length)} chosen, ${format.size(items.reduce((sum, item) => sum + (item.documentSize ?? 0), 0))} in all` : 'Choose an item to see what is known of it.';
    information.replaceChildren(h('h2', {}, 'Information'), h('p', {}, text));
    return;
  }
  const [item] = items;
  information.replaceChildren(h('h2', { dir: 'auto' }, item.filename), h('dl', { class: 'fields' }, FIELDS.filter(([name]) => item[name] !== undefined && item[name] !== '').flatMap(
    ([name, label, text]) => [h('dt', {}, label), h('dd', { dir: 'auto' }, text ? text(item[name]) : String(item[name]))])));
}

// MARK: A menu where the pointer is

function showMenu(x, y) {
  document.querySelector('.menu')?.remove();
  const menu = h('div', { class: 'menu', role: 'menu', 'aria-label': 'Works' }, Object.entries(commands)
    .filter(([name, command]) => command.when() && !command.isPressed && !['upload', 'uploadFolder'].includes(name))
    .map(([name, command]) => h('button', { type: 'button', role: 'menuitem', onclick: () => { away(); run(name); } }, command.label)));
  const away = () => {
    menu.remove();
    removeEventListener('pointerdown', outside);
    rows.scroller.focus({ preventScroll: true });
  };
  const outside = (event) => { if (!menu.contains(event.target)) away(); };
  menu.addEventListener('keydown', (event) => {
    event.stopPropagation();
    const entries = [...menu.children];
    const at = entries.indexOf(document.activeElement);
    if (event.key === 'Escape') away();
    else if (event.key === 'ArrowDown') entries[(at + 1) % entries.length].focus();
    else if (event.key === 'ArrowUp') entries[(at + entries.length - 1) % entries.length].focus();
    else return;
    event.preventDefault();
  });
  app.querySelector('main').append(menu);
  menu.style.left = `${Math.min(x, innerWidth - menu.offsetWidth - 4)}px`;
  menu.style.top = `${Math.min(y, innerHeight - menu.offsetHeight - 4)}px`;
  menu.firstChild?.focus();
  addEventListener('pointerdown', outside);
}

// MARK: Dragging, pasting, uploading

function dragOver(event, element, target) {
  const isOurs = event.dataTransfer.types.includes(ITEMS);
  if (!isOurs && !event.dataTransfer.types.includes('Files')) return;
  if (isOurs && dragged.some((item) => item.identifier === target)) return;
  event.preventDefault();
  event.stopPropagation();
  event.dataTransfer.dropEffect = isOurs && !event.ctrlKey ? 'move' : 'copy';
  element.classList.add('target');
  const away = () => element.classList.remove('target');
  element.addEventListener('dragleave', away, { once: true });
  element.addEventListener('drop', away, { once: true });
}

async function drop(event, target) {
  event.preventDefault();
  event.stopPropagation();
  try {
    if (event.dataTransfer.types.includes(ITEMS)) {
      const items = dragged;
      if (event.ctrlKey) await work.copy(items, target);
      else await work.move(items, target);
    } else {
      await work.upload(await entriesOf(event.dataTransfer), target);
    }
  } catch (error) {
    failed(error);
  }
}

rows.scroller.addEventListener('dragover', (event) => { if (mayWriteHere() && event.dataTransfer.types.includes('Files')) dragOver(event, rows.scroller, view.container); });
rows.scroller.addEventListener('drop', (event) => { if (mayWriteHere()) drop(event, view.container); });
state.addEventListener('dragover', (event) => { if (mayWriteHere()) dragOver(event, state, view.container); });
state.addEventListener('drop', (event) => { if (mayWriteHere()) drop(event, view.container); });

for (const field of [files, folders]) {
  field.addEventListener('change', async () => {
    const entries = entriesOfFiles(field.files);
    field.value = '';
    await work.upload(entries, view.container).catch(failed);
  });
}

addEventListener('paste', (event) => {
  if (!mayWriteHere() || event.target.closest?.('input, dialog')) return;
  if (event.clipboardData.files.length) {
    event.preventDefault();
    const { container } = view;
    entriesOf(event.clipboardData).then((entries) => work.upload(entries, container)).catch(failed);
  } else if (clipboard) {
    const { items, isCut } = clipboard;
    if (isCut) clipboard = null;
    (isCut ? work.move(items, view.container) : work.copy(items, view.container)).catch(failed);
  }
});
for (const name of ['copy', 'cut']) {
  addEventListener(name, (event) => {
    if (event.target.closest?.('input, dialog, pre') || !chosen().length || view.kind === 'trash') return;
    event.preventDefault();
    event.clipboardData.setData('text/plain', chosen().map((item) => item.filename).join('\n'));
    clipboard = { items: chosen(), isCut: name === 'cut' };
    status.textContent = `${format.count(clipboard.items.length)} ${name === 'cut' ? 'to be moved' : 'to be copied'}`;
  });
}

// MARK: Keys

addEventListener('keydown', (event) => {
  if (!hasSession || event.defaultPrevented || event.target.closest?.('dialog, .menu')) return;
  const isTyping = event.target.closest?.('input');
  const control = event.ctrlKey || event.metaKey;
  const isInRows = event.target === rows.scroller;
  const key = control ? `Ctrl+${event.key.toLowerCase()}` : event.key;
  if (isTyping) {
    if (key === 'Escape' && event.target === search) {
      search.value = '';
      searchNow();
      rows.scroller.focus();
    } else if (key === 'ArrowDown' && event.target === search) rows.scroller.focus();
    else return;
  } else if (key === '/') search.focus();
  else if (key === 'Ctrl+z') work.undo().catch(failed);
  else if (key === '?') dialogs.keys();
  else if (key === 'Backspace' && path.trail?.length > 1) go({ kind: 'folder', container: path.trail.at(-2).identifier });
  else if (!isInRows) return;
  else if (key === 'Enter' && chosen().length === 1) open(chosen()[0]);
  else if (key === ' ' && chosen().length === 1) open(chosen()[0]);
  else if (key === 'F2') run('rename');
  else if (key === 'Delete') emptyChosenOrTrash();
  else if (key === 'Ctrl+a') rows.selectAll();
  else if (key === 'Escape') rows.clear();
  else if (key === 'Ctrl+i') run('information');
  else if (key === 'ContextMenu' || (key === 'F10' && event.shiftKey)) {
    const place = rows.elements.get(rows.current)?.getBoundingClientRect();
    if (place) showMenu(place.left + 40, place.bottom);
  } else return;
  event.preventDefault();
});

// MARK: Searching

let searching = null;

function searchNow() {
  clearTimeout(searching);
  const text = search.value.trim();
  if (text) {
    const next = { kind: 'search', text, title: `Found: ${text}` };
    // One step back leads to where the search began, not through its letters.
    if (view?.kind === 'search') history.replaceState(null, '', addressOf(next));
    else history.pushState(null, '', addressOf(next));
    show(next, { keepsFocus: true });
  } else if (view?.kind === 'search') {
    history.back();
  }
}
search.addEventListener('input', () => {
  clearTimeout(searching);
  searching = setTimeout(searchNow, SEARCH_DELAY);
});

// MARK: The beginning, and the end

function showSignedOut() {
  hasSession = false;
  source?.stop();
  source = null;
  for (const each of trailWatches.splice(0)) each.stop();
  app.replaceChildren(h('main', { class: 'state' }, h('h1', {}, 'Cindral'),
    h('p', {}, 'This browser has no session. Open the link that the program has printed; each is good once.'),
    h('p', { class: 'hint' }, 'The command “cindral link” prints another.')));
}

async function begin() {
  try {
    await signIn();
  } catch (error) {
    if (error instanceof SignedOut) return showSignedOut();
    app.replaceChildren(h('main', { class: 'state' }, h('h1', {}, 'Cindral'), h('p', { role: 'alert' }, 'The program does not answer. Is it running?'), button('Try again', begin, { class: 'main' })));
    return undefined;
  }
  hasSession = true;
  app.replaceChildren(
    h('header', {}, h('a', { class: 'skip', href: '#', onclick: (event) => { event.preventDefault(); rows.scroller.focus(); } }, 'To the documents'), placesButton, path, search, button('Keys', () => dialogs.keys(), { class: 'quiet keys' }), button('Sign out', async () => { await signOut(); showSignedOut(); }, { class: 'quiet' })),
    h('div', { class: 'columns-of-page' }, places, h('main', {}, toolbar, h('div', { class: 'shown' }, rows.element, state)), information, messages),
    works, status, files, folders);
  // Whatever changes anywhere is signalled there. What is shown comes first.
  const librariesChanged = later(PLACES_DELAY, () => readLibraries().catch(failed));
  const tagsChanged = later(PLACES_DELAY, () => readTags().catch(failed));
  listen('signal', ({ container }) => { if (container === ROOT) librariesChanged(); });
  listen('connected', () => followPlaces().catch(failed));
  listen('lost', (isOver) => { if (isOver) signIn().catch(failed); });
  search.value = view?.text ?? '';
  await Promise.all([show(viewOfAddress()), followPlaces().catch(failed)]);
  if (view.kind === 'search') search.value = view.text;
  return undefined;

  async function followPlaces() {
    await call('startMonitoring', { container: ROOT });
    anchor = null;
    await readLibraries();
    const { watch } = await call('watchQuery', { query: 'tags' });
    tagsWatch?.();
    tagsWatch = listen('queryChanged', (changed) => { if (changed.watch === watch) tagsChanged(); });
    await readTags();
  }
}
let tagsWatch = null;

begin();
