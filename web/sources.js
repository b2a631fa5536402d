// Where the rows of a view come from, a page at a time. A source knows as much as was looked at.

import { call, listen, ROOT } from './rpc.js';
import { collator, kind, isFolder } from './format.js';

// More rows than most screens show; each costs the host a look at its file.
const PAGE = 100;
// For what is done with all of them: as many as the host gives at once, so many times at a time.
const RUN = 10;
const RUNS_AT_ONCE = 3;
// Milliseconds until somebody who waits for an order is shown another.
const PATIENCE = 400;
// Where the provider builds what is not to be seen before it is whole.
const isWorkshop = (item) => item.filename === '.TemporaryLocalFolder' && item.parentIdentifier === ROOT;

// An order that is made here, for what the host gives in one of its own.
function comparatorOf(sort) {
  const byName = (a, b) => collator.compare(a.filename, b.filename);
  const by = {
    name: byName,
    date: (a, b) => new Date(a.contentModificationDate ?? 0) - new Date(b.contentModificationDate ?? 0),
    size: (a, b) => (a.documentSize ?? -1) - (b.documentSize ?? -1),
    kind: (a, b) => isFolder(b) - isFolder(a) || collator.compare(kind(a), kind(b)),
  }[sort.by];
  const way = sort.descending ? -1 : 1;
  return (a, b) => way * by(a, b) || byName(a, b);
}

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
      if (this.isStopped) this.#unwatch();
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
    this.#unwatch();
  }

  #unwatch() {
    if (this.watch !== null) call('unwatchQuery', { watch: this.watch }).catch(() => {});
    this.watch = null;
  }
}

// Tells when what a folder holds may be other items, or items of other names.
export class FolderWatch extends Source {
  constructor(container, onchange) {
    super();
    this.onchange = onchange;
    this.follow({ query: 'sortedItems', container });
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
    const waited = [];
    const runs = [];
    for (let page = Math.floor(first / PAGE); page <= Math.floor((last + 1) / PAGE); page += 1) {
      if (this.pages.has(page) || page * PAGE >= Math.max(this.known, 1)) continue;
      if (this.loading.has(page)) waited.push(this.loading.get(page));
      else if (runs.length && runs.at(-1).page + runs.at(-1).count === page && runs.at(-1).count < RUN) runs.at(-1).count += 1;
      else runs.push({ page, count: 1 });
    }
    const isNews = waited.length + runs.length > 0;
    const work = async () => { while (runs.length) { const { page, count } = runs.shift(); await this.#fetch(page, count); } };
    await Promise.all([...waited, ...Array.from({ length: RUNS_AT_ONCE }, work)]);
    return isNews;
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

  #ask(page, count = 1) {
    return call('sortedItems', {
      container: this.container, sort: this.sort.by, descending: this.sort.descending, offset: page * PAGE, limit: PAGE * count,
    });
  }

  #fetch(page, count = 1) {
    const { generation } = this;
    const loading = this.#ask(page, count).then((answer) => {
      if (generation !== this.generation) return;
      for (let each = 0; each < count; each += 1) {
        this.loading.delete(page + each);
        this.#take(page + each, answer.items.slice(each * PAGE, (each + 1) * PAGE));
      }
      this.total = answer.total;
      this.isComplete = true;
    }, (error) => {
      if (generation === this.generation) for (let each = 0; each < count; each += 1) this.loading.delete(page + each);
      throw error;
    });
    for (let each = 0; each < count; each += 1) this.loading.set(page + each, loading);
    return loading;
  }

  // All items, for what is done with all of them. A change on the way lets what was known go: then once more.
  async all() {
    let before;
    do {
      before = this.generation;
      await this.load(0, Math.max(this.total - 1, 0));
    } while (before !== this.generation && !this.isStopped);
    const items = [];
    for (let index = 0; index < this.total; index += 1) if (this.get(index)) items.push(this.get(index));
    return items;
  }
}

// What the host finds by a question, one page after the other.
export class QuerySource extends Source {
  // With a `sort` all that is found is fetched, and brought into that order.
  constructor(method, params = {}, { follows = true, keeps = () => true, sort = null } = {}) {
    super();
    this.sort = sort;
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
      const answer = await call(this.method, { ...this.params, limit: this.sort ? PAGE * RUN : PAGE, ...(page ? { page } : {}) });
      items.push(...answer.items.filter(this.keeps));
      page = answer.nextPage;
    } while (page && (this.sort || items.length < least));
    if (this.sort) items.sort(comparatorOf(this.sort));
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
    items.sort(comparatorOf(this.sort));
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
