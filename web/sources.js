// Where the rows of a view come from, a page at a time. A source knows as much as was looked at.

import { call, listen, ROOT } from './rpc.js';
import { collator, kind, isFolder } from './format.js';

const PAGE = 200;
// Milliseconds until somebody who waits for an order is shown another.
const PATIENCE = 400;
// Where the provider builds what is not to be seen before it is whole.
const isWorkshop = (item) => item.filename === '.TemporaryLocalFolder' && item.parentIdentifier === ROOT;

class Source {
  constructor() {
    this.total = 0;
    this.isComplete = false; // Whether `total` is all there is.
    this.onchange = () => {};
    this.watch = null;
    this.stops = [];
  }

  // Tells `onchange` when what it answers may be another, from now on.
  async follow(query) {
    const begin = async () => {
      try {
        this.watch = (await call('watchQuery', query)).watch;
      } catch {
        this.watch = null; // What can't be watched is looked at when somebody asks.
      }
    };
    this.stops.push(listen('queryChanged', ({ watch }) => { if (watch === this.watch) this.onchange(); }));
    this.stops.push(listen('connected', async () => {
      await begin();
      this.onchange();
    }));
    await begin();
  }

  stop() {
    this.isStopped = true;
    for (const each of this.stops.splice(0)) each();
    if (this.watch !== null) call('unwatchQuery', { watch: this.watch }).catch(() => {});
    this.watch = null;
  }
}

// A folder in an order that the host's index keeps.
export class SortedSource extends Source {
  constructor(container, sort) {
    super();
    this.container = container;
    this.sort = sort;
    this.pages = new Map();
    this.loading = new Map();
    this.generation = 0;
    this.known = 0; // Items that the host counts.
    this.left = null; // Index of the one that is left out, once it was met.
  }

  get total() { return this.known - (this.left === null ? 0 : 1); }

  set total(value) { this.known = value; }

