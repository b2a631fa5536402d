// The rows of a view: only those that are seen are there, however many there are.
//
// A row's element is its item's for as long as both are there. So a name that is being edited, and what has been chosen,
// stay what they are when rows come, go and move around them.

import { h, icon } from './dom.js';
import * as format from './format.js';
import { fileAddress } from './rpc.js';

const ROW = 40;
const CELL = { width: 132, height: 156 };
const MARGIN = 6; // Rows beyond what is seen.
const PICTURE_BYTES_MAX = 8e6;

const COLUMNS = [
  { name: 'name', label: 'Name' }, { name: 'date', label: 'Changed' }, { name: 'size', label: 'Size' },
  { name: 'kind', label: 'Kind' }];

export class Rows {
  // `actions`: open(item), selectionChanged(), menu(item), rename(item, name), sort(by), failed(error), dragStart, dragOver, drop,
  // released().
  constructor(actions) {
    this.actions = actions;
    this.elements = new Map();
    this.selected = new Map();
    this.source = null;
    this.current = null; // Identifier of the row that the keyboard is at.
    this.anchor = null;
    this.isHeld = false; // While a row is dragged, none moves away under the pointer.
    this.layout = 'list';
    this.spacer = h('div', { class: 'spacer' });
    this.body = h('div', { class: 'rows' });
    this.header = h('div', { class: 'columns' });
    this.scroller = h('div', { class: 'scroller', tabIndex: 0 });
    this.element = h('div', { class: 'view' }, this.scroller);
    this.scroller.addEventListener('scroll', () => this.draw(), { passive: true });
    this.scroller.addEventListener('keydown', (event) => this.#key(event));
    this.scroller.addEventListener('click', (event) => { if (event.target === this.scroller || event.target === this.body) this.clear(); });
    new ResizeObserver(() => this.draw()).observe(this.scroller);
  }

  // MARK: What is shown

  show(source, { layout, sort, label }) {
    this.source = source;
    this.layout = layout;
    this.sort = sort;
    for (const element of this.elements.values()) element.remove();
    this.elements.clear();
    this.selected.clear();
    this.current = null;
    this.anchor = null;
    this.isHeld = false;
    this.editing = null;
    this.scroller.scrollTop = 0;
    this.scroller.className = `scroller ${layout}`;
    this.scroller.setAttribute('role', layout === 'list' ? 'grid' : 'listbox');
    this.scroller.setAttribute('aria-multiselectable', 'true');
    this.scroller.setAttribute('aria-label', label);
    this.scroller.removeAttribute('aria-activedescendant');
    this.body.setAttribute('role', layout === 'list' ? 'rowgroup' : 'presentation');
    if (layout === 'list') {
      this.#makeHeader();
      this.scroller.replaceChildren(this.header, this.body);
      this.scroller.setAttribute('aria-colcount', COLUMNS.length);
    } else {
      this.scroller.replaceChildren(this.body);
      this.scroller.removeAttribute('aria-colcount');
      this.scroller.removeAttribute('aria-rowcount');
    }
    this.actions.selectionChanged();
    this.draw();
  }

  // The same items in another order, or more of them.
  replace(source) {
    this.source = source;
    this.draw();
    this.actions.selectionChanged();
  }

  #makeHeader() {
    this.header.setAttribute('role', 'rowgroup');
    this.header.replaceChildren(h('div', { class: 'row heading', role: 'row', 'aria-rowindex': 1 }, COLUMNS.map(({ name, label }) => {
      const isSorted = this.sort?.by === name;
      const way = this.sort?.descending ? 'descending' : 'ascending';
      return h('div', { class: `cell ${name}`, role: 'columnheader', 'aria-sort': isSorted ? way : 'none' },
        h('button', { type: 'button', onclick: () => this.actions.sort(name) }, label, h('span', { 'aria-hidden': 'true' }, isSorted ? (this.sort.descending ? ' ▾' : ' ▴') : '')));
    })));
  }

