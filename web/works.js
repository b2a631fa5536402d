// What is done with items: each work says how far it is, can be cancelled, asks where a name is taken, and, where that can
// be, is undone.

import { call, upload, RpcError } from './rpc.js';
import { askClash } from './dialogs.js';
import { alternativeName, isFolder, count } from './format.js';

export class Works {
  // `shown` is told of works under way, `say` of what was done: say(text, undo).
  constructor({ shown, say }) {
    this.shown = shown;
    this.say = say;
    this.running = new Set();
    this.undos = [];
  }

  // Does `each` with every item, one after the other. What fails is said; the others go on.
  async #run(title, items, each, { done, undoable = true } = {}) {
    const work = { title, completed: 0, total: items.length, part: 0, isCancelled: false, follow: {} };
    work.follow.progress = ({ completedBytes, totalBytes, completedItems, totalItems }) => {
      work.part = totalBytes ? completedBytes / totalBytes : totalItems ? completedItems / totalItems : 0;
      this.shown(this.running);
    };
    work.cancel = () => {
      work.isCancelled = true;
      work.follow.cancel?.();
    };
    this.running.add(work);
    this.shown(this.running);
    const undos = [];
    const failures = [];
    const results = [];
    const clash = { choice: null };
    for (const item of items) {
      if (work.isCancelled) break;
      work.part = 0;
      try {
        const result = await each(item, work.follow, clash, items.length - work.completed > 1);
        if (result) {
          results.push(result.item ?? item);
          if (result.undo) undos.unshift({ filename: item.filename, run: result.undo });
        }
      } catch (error) {
        if (!(error instanceof RpcError && error.isCancellation)) failures.push(`${item.filename ?? item.name}: ${error.message}`);
      }
      work.completed += 1;
      this.shown(this.running);
    }
    this.running.delete(work);
    this.shown(this.running);
    let undo = null;
    if (undos.length && undoable) {
      const each = async (back) => { await back.run(); return {}; };
      undo = { title, run: () => this.#run(`Undo: ${title}`, undos, each, { undoable: false, done: () => 'Undone' }) };
      this.undos.push(undo);
    }
    if (failures.length) this.say(failures.slice(0, 3).join('\n') + (failures.length > 3 ? `\nand ${failures.length - 3} more` : ''), null, true);
    else if (work.isCancelled) this.say('Cancelled', null);
    else if (results.length && done) this.say(done(results), undo);
    return results;
  }

  async undo(which = this.undos.at(-1)) {
    if (!which || !this.undos.includes(which)) return this.say('There is nothing to undo', null);
    this.undos = this.undos.filter((each) => each !== which);
    return which.run();
  }