  #take(page, items) {
    this.pages.set(page, items);
    if (this.container !== ROOT) return;
    const found = items.findIndex(isWorkshop);
    if (found >= 0) this.left = page * PAGE + found;
  }

  async open() {
    const [first] = await Promise.all([
      this.#fetch(0), this.follow({ query: 'sortedItems', container: this.container })]);
    return first;
  }

  get(index) {
    const place = this.left !== null && index >= this.left ? index + 1 : index;
    return this.pages.get(Math.floor(place / PAGE))?.[place % PAGE];
  }

  // Makes rows from `first` to `last` known; false where they were.
  async load(first, last) {
    const wanted = [];
    for (let page = Math.floor(first / PAGE); page <= Math.floor((last + 1) / PAGE); page += 1) {
      if (!this.pages.has(page) && page * PAGE < Math.max(this.known, 1)) wanted.push(this.#fetch(page));
    }
    await Promise.all(wanted);
    return wanted.length > 0;
  }

  // Everything that was known is looked at again, what is seen first.
  async refresh(first, last) {
    this.generation += 1;
    this.loading.clear();
    const from = Math.floor(first / PAGE);
    const to = Math.floor(last / PAGE);
    const fresh = new Map();
    for (let page = from; page <= to; page += 1) fresh.set(page, null);
    const generation = this.generation;
    await Promise.all([...fresh.keys()].map(async (page) => { fresh.set(page, await this.#ask(page)); }));
    if (generation !== this.generation) return;
    const wasLeft = this.left !== null && this.pages.get(Math.floor(this.left / PAGE));
    if (wasLeft && fresh.has(Math.floor(this.left / PAGE))) this.left = null;
    this.pages = new Map();
    for (const [page, answer] of fresh) this.#take(page, answer.items);
    this.total = fresh.get(from).total;
  }

  #ask(page) {
    return call('sortedItems', {
      container: this.container, sort: this.sort.by, descending: this.sort.descending, offset: page * PAGE, limit: PAGE,
    });
  }

  #fetch(page) {
    if (this.loading.has(page)) return this.loading.get(page);
    const { generation } = this;
    const loading = this.#ask(page).then((answer) => {
      if (generation !== this.generation) return;
      this.#take(page, answer.items);
      this.total = answer.total;
      this.isComplete = true;
    }).finally(() => this.loading.delete(page));
    this.loading.set(page, loading);
    return loading;
  }

  // All items, for what is done with all of them.
  async all() {
    await this.load(0, Math.max(this.total - 1, 0));
    const items = [];
    for (let index = 0; index < this.total; index += 1) if (this.get(index)) items.push(this.get(index));
    return items;
  }
}

// What the host finds by a question, one page after the other.
export class QuerySource extends Source {
  constructor(method, params = {}, { follows = true, keeps = () => true } = {}) {
    super();
    this.follows = follows;
    this.keeps = keeps;
    this.method = method;
    this.params = params;
    this.items = [];
    this.next = null;
    this.loadingMore = null;
  }

  async open() {
    await Promise.all([this.#read(PAGE), this.follows ? this.follow({ query: this.method, ...this.params }) : null]);
  }

  get(index) { return this.items[index]; }

  async load(first, last) {
    if (this.isComplete || last < this.items.length - 1) return false;
    this.loadingMore ??= this.#more(this.items).finally(() => { this.loadingMore = null; });
    await this.loadingMore;
    return true;
  }

  async refresh() { await this.#read(Math.max(this.items.length, PAGE)); }

  async #read(least) {
    const items = [];
    let page = null;
    do {
      const answer = await call(this.method, { ...this.params, limit: PAGE, ...(page ? { page } : {}) });
      items.push(...answer.items.filter(this.keeps));
      page = answer.nextPage;
    } while (page && items.length < least);
    this.#take(items, page);
  }

  async #more(before) {
    const answer = await call(this.method, { ...this.params, limit: PAGE, page: this.next });
    if (before === this.items) this.#take([...before, ...answer.items.filter(this.keeps)], answer.nextPage);
  }

  #take(items, page) {
    this.items = items;
    this.next = page;
    this.total = items.length;
    this.isComplete = !page;
  }

  async all() {
    while (!this.isComplete) await this.load(0, this.items.length);
    return this.items;
  }
}

// A folder whose order the host doesn't know: the provider's listing, in an order made here.
export class ListedSource extends Source {
  constructor(container, sort) {
    super();
    this.container = container;
    this.sort = sort;
    this.items = [];
  }

  async open() {
    this.stops.push(listen('signal', ({ container }) => { if (container === this.container) this.onchange(); }));
    const begin = () => call('startMonitoring', { container: this.container });
    this.stops.push(listen('connected', async () => {
      await begin();
      this.onchange();
    }));
    await begin();
    await this.refresh();
  }

  get(index) { return this.items[index]; }

  async load() { return false; }

  async refresh() {
    const items = [];
    let page = null;
    do {
      const answer = await call('enumerateItems', { container: this.container, ...(page ? { page } : {}) });
      items.push(...answer.items.filter((item) => this.container !== ROOT || item.parentIdentifier === ROOT));
      page = answer.nextPage;
    } while (page);
    const by = {
      name: (a, b) => collator.compare(a.filename, b.filename),
      date: (a, b) => (a.contentModificationDate ?? '').localeCompare(b.contentModificationDate ?? ''),
      size: (a, b) => (a.documentSize ?? -1) - (b.documentSize ?? -1),
      kind: (a, b) => isFolder(b) - isFolder(a) || collator.compare(kind(a), kind(b)),
    }[this.sort.by];
    const way = this.sort.descending ? -1 : 1;
    items.sort((a, b) => way * by(a, b) || collator.compare(a.filename, b.filename));
    this.items = items;
    this.total = items.length;
    this.isComplete = true;
  }

  stop() {
    super.stop();
    call('stopMonitoring', { container: this.container }).catch(() => {});
  }

  async all() { return this.items; }
}

// The rows of a folder: the host's order where it has one. Where it has none yet, the provider's own for now, and `better`
// is the promise of the other.
export async function openFolder(container, sort) {
  const source = new SortedSource(container, sort);
  const sorted = source.open().then(() => source, async (error) => {
    source.stop();
    if (!error.isUnknownMethod) throw error;
    const listed = new ListedSource(container, sort);
    await listed.open();
    return listed;
  });
  const inTime = await Promise.race([sorted, new Promise((resolve) => { setTimeout(() => resolve(null), PATIENCE); })]);
  if (inTime) return inTime;
  const isHere = (item) => container !== ROOT || (item.parentIdentifier === ROOT && !isWorkshop(item));
  const now = new QuerySource('enumerateItems', { container }, { follows: false, keeps: isHere });
  await now.open();
  now.better = sorted;
  return now;
}
