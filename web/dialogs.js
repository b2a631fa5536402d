// What is asked, and answered, in a window above the page.

import { h, button } from './dom.js';
import * as format from './format.js';
import { call, fileAddress, ROOT } from './rpc.js';

let last = 0;

// Shows a window with the contents until it is closed; the answer is what it was closed with.
function ask(title, contents, { wide = false } = {}) {
  last += 1;
  return new Promise((resolve) => {
    const before = document.activeElement;
    const dialog = h('dialog', { class: wide ? 'wide' : '', 'aria-labelledby': `title-${last}` },
      h('h2', { id: `title-${last}` }, title), ...contents((answer) => {
        dialog.answer = answer;
        dialog.close();
      }));
    dialog.addEventListener('keydown', (event) => event.stopPropagation());
    dialog.addEventListener('close', () => {
      dialog.remove();
      if (before?.isConnected) before.focus({ preventScroll: true });
      resolve(dialog.answer ?? null);
    });
    document.body.append(dialog);
    dialog.showModal();
  });
}

export function confirm(title, text, yes) {
  return ask(title, (close) => [
    h('p', {}, text),
    h('div', { class: 'choices' }, button('Cancel', () => close(false), { autofocus: true }), button(yes, () => close(true), { class: 'danger' }))]);
}

// A line of text; none where it is left.
export function askText(title, label, value, yes) {
  return ask(title, (close) => {
    const input = h('input', { value, autofocus: true, autocomplete: 'off' });
    const form = h('form', {
      method: 'dialog',
      onsubmit: (event) => {
        event.preventDefault();
        if (input.value) close(input.value);
      },
    }, h('label', {}, label, input), h('div', { class: 'choices' }, button('Cancel', () => close(null)), h('button', { class: 'main' }, yes)));
    return [form];
  });
}

// What to do about a name that is taken: {choice: 'keep' | 'replace' | 'skip', isForAll}.
export function askClash(name, inTheWay, mayBeMore) {
  return ask('That name is taken', (close) => {
    const all = h('input', { type: 'checkbox' });
    const choose = (choice) => () => close({ choice, isForAll: all.checked });
    const there = inTheWay ? ` It was changed ${format.date(inTheWay.contentModificationDate)}${inTheWay.documentSize === undefined ? '' : ` and has ${format.size(inTheWay.documentSize)}`}.` : '';
    return [
      h('p', {}, `There is “${name}” in that folder already.${there}`),
      mayBeMore ? h('label', { class: 'check' }, all, 'For all that follow') : null,
      h('div', { class: 'choices' },
        button('Skip', choose('skip')), button('Replace', choose('replace'), { title: 'The one that is there goes to the trash' }),
        button('Keep both', choose('keep'), { class: 'main', autofocus: true }))].filter(Boolean);
  }).then((answer) => answer ?? { choice: 'skip', isForAll: true });
}

// A folder, found by walking there; none where none was chosen.
export function askFolder(title, yes, start) {
  return ask(title, (close) => {
    let here = null;
    const path = h('p', { class: 'where', role: 'status' });
    const list = h('ul', { class: 'folders', 'aria-label': 'Folders' });
    const go = async (identifier) => {
      try {
        here = identifier === ROOT ? { identifier: ROOT, filename: 'Documents' } : await call('itemForIdentifier', { identifier });
        path.textContent = here.filename;
        const folders = [];
        let page = null;
        do {
          const answer = await call('enumerateItems', { container: identifier, ...(page ? { page } : {}) });
          folders.push(...answer.items.filter((item) => format.isFolder(item) && (identifier !== ROOT || (item.parentIdentifier === ROOT && item.filename !== '.TemporaryLocalFolder'))));
          page = answer.nextPage;
        } while (page);
        folders.sort((a, b) => format.collator.compare(a.filename, b.filename));
        const entries = folders.map((item) => h('li', {}, button(item.filename, () => go(item.identifier))));
        if (identifier !== ROOT) entries.unshift(h('li', {}, button('↑ Up', () => go(here.parentIdentifier || ROOT))));
        list.replaceChildren(...entries.length ? entries : [h('li', { class: 'hint' }, 'No folders here')]);
        list.querySelector('button')?.focus();
      } catch (error) {
        path.textContent = error.message;
      }
    };
    go(start);
    return [path, list, h('div', { class: 'choices' }, button('Cancel', () => close(null)), button(yes, () => close(here?.identifier), { class: 'main' }))];
  });
}

const TEXT_BYTES_MAX = 1 << 20;