  get #columns() {
    return this.layout === 'list' ? 1 : Math.max(1, Math.floor((this.scroller.clientWidth - 16) / CELL.width));
  }

  get #lineHeight() { return this.layout === 'list' ? ROW : CELL.height; }

  get #top() { return this.layout === 'list' ? ROW : 0; } // The headings stay.

  // Indices of the first and the last item that are seen.
  range() {
    const columns = this.#columns;
    const first = Math.floor(this.scroller.scrollTop / this.#lineHeight);
    const last = Math.ceil((this.scroller.scrollTop + this.scroller.clientHeight) / this.#lineHeight);
    const end = Math.max((this.source?.total ?? 1) - 1, 0);
    return [Math.min(first * columns, end), Math.min((last + 1) * columns, end)];
  }

  draw() {
    const { source } = this;
    if (!source) return;
    const columns = this.#columns;
    const lines = Math.ceil(source.total / columns);
    this.body.style.height = `${lines * this.#lineHeight}px`;
    if (this.layout === 'list') this.scroller.setAttribute('aria-rowcount', source.isComplete ? source.total + 1 : -1);
    const [first, last] = this.range();
    const from = Math.max(0, first - MARGIN * columns);
    const to = Math.min(source.total - 1, last + MARGIN * columns);
    const wanted = new Map();
    let isMissing = false;
    for (let index = from; index <= to; index += 1) {
      const item = source.get(index);
      if (item) wanted.set(item.identifier, { item, index });
      else isMissing = true;
    }
    // Where the keyboard is, and what is being edited, stays, also out of sight.
    for (const identifier of [this.current, this.editing?.identifier]) {
      const element = identifier && this.elements.get(identifier);
      if (element && !wanted.has(identifier)) wanted.set(identifier, { item: element.item, index: element.index });
    }
    for (const [identifier, element] of this.elements) {
      if (!wanted.has(identifier)) {
        element.remove();
        this.elements.delete(identifier);
      }
    }
    for (const { item, index } of wanted.values()) this.#place(item, index, columns);
    if (this.current && !this.elements.has(this.current)) this.current = null;
    this.#markCurrent();
    if (isMissing || !source.isComplete) this.#load(source, from, to);
  }

  async #load(source, from, to) {
    try {
      if (await source.load(from, to) && source === this.source) this.draw();
    } catch (error) {
      this.actions.failed(error);
    }
  }

  #place(item, index, columns) {
    let element = this.elements.get(item.identifier);
    if (!element) {
      element = this.#make(item);
      this.elements.set(item.identifier, element);
      this.body.append(element);
    } else if (element.item !== item) {
      this.#fill(element, item);
    }
    element.index = index;
    const line = Math.floor(index / columns);
    element.style.transform = this.layout === 'list' ? `translateY(${line * ROW}px)`
      : `translate(${(index % columns) * CELL.width}px, ${line * CELL.height}px)`;
    if (this.layout === 'list') {
      element.setAttribute('aria-rowindex', index + 2);
    } else {
      element.setAttribute('aria-posinset', index + 1);
      element.setAttribute('aria-setsize', this.source.isComplete ? this.source.total : -1);
    }
    element.setAttribute('aria-selected', this.selected.has(item.identifier));
    if (this.selected.has(item.identifier)) this.selected.set(item.identifier, item);
  }

  #make(item) {
    const element = h('div', {
      class: 'row', id: `row-${item.identifier}`, role: this.layout === 'list' ? 'row' : 'option', draggable: true,
      onclick: (event) => this.#click(event, element),
      ondblclick: (event) => { if (!this.editing) { event.preventDefault(); this.actions.open(element.item); } },
      oncontextmenu: (event) => {
        event.preventDefault();
        if (!this.selected.has(element.item.identifier)) this.select(element.item);
        this.actions.menu(event.clientX, event.clientY);
      },
      ondragstart: (event) => {
        if (!this.selected.has(element.item.identifier)) this.select(element.item);
        this.isHeld = true;
        this.actions.dragStart(event);
      },
      ondragend: () => {
        this.isHeld = false;
        this.actions.released();
      },
      ondragover: (event) => { if (format.isFolder(element.item)) this.actions.dragOver(event, element, element.item.identifier); },
      ondrop: (event) => { if (format.isFolder(element.item)) this.actions.drop(event, element.item.identifier); },
    });
    this.#fill(element, item);
    return element;
  }

  #fill(element, item) {
    element.item = item;
    const isEdited = this.editing?.identifier === item.identifier;
    // The row's other cells may change; the name is the person's until they are done.
    if (isEdited) return;
    const cell = (name, ...children) => h('div', { class: `cell ${name}`, role: this.layout === 'list' ? 'gridcell' : undefined }, children);
    const marks = [];
    if (item.favoriteRank !== undefined) marks.push(h('span', { class: 'mark', title: 'Favourite' }, icon('star'), h('span', { class: 'unseen' }, 'Favourite')));
    for (const tag of item.tags ?? []) marks.push(h('span', { class: 'label' }, tag));
    const name = h('span', { class: 'name-text', dir: 'auto' }, item.filename);
    if (this.layout === 'list') {
      element.replaceChildren(
        cell('name', this.#picture(item), name, ...marks),
        cell('date', format.date(item.contentModificationDate)),
        cell('size', format.sizeText(item)),
        cell('kind', format.kind(item)));
    } else {
      element.replaceChildren(cell('picture', this.#picture(item)), cell('name', name), cell('marks', ...marks));
    }
  }

  #picture(item) {
    if (item.isAppLibrary) return h('img', { class: 'icon', src: `/thumbnail/${encodeURIComponent(item.identifier)}?size=128`, alt: '', draggable: false, onerror: (event) => event.target.replaceWith(icon('app')) });
    const isSmall = (item.documentSize ?? 0) > 0 && item.documentSize < PICTURE_BYTES_MAX;
    if (this.layout === 'icons' && isSmall && /^image\/(png|jpeg|gif|webp|bmp|avif|svg\+xml)$/.test(item.typeIdentifier)) {
      return h('img', { class: 'icon picture', src: fileAddress(item), alt: '', loading: 'lazy', draggable: false, onerror: (event) => event.target.replaceWith(icon('image')) });
    }
    return icon(format.iconOf(item));
  }

  // MARK: What changes while it is shown

  async refresh() {
    const { source } = this;
    if (!source) return;
    const [first, last] = this.range();
    // What was seen at the top stays there, whatever comes before it.
    const seen = [];
    for (let index = first; index <= last; index += 1) if (source.get(index)) seen.push([source.get(index).identifier, index]);
    await source.refresh(first, last);
    if (source !== this.source) return;
    const columns = this.#columns;
    const places = new Map();
    for (let index = Math.max(0, first - 400); index <= Math.min(source.total - 1, last + 400); index += 1) {
      const item = source.get(index);
      if (item) places.set(item.identifier, index);
    }
    const stayed = seen.find(([identifier]) => places.has(identifier));
    if (stayed && this.scroller.scrollTop > 0) {
      const lines = Math.floor(places.get(stayed[0]) / columns) - Math.floor(stayed[1] / columns);
      if (lines) {
        this.body.style.height = `${Math.ceil(source.total / columns) * this.#lineHeight}px`;
        this.scroller.scrollTop += lines * this.#lineHeight;
      }
    }
    // What is out of sight may be anywhere; what was in sight and is no more is gone.
    for (const [identifier, index] of seen) {
      if (places.has(identifier)) continue;
      this.selected.delete(identifier);
      // The keyboard goes on from where it was.
      if (this.current === identifier) this.current = source.get(Math.min(index, source.total - 1))?.identifier ?? null;
    }
    if (this.editing && !places.has(this.editing.identifier)) this.editing.isAlone = true;
    this.draw();
    this.actions.selectionChanged();
  }

  // MARK: Choosing

  #click(event, element) {
    if (event.target.closest('input')) return;
    const { item } = element;
    if (event.shiftKey) this.#extend(element.index).catch((error) => this.actions.failed(error));
    else if (event.ctrlKey || event.metaKey) this.toggle(item);
    else this.select(item);
    if (!event.shiftKey) this.anchor = element.index;
    this.scroller.focus({ preventScroll: true });
  }

  select(item) {
    this.selected = new Map([[item.identifier, item]]);
    this.current = item.identifier;
    this.#selectionChanged();
  }

  toggle(item) {
    if (!this.selected.delete(item.identifier)) this.selected.set(item.identifier, item);
    this.current = item.identifier;
    this.#selectionChanged();
  }

  clear() {
    this.selected.clear();
    this.#selectionChanged();
  }

  async selectAll() {
    const items = await this.source.all();
    this.selected = new Map(items.map((item) => [item.identifier, item]));
    this.#selectionChanged();
  }

  // After something was made or put there.
  async reveal(identifier) {
    const items = this.source.total <= 2000 ? await this.source.all() : [];
    const index = items.findIndex((item) => item.identifier === identifier);
    if (index < 0) return false;
    this.#goTo(index);
    return true;
  }

  async #extend(to) {
    const from = this.anchor ?? to;
    const { source } = this;
    await source.load(Math.min(from, to), Math.max(from, to));
    if (source !== this.source) return;
    this.selected.clear();
    for (let index = Math.min(from, to); index <= Math.max(from, to); index += 1) {
      const item = this.source.get(index);
      if (item) this.selected.set(item.identifier, item);
    }
    this.current = this.source.get(to)?.identifier ?? this.current;
    this.#selectionChanged();
  }

  #selectionChanged() {
    for (const [identifier, element] of this.elements) element.setAttribute('aria-selected', this.selected.has(identifier));
    this.#markCurrent();
    this.actions.selectionChanged();
  }

  #markCurrent() {
    for (const [identifier, element] of this.elements) element.classList.toggle('current', identifier === this.current);
    if (this.current) this.scroller.setAttribute('aria-activedescendant', `row-${this.current}`);
    else this.scroller.removeAttribute('aria-activedescendant');
  }

  // MARK: Keyboard

  get #index() { return this.elements.get(this.current)?.index ?? -1; }

  async #goTo(index, { extends: isExtended = false } = {}) {
    const to = Math.max(0, Math.min(index, this.source.total - 1));
    await this.source.load(to, to);
    const item = this.source.get(to);
    if (!item) return;
    this.#scrollTo(to);
    this.current = item.identifier;
    this.draw();
    if (isExtended) return this.#extend(to);
    this.anchor = to;
    this.select(item);
  }

  #scrollTo(index) {
    const top = Math.floor(index / this.#columns) * this.#lineHeight;
    const seen = this.scroller.clientHeight - this.#top;
    if (top < this.scroller.scrollTop) this.scroller.scrollTop = top;
    else if (top + this.#lineHeight > this.scroller.scrollTop + seen) this.scroller.scrollTop = top + this.#lineHeight - seen;
  }

  #key(event) {
    if (event.target !== this.scroller || !this.source || event.altKey || event.metaKey) return;
    const columns = this.#columns;
    const page = Math.max(1, Math.floor(this.scroller.clientHeight / this.#lineHeight) - 1) * columns;
    const steps = { ArrowDown: columns, ArrowUp: -columns, PageDown: page, PageUp: -page };
    if (columns > 1) Object.assign(steps, { ArrowLeft: -1, ArrowRight: 1 });
    const at = this.#index;
    if (event.key in steps) this.#goTo(at < 0 ? 0 : at + steps[event.key], { extends: event.shiftKey });
    else if (event.key === 'Home') this.#goTo(0, { extends: event.shiftKey });
    else if (event.key === 'End') this.#goTo(this.source.total - 1, { extends: event.shiftKey });
    else if (event.key === ' ' && event.ctrlKey && at >= 0) this.toggle(this.source.get(at));
    else if (event.key.length === 1 && !event.ctrlKey && event.key !== '/' && event.key !== '?' && (event.key !== ' ' || this.typed)) this.#typeAhead(event.key);
    else return;
    event.preventDefault();
  }

  // The next row whose name begins with what is typed, among what is known.
  #typeAhead(key) {
    clearTimeout(this.typing);
    this.typed = (this.typed ?? '') + key.toLowerCase();
    this.typing = setTimeout(() => { this.typed = ''; }, 800);
    const from = Math.max(this.#index, 0) + (this.typed.length === 1 ? 1 : 0);
    for (let step = 0; step < Math.min(this.source.total, 5000); step += 1) {
      const index = (from + step) % this.source.total;
      if (this.source.get(index)?.filename.toLowerCase().startsWith(this.typed)) return this.#goTo(index);
    }
  }

  // MARK: Renaming in place

  edit(item) {
    const element = this.elements.get(item.identifier);
    const text = element?.querySelector('.name-text');
    if (!text) return;
    let isDone = false;
    const end = (name) => {
      if (isDone) return;
      isDone = true;
      const wasFocused = document.activeElement === input;
      this.editing = null;
      this.#fill(element, element.item);
      this.draw();
      if (wasFocused) this.scroller.focus({ preventScroll: true });
      if (name !== null && name !== '' && name !== item.filename) this.actions.rename(element.item, name);
    };
    const input = h('input', {
      class: 'name-edit', value: item.filename, 'aria-label': `New name of ${item.filename}`, autocomplete: 'off', spellcheck: false,
      onkeydown: (event) => {
        event.stopPropagation();
        if (event.key === 'Enter') end(input.value);
        else if (event.key === 'Escape') end(null);
      },
      onblur: () => { if (input.isConnected) end(input.value); },
    });
    element.draggable = false;
    this.editing = { identifier: item.identifier };
    text.replaceWith(input);
    input.focus();
    const dot = format.isFolder(item) ? -1 : item.filename.lastIndexOf('.');
    input.setSelectionRange(0, dot > 0 ? dot : item.filename.length);
  }
}