  // Tries the name, and asks where it is taken. What is replaced goes to the trash, and into the list.
  async #withName(name, isOfFolder, clash, mayBeMore, attempt, replaced = []) {
    let tried = name;
    let choice = null;
    for (let number = 2; ; ) {
      try {
        return await attempt(tried);
      } catch (error) {
        if (!(error instanceof RpcError && error.isCollision)) throw error;
        choice ??= clash.choice;
        if (!choice) {
          const answer = await askClash(name, error.data.item, mayBeMore);
          ({ choice } = answer);
          if (answer.isForAll) clash.choice = choice;
        }
        if (choice === 'skip') return null;
        if (choice === 'replace') replaced.push(await call('trashItem', { identifier: error.data.item.identifier }));
        else tried = alternativeName(name, isOfFolder, number++);
      }
    }
  }

  // What undoes something by `back`, for which others went to the trash.
  #undoOf(back, replaced) {
    return async () => {
      await back();
      for (const item of replaced) await call('untrashItem', { identifier: item.identifier });
    };
  }

  // MARK: The works

  newFolder(parent, name) {
    return this.#run('New folder', [{ filename: name }], async (_, follow, clash) => {
      const item = await this.#withName(name, true, clash, false, (tried) => call('createDirectory', { parent, name: tried }));
      return item && { item };
    });
  }

  rename(item, name) {
    return this.#run('Rename', [item], async (_, follow, clash) => {
      const replaced = [];
      const renamed = await this.#withName(name, isFolder(item), clash, false,
        (tried) => call('renameItem', { identifier: item.identifier, name: tried }), replaced);
      return renamed && { item: renamed, undo: this.#undoOf(() => call('renameItem', { identifier: renamed.identifier, name: item.filename }), replaced) };
    }, { done: ([renamed]) => `Renamed to ${renamed.filename}` });
  }

  move(items, parent) {
    const moving = items.filter((item) => item.parentIdentifier !== parent && item.identifier !== parent);
    return this.#run('Move', moving, async (item, follow, clash, mayBeMore) => {
      const replaced = [];
      const moved = await this.#withName(item.filename, isFolder(item), clash, mayBeMore,
        (name) => call('reparentItem', { identifier: item.identifier, parent, name }, follow), replaced);
      return moved && {
        item: moved,
        undo: this.#undoOf(() => call('reparentItem', { identifier: moved.identifier, parent: item.parentIdentifier, name: item.filename }), replaced),
      };
    }, { done: (results) => `Moved ${count(results.length)}` });
  }

  copy(items, parent) {
    return this.#run('Copy', items, async (item, follow, clash, mayBeMore) => {
      // A copy beside its original is meant to be kept beside it.
      const own = item.parentIdentifier === parent ? { choice: 'keep' } : clash;
      const copied = await this.#withName(item.filename, isFolder(item), own, mayBeMore,
        (name) => call('copyItem', { identifier: item.identifier, parent, name }, follow));
      return copied && { item: copied };
    }, { done: (results) => `Copied ${count(results.length)}` });
  }

  trash(items) {
    return this.#run('Move to the trash', items, async (item) => {
      const trashed = await call('trashItem', { identifier: item.identifier });
      return { item: trashed, undo: () => call('untrashItem', { identifier: trashed.identifier }) };
    }, { done: (results) => `${count(results.length)} in the trash` });
  }

  putBack(items) {
    return this.#run('Put back', items, async (item) => {
      const back = await call('untrashItem', { identifier: item.identifier });
      return { item: back };
    }, { done: (results) => `Put back ${count(results.length)}` });
  }

  delete(items) {
    return this.#run('Delete', items, async (item, follow) => {
      await call('deleteItem', { identifier: item.identifier }, follow);
      return {};
    }, { done: (results) => `Deleted ${count(results.length)}` });
  }

  tag(changes) {
    const changed = changes.filter(({ item, tags }) => (item.tags ?? []).join('\0') !== tags.join('\0'));
    return this.#run('Tags', changed.map(({ item, tags }) => ({ ...item, wanted: tags })), async (item) => {
      const tagged = await call('setTags', { identifier: item.identifier, tags: item.wanted });
      return { item: tagged, undo: () => call('setTags', { identifier: tagged.identifier, tags: item.tags ?? [] }) };
    }, { done: (results) => `Changed the tags of ${count(results.length)}` });
  }

  favorite(items, isFavorite) {
    return this.#run('Favourites', items, async (item) => {
      const before = item.favoriteRank ?? null;
      const changed = await call('setFavoriteRank', { identifier: item.identifier, rank: isFavorite ? Date.now() : null });
      return { item: changed, undo: () => call('setFavoriteRank', { identifier: changed.identifier, rank: before }) };
    }, { done: (results) => (isFavorite ? `${count(results.length)} among the favourites` : `${count(results.length)} no longer among the favourites`) });
  }

  // `entries`: {file, folders: names of the folders that lead to it}; without a file, an empty folder.
  async upload(entries, parent) {
    const folders = new Map([['', parent]]);
    const folder = async (names) => {
      const path = names.join('/');
      if (folders.has(path)) return folders.get(path);
      const above = await folder(names.slice(0, -1));
      let made;
      try {
        made = await call('createDirectory', { parent: above, name: names.at(-1) });
      } catch (error) {
        if (!(error instanceof RpcError && error.isCollision)) throw error;
        // A folder of that name takes what comes, as it does everywhere else.
        if (!isFolder(error.data.item)) throw error;
        made = error.data.item;
      }
      folders.set(path, made.identifier);
      return made.identifier;
    };
    return this.#run('Upload', entries.map((entry) => ({ ...entry, filename: entry.file?.name ?? entry.folders.join('/') })), async (entry, follow, clash, mayBeMore) => {
      const target = await folder(entry.folders);
      if (!entry.file) return {};
      const item = await this.#withName(entry.file.name, false, clash, mayBeMore, (name) => upload(entry.file, target, name, follow));
      return item && { item };
    }, { done: (results) => `Uploaded ${count(results.length)}` });
  }
}

// What was dropped or pasted: files, and what is in folders.
export async function entriesOf(transfer) {
  // Before anything is waited for: afterwards there is nothing in there any more.
  const roots = [...transfer.items].filter((item) => item.kind === 'file').map((item) => item.webkitGetAsEntry?.() ?? item.getAsFile()).filter(Boolean);
  const entries = [];
  const walk = async (entry, folders) => {
    if (entry instanceof File) entries.push({ file: entry, folders });
    else if (entry.isFile) entries.push({ file: await new Promise((resolve, reject) => { entry.file(resolve, reject); }), folders });
    else if (entry.isDirectory) {
      const inside = [...folders, entry.name];
      entries.push({ file: null, folders: inside });
      const reader = entry.createReader();
      for (;;) {
        const some = await new Promise((resolve, reject) => { reader.readEntries(resolve, reject); });
        if (!some.length) break;
        for (const each of some) await walk(each, inside);
      }
    }
  };
  for (const root of roots) await walk(root, []);
  return entries;
}

// What a field for files or folders was given.
export function entriesOfFiles(files) {
  return [...files].map((file) => ({ file, folders: file.webkitRelativePath ? file.webkitRelativePath.split('/').slice(0, -1) : [] }));
}