async function textOf(item) {
  const answer = await fetch(fileAddress(item), { headers: { Range: `bytes=0-${TEXT_BYTES_MAX - 1}` } });
  if (!answer.ok && answer.status !== 416) throw new Error((await answer.json()).message);
  const text = answer.status === 416 ? '' : await answer.text();
  return answer.status === 206 ? `${text}\n…` : text;
}

function isText(item) {
  return item.typeIdentifier.startsWith('text/') || /^application\/(json|xml|x-shellscript|toml|(x-)?yaml|javascript|xhtml\+xml)$/.test(item.typeIdentifier);
}

function previewOf(item) {
  const [family] = item.typeIdentifier.split('/');
  const source = fileAddress(item);
  const failed = (element) => () => element.replaceWith(h('p', { role: 'alert' }, 'This document can’t be shown here. Download it to open it with a program of yours.'));
  if (family === 'image') {
    const image = h('img', { src: source, alt: item.filename });
    image.addEventListener('error', failed(image));
    return image;
  }
  if (family === 'audio' || family === 'video') {
    const player = h(family, { src: source, controls: true, preload: 'metadata' });
    player.setAttribute('aria-label', item.filename);
    player.addEventListener('error', failed(player));
    return player;
  }
  if (item.typeIdentifier === 'application/pdf') return h('iframe', { src: source, title: item.filename });
  if (isText(item)) {
    const text = h('pre', { tabIndex: 0, 'aria-label': item.filename, role: 'document' }, 'Loading…');
    textOf(item).then((contents) => { text.textContent = contents; }, (error) => { text.textContent = error.message; });
    return text;
  }
  return h('p', {}, `There is no preview of ${format.kind(item)}. Download it to open it with a program of yours.`);
}

export function preview(item, download) {
  return ask(item.filename, (close) => [
    h('div', { class: 'preview' }, previewOf(item)),
    h('div', { class: 'choices' }, button('Download', download), button('Close', () => close(), { class: 'main', autofocus: true }))], { wide: true });
}

// Tags as a person changes them: those of all items that were given, one field for more.
export function askTags(items, known) {
  const of = (item) => item.tags ?? [];
  return ask(items.length === 1 ? `Tags of ${items[0].filename}` : `Tags of ${format.count(items.length)}`, (close) => {
    const all = [...new Set([...known, ...items.flatMap(of)])].sort(format.collator.compare);
    const boxes = new Map();
    const list = h('ul', { class: 'tags' });
    const add = (tag, isOn, isMixed = false) => {
      if (boxes.has(tag)) {
        boxes.get(tag).checked = true;
        return;
      }
      const box = h('input', { type: 'checkbox', checked: isOn, indeterminate: isMixed });
      boxes.set(tag, box);
      list.append(h('li', {}, h('label', { class: 'check' }, box, tag)));
    };
    for (const tag of all) {
      const having = items.filter((item) => of(item).includes(tag)).length;
      add(tag, having === items.length, having > 0 && having < items.length);
    }
    const input = h('input', { autocomplete: 'off', autofocus: true });
    const addNew = () => {
      const tag = input.value.trim();
      if (tag) add(tag, true);
      input.value = '';
    };
    const form = h('form', {
      method: 'dialog',
      onsubmit: (event) => {
        event.preventDefault();
        if (input.value.trim()) addNew();
        else finish();
      },
    });
    const finish = () => {
      addNew();
      close(items.map((item) => ({
        item,
        tags: [...of(item).filter((tag) => boxes.get(tag).checked || boxes.get(tag).indeterminate),
          ...[...boxes].filter(([tag, box]) => box.checked && !box.indeterminate && !of(item).includes(tag)).map(([tag]) => tag)],
      })));
    };
    form.append(list, h('label', {}, 'New tag', input), h('div', { class: 'choices' }, button('Cancel', () => close(null)), button('Add', addNew), button('Done', finish, { class: 'main' })));
    return [form];
  });
}

export function keys() {
  const entries = [
    ['Enter', 'Open'], ['Space', 'Preview'], ['F2', 'Rename'], ['Delete', 'To the trash; in the trash, delete'], ['Ctrl+A', 'Choose all'],
    ['Ctrl+Space', 'Choose one more'], ['Ctrl+C, Ctrl+X, Ctrl+V', 'Copy, cut, put here'], ['Ctrl+Z', 'Undo'], ['Backspace', 'Up one folder'],
    ['/', 'Search'], ['i', 'Information'], ['Shift+arrows', 'Choose more'], ['Escape', 'Choose nothing; leave what is open']];
  return ask('Keys', (close) => [
    h('dl', { class: 'fields' }, entries.flatMap(([key, what]) => [h('dt', {}, key), h('dd', {}, what)])),
    h('div', { class: 'choices' }, button('Close', () => close(), { class: 'main', autofocus: true }))]);
}
