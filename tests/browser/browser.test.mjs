// The page in a real browser, on a real storage, with other programs changing it meanwhile.

import { test, before, after, beforeEach, afterEach } from 'node:test';
import assert from 'node:assert/strict';
import fs from 'node:fs';
import path from 'node:path';
import { execFileSync } from 'node:child_process';
import http from 'node:http';
import { Storage, Daemon, Meddler, launch, watchPage, violations, PATIENCE } from './harness.mjs';

let storage;
let daemon;
let browser;
let context;
let page;
let complaints;

// High enough for the folders of all tests.
const SIZE = { width: 1100, height: 1500 };
// A picture of one dot.
const PNG = Buffer.from('iVBORw0KGgoAAAANSUhEUgAAAAEAAAABCAYAAAAfFcSJAAAADUlEQVR42mNk+M9QDwADhgGAWjR9awAAAABJRU5ErkJggg==', 'base64');
const PDF = ['%PDF-1.4', '1 0 obj<</Type/Catalog/Pages 2 0 R>>endobj', '2 0 obj<</Type/Pages/Kids[3 0 R]/Count 1>>endobj',
  '3 0 obj<</Type/Page/Parent 2 0 R/MediaBox[0 0 99 99]>>endobj', 'trailer<</Root 1 0 R>>', '%%EOF', ''].join('\n');
// A tenth of a second of silence.
const WAV = Buffer.concat([Buffer.from('RIFF\x44\x03\0\0WAVEfmt \x10\0\0\0\x01\0\x01\0\x40\x1f\0\0\x40\x1f\0\0\x01\0\x08\0data\x20\x03\0\0', 'latin1'), Buffer.alloc(800, 128)]);

before(async () => {
  storage = new Storage();
  storage.addApplication('org.example.Sketch', 'Sketch');
  daemon = await Daemon.start(storage);
  browser = await launch();
  context = await browser.newContext({ viewport: SIZE, acceptDownloads: true, reducedMotion: 'reduce' });
  context.setDefaultTimeout(PATIENCE);
  page = await context.newPage();
  complaints = watchPage(page, daemon.origin);
  await page.goto(daemon.link);
  await page.getByRole('heading', { level: 1, name: 'Documents' }).waitFor();
});

after(async () => {
  await browser?.close();
  const status = await daemon?.stop();
  storage?.remove();
  assert.equal(status ?? 0, 0);
});

let number = 0;
let here; // Name of the test's own folder.

beforeEach(async () => {
  number += 1;
  here = `Test ${number}`;
  fs.mkdirSync(storage.path(here));
});

afterEach(async () => {
  await page.keyboard.press('Escape');
  const said = await page.locator('.message.failure span').allTextContents();
  await page.locator('.message .close').evaluateAll((buttons) => buttons.forEach((button) => button.click()));
  assert.deepEqual(said, [], 'what failed');
  assert.deepEqual(complaints.splice(0), []);
});

// MARK: Verbs

const row = (name, on = page) => on.locator('.rows .row').filter({ has: on.locator(`.name-text:text-is("${name}")`) });
const tool = (name) => page.getByRole('toolbar').getByRole('button', { name, exact: true });
const dialog = () => page.getByRole('dialog');
const file = (name, contents = '') => storage.write(path.join(here, name), contents);

async function openHere(names = []) {
  await page.getByRole('navigation', { name: 'Places' }).getByRole('button', { name: 'Documents' }).click();
  await row(here).dblclick();
  await page.getByRole('heading', { level: 1, name: here }).waitFor();
  for (const name of names) await row(name).waitFor();
}

async function goTo(place) {
  await page.getByRole('navigation', { name: 'Places' }).getByRole('button', { name: place }).click();
  await page.getByRole('heading', { level: 1 }).waitFor();
}

async function names() { return page.locator('.rows .row .name-text').allTextContents(); }

// The names in the order in which they are seen.
async function shownNames() {
  return page.locator('.rows .row').evaluateAll((elements) => elements.sort((a, b) => Number(a.ariaRowIndex) - Number(b.ariaRowIndex)).map((each) => each.querySelector('.name-text').textContent));
}

// Waits until it is so.
async function until(what, isSo) {
  const deadline = Date.now() + PATIENCE;
  while (!await isSo()) {
    assert.ok(Date.now() < deadline, `it never came to be so: ${what}`);
    await new Promise((resolve) => { setTimeout(resolve, 20); });
  }
}

// A moment of film: the browser makes it itself.
async function filmOf(on) {
  const bytes = await on.evaluate(async () => {
    const canvas = document.createElement('canvas');
    [canvas.width, canvas.height] = [64, 48];
    const paint = canvas.getContext('2d');
    const recorder = new MediaRecorder(canvas.captureStream(25), { mimeType: 'video/webm;codecs=vp8' });
    const parts = [];
    recorder.ondataavailable = ({ data }) => parts.push(data);
    const ended = new Promise((resolve) => { recorder.onstop = resolve; });
    recorder.start();
    for (let frame = 0; frame < 8; frame += 1) {
      paint.fillStyle = `hsl(${frame * 40} 80% 50%)`;
      paint.fillRect(0, 0, 64, 48);
      await new Promise((resolve) => { requestAnimationFrame(resolve); });
    }
    recorder.stop();
    await ended;
    return [...new Uint8Array(await new Blob(parts).arrayBuffer())];
  });
  return Buffer.from(bytes);
}

const isThere = (name) => until(`${name} is there`, () => storage.has(path.join(here, name)));
const isGone = (name) => until(`${name} is gone`, () => !storage.has(path.join(here, name)));

async function noViolations(what) {
  assert.deepEqual(await violations(page), [], what);
  // Nothing else depends on the colours.
  await page.emulateMedia({ colorScheme: 'dark' });
  assert.deepEqual(await violations(page, ['color-contrast']), [], `${what}, dark`);
  await page.emulateMedia({ colorScheme: 'light' });
}

// A test during which another program is at work in the same folder.
function testAmongOthers(title, work, how) {
  test(title, async () => {
    const other = new Meddler(storage.path(here), how);
    try {
      await work();
    } finally {
      assert.equal(await other.stop(), 0);
    }
  });
}

// MARK: Views

test('a list has its rows in the natural order of names, and in others', async () => {
  file('Scan 10.txt', 'a');
  file('Scan 9.txt', 'abc');
  file('älter.txt', 'ab');
  file('Zoo.txt', '');
  await openHere(['älter.txt', 'Scan 9.txt', 'Scan 10.txt', 'Zoo.txt']);
  assert.deepEqual(await shownNames(), ['älter.txt', 'Scan 9.txt', 'Scan 10.txt', 'Zoo.txt']);
  assert.equal(await page.getByRole('grid').getAttribute('aria-rowcount'), '5');
  await page.getByRole('button', { name: 'Size', exact: true }).click();
  await until('the biggest is first', async () => (await shownNames())[0] === 'Scan 9.txt');
  assert.equal(await page.getByRole('columnheader', { name: 'Size' }).getAttribute('aria-sort'), 'descending');
  assert.equal(await page.evaluate(() => document.activeElement.textContent), 'Size ▾', 'the heading keeps the focus');
  await page.getByRole('button', { name: 'Name', exact: true }).click();
  await until('names again', async () => (await shownNames())[0] === 'älter.txt');
});

test('any view is sorted by any of them, as a list or as icons', async () => {
  const made = { 'b.png': [PNG, 3000], 'a.txt': ['12345', 1000], 'c.pdf': [PDF, 2000] };
  for (const [name, [contents, seconds]] of Object.entries(made)) fs.utimesSync(file(name, contents), seconds, seconds);
  await openHere(['a.txt', 'b.png', 'c.pdf']);
  const orders = { date: 'b.png,c.pdf,a.txt', size: 'c.pdf,b.png,a.txt', kind: 'c.pdf,b.png,a.txt', name: 'a.txt,b.png,c.pdf' };
  const field = page.getByRole('combobox', { name: 'Sort by' });
  const way = page.getByRole('button', { name: 'Descending' });
  const shown = () => page.locator('.rows .row').evaluateAll((elements) => elements
    .sort((a, b) => Number(a.ariaRowIndex ?? a.ariaPosInSet) - Number(b.ariaRowIndex ?? b.ariaPosInSet)).map((each) => each.querySelector('.name-text').textContent).join());
  for (const isIcons of [false, true]) {
    if (isIcons) await tool('Icons').click();
    for (const [by, order] of Object.entries(orders)) {
      await field.selectOption(by);
      await until(`it is sorted by ${by}`, async () => await shown() === order);
      // Two of the orders are the same here: the rows alone don't tell that the page is there yet.
      const pressed = String(by === 'date' || by === 'size');
      await until(`${by} has its own direction`, async () => await way.getAttribute('aria-pressed') === pressed);
    }
    await way.click();
    await until('it is the other way round', async () => await shown() === 'c.pdf,b.png,a.txt');
    await way.click();
    await until('and again', async () => await shown() === 'a.txt,b.png,c.pdf');
  }
  await tool('Icons').click();
  // What is found has an order of its own, and any other.
  for (const name of Object.keys(made)) {
    await row(name).click();
    await tool('Favourite').click();
    await row(name).locator('.mark').waitFor();
  }
  await goTo('Favourites');
  await field.selectOption('name');
  await until('favourites are sorted', async () => await shown() === 'a.txt,b.png,c.pdf');
  await field.selectOption('size');
  await until('favourites are sorted by size', async () => await shown() === 'c.pdf,b.png,a.txt');
  await row('a.txt').click();
  await page.keyboard.press('Control+a');
  await tool('Favourite').click();
  await page.getByText('There are no favourites yet.').waitFor();
});

test('no view has anything that keeps somebody out', async () => {
  file('picture.png', PNG);
  file('notes.txt', 'Notes');
  fs.mkdirSync(storage.path(here, 'Inside'));
  await openHere(['picture.png', 'Inside']);
  await noViolations('list');
  await row('notes.txt').click();
  await tool('Information').click();
  await page.locator('.details dl').waitFor();
  await noViolations('list with information');
  await tool('Icons').click();
  await page.getByRole('listbox').waitFor();
  await noViolations('icons');
  await tool('Icons').click();
  await tool('Information').click();
  await row('notes.txt').dblclick();
  await page.locator('pre:text-is("Notes")').waitFor();
  await noViolations('preview');
  await page.keyboard.press('Escape');
  await tool('Tags…').click();
  await noViolations('tags');
  await page.keyboard.press('Escape');
  await row('notes.txt').click({ button: 'right' });
  await page.getByRole('menu').waitFor();
  await noViolations('menu');
  await page.keyboard.press('Escape');
  await page.setViewportSize({ width: 320, height: 640 });
  await noViolations('320 pixels');
  assert.ok(await page.evaluate(() => document.documentElement.scrollWidth <= 320), 'nothing is cut off');
  await page.setViewportSize(SIZE);
  for (const place of ['Recents', 'Favourites', 'Trash', 'Sketch']) {
    await goTo(place);
    await page.getByRole('heading', { level: 1, name: place }).waitFor();
    await noViolations(place);
  }
  await page.locator('#search').fill('picture');
  await row('picture.png').waitFor();
  await noViolations('search');
  await page.locator('#search').fill('');
  await openHere(['notes.txt']);
  await row('notes.txt').click();
  const opensBy = { 'New folder': 'New folder', 'Move…': 'Move notes.txt', 'Copy…': 'Copy notes.txt' };
  for (const [name, title] of Object.entries(opensBy)) {
    await tool(name).click();
    await page.getByRole('dialog', { name: title }).waitFor();
    await noViolations(name);
    await page.keyboard.press('Escape');
  }
  await page.locator('.scroller').focus();
  await page.keyboard.press('?');
  await page.getByRole('dialog', { name: 'Keys' }).waitFor();
  await noViolations('keys');
  await page.keyboard.press('Escape');
  await row('notes.txt').click();
  await page.keyboard.press('F2');
  await noViolations('a name that is edited');
  await page.locator('.name-edit').fill('picture.png');
  await page.keyboard.press('Enter');
  await dialog().waitFor();
  await noViolations('a name that is taken');
  await dialog().getByRole('button', { name: 'Skip' }).click();
  await tool('Tags…').click();
  await dialog().getByLabel('New tag').fill('Blue');
  await dialog().getByRole('button', { name: 'Done' }).click();
  await page.getByText('Changed the tags of 1 item').waitFor();
  await noViolations('what was done');
  await goTo('Blue');
  await row('notes.txt').waitFor();
  await noViolations('a tag');
  await row('notes.txt').click();
  await tool('Move to trash').click();
  await goTo('Trash');
  await row('notes.txt').click();
  await tool('Delete…').click();
  await noViolations('a question');
  await dialog().getByRole('button', { name: 'Delete' }).click();
  await page.getByText('Deleted 1 item').waitFor();
});

test('nothing is cut off on a narrow screen, and nothing moves for who wants no movement', async () => {
  file('a document with quite a long name that has to be cut somewhere.txt', 'x');
  await openHere();
  await page.locator('.rows .row').first().click();
  await page.setViewportSize({ width: 320, height: 640 });
  const fits = async (what) => assert.ok(await page.evaluate(() => document.documentElement.scrollWidth <= 320), what);
  for (const place of ['Recents', 'Favourites', 'Trash', 'Sketch', 'Documents']) {
    await page.getByRole('button', { name: 'Places' }).click();
    await goTo(place);
    await page.getByRole('heading', { level: 1, name: place }).waitFor();
    await fits(place);
  }
  await row(here).dblclick();
  await page.getByRole('heading', { level: 1, name: here }).waitFor();
  for (const name of ['Icons', 'Information']) {
    await tool(name).click();
    await fits(name);
    await tool(name).click();
  }
  await page.locator('.rows .row').first().click();
  for (const name of ['Move…', 'Tags…', 'Open', 'New folder']) {
    await tool(name).click();
    await dialog().waitFor();
    const box = await dialog().boundingBox();
    assert.ok(box.x >= 0 && box.x + box.width <= 320, name);
    await page.keyboard.press('Escape');
    await dialog().waitFor({ state: 'detached' });
  }
  await page.setViewportSize(SIZE);
  const moving = async () => {
    await tool('Favourite').click();
    const message = page.locator('.message').last();
    await message.waitFor();
    return message.evaluate((element) => getComputedStyle(element).animationName);
  };
  assert.equal(await moving(), 'none');
  await page.emulateMedia({ reducedMotion: 'no-preference' });
  assert.equal(await moving(), 'arrive');
  await page.emulateMedia({ reducedMotion: 'reduce' });
});

test('a folder whose order is not known yet is shown in another', async () => {
  for (const name of ['b 10.txt', 'b 9.txt', 'a.txt']) file(name);
  await openHere(['a.txt']);
  await goTo('Documents');
  let release;
  const released = new Promise((resolve) => { release = resolve; });
  await page.route('**/rpc', async (route) => {
    if (route.request().postData().includes('"sortedItems"')) await released;
    await route.continue();
  });
  await row(here).dblclick();
  await row('b 9.txt').waitFor();
  release();
  await until('the order is there', async () => (await shownNames()).join() === 'a.txt,b 9.txt,b 10.txt');
  await page.unroute('**/rpc');
});

test('an application is a place with its documents', async () => {
  fs.writeFileSync(path.join(storage.folder, 'data', 'org.example.Sketch', 'Documents', 'drawing.txt'), '');
  await goTo('Sketch');
  await row('drawing.txt').waitFor();
  storage.addApplication('org.example.Later', 'Later');
  await page.getByRole('navigation', { name: 'Places' }).getByRole('button', { name: 'Later' }).waitFor();
});

test('search finds as one types', async () => {
  file('Deep/in/the/tree/quixotic plan.txt');
  await openHere(['Deep']);
  await page.keyboard.press('/');
  await page.keyboard.type('quixo');
  await row('quixotic plan.txt').waitFor();
  assert.equal(await page.evaluate(() => document.activeElement.id), 'search', 'the field keeps the focus');
  await page.keyboard.press('Escape');
  await page.getByRole('heading', { level: 1, name: here }).waitFor();
});

test('what is empty and what is not there says what to do', async () => {
  await openHere();
  await page.getByText('This folder is empty. Upload documents, or drop them here.').waitFor();
  await page.evaluate(() => { location.hash = '#folder=fid%3D999999999'; });
  await page.getByRole('alert').getByText('This folder is not there any more.').waitFor();
  await noViolations('what is not there');
  await page.getByRole('button', { name: 'To the documents' }).click();
  await row(here).waitFor();
  // What goes wrong otherwise can be tried again.
  await page.route('**/rpc', (route) => (route.request().postData().includes('"sortedItems"') ? route.fulfill({ status: 503, json: { message: 'Not now' } }) : route.continue()));
  await row(here).dblclick();
  await page.getByText('This can’t be shown: Not now').waitFor();
  await page.unroute('**/rpc');
  await page.getByRole('button', { name: 'Try again' }).click();
  await page.getByText('This folder is empty.').waitFor();
  await noViolations('what is empty');
});

test('information shows every field of an item', async () => {
  file('facts.txt', '12345');
  await openHere(['facts.txt']);
  await row('facts.txt').click();
  await tool('Information').click();
  const details = page.getByRole('complementary', { name: 'Information' });
  for (const text of ['text/plain', '5 bytes (5)', 'Identifier', 'Document number', 'Version']) await details.getByText(text, { exact: true }).waitFor();
  const labels = () => details.locator('dt').allTextContents();
  assert.deepEqual(await labels(), ['Type', 'Size', 'Made', 'Changed', 'Place', 'Application', 'In the trash', 'Synchronised', 'May be', 'Identifier', 'Folder', 'Document number', 'File number', 'Version']);
  // What is given to it meanwhile is shown as it comes, and so is what others write.
  await tool('Favourite').click();
  await details.getByText('Favourite', { exact: true }).waitFor();
  file('facts.txt', '1234567');
  await details.getByText('7 bytes (7)', { exact: true }).waitFor();
  await tool('Information').click();
});

// MARK: Works

testAmongOthers('documents are previewed by what they are', async () => {
  file('picture.png', PNG);
  file('vector.svg', '<svg xmlns="http://www.w3.org/2000/svg" width="9" height="9"><script>parent.document.title="run"</script></svg>');
  file('page.html', '<script>parent.document.title = "run"</script>');
  file('paper.pdf', PDF);
  file('sound.wav', WAV);
  file('blob.bin', Buffer.from([0, 1, 2, 3]));
  file('film.webm', await filmOf(page));
  await openHere(['blob.bin', 'sound.wav']);
  const shows = async (name, selector, isSo) => {
    await row(name).dblclick();
    await dialog().locator(selector).waitFor({ state: 'attached' });
    await until(`${name} is shown`, () => dialog().locator(selector).evaluate(isSo));
    await page.keyboard.press('Escape');
    await dialog().waitFor({ state: 'detached' });
  };
  await shows('picture.png', 'img', (image) => image.naturalWidth === 1);
  await shows('vector.svg', 'img', (image) => image.naturalWidth === 9);
  await shows('page.html', 'pre', (text) => text.textContent.includes('parent.document'));
  await shows('sound.wav', 'audio', (sound) => sound.duration > 0);
  await shows('film.webm', 'video', (film) => film.videoWidth === 64);
  await shows('paper.pdf', 'iframe', (frame) => frame.src.includes('/file/'));
  await shows('blob.bin', 'p', (text) => text.textContent.startsWith('There is no preview'));
  assert.ok(!(await page.title()).includes('run'));
});

testAmongOthers('a document is downloaded', async () => {
  file('take me.html', '<p>contents</p>');
  await openHere(['take me.html']);
  await row('take me.html').click();
  const [download] = await Promise.all([page.waitForEvent('download'), tool('Download').click()]);
  assert.equal(download.suggestedFilename(), 'take me.html');
  assert.equal(fs.readFileSync(await download.path(), 'utf8'), '<p>contents</p>');
});

testAmongOthers('folders, and several items, are downloaded as an archive', async () => {
  file('Album/Deep/leaf.txt', 'leaf');
  file('note.txt', 'note');
  await openHere(['Album', 'note.txt']);
  const unpacked = async () => {
    const [download] = await Promise.all([page.waitForEvent('download'), tool('Download').click()]);
    const into = path.join(storage.folder, `unpacked ${download.suggestedFilename()}`);
    execFileSync('python3', ['-m', 'zipfile', '-e', await download.path(), into]);
    return [download.suggestedFilename(), into];
  };
  await row('Album').click();
  let [name, into] = await unpacked();
  assert.equal(name, 'Album.zip');
  assert.equal(fs.readFileSync(path.join(into, 'Album/Deep/leaf.txt'), 'utf8'), 'leaf');
  await row('note.txt').click({ modifiers: ['Control'] });
  [name, into] = await unpacked();
  assert.equal(name, 'Documents.zip');
  assert.deepEqual(fs.readdirSync(into).sort(), ['Album', 'note.txt']);
});

testAmongOthers('documents and folders are uploaded', async () => {
  const outside = path.join(storage.folder, `outside ${number}`);
  fs.mkdirSync(path.join(outside, 'Album/Deep'), { recursive: true });
  fs.writeFileSync(path.join(outside, 'one.txt'), 'one');
  fs.writeFileSync(path.join(outside, 'two.txt'), 'two');
  fs.writeFileSync(path.join(outside, 'Album/Deep/leaf.txt'), 'leaf');
  await openHere();
  await page.locator('#files').setInputFiles([path.join(outside, 'one.txt'), path.join(outside, 'two.txt')]);
  await row('one.txt').waitFor();
  await row('two.txt').waitFor();
  await page.locator('#folders').setInputFiles(path.join(outside, 'Album'));
  await row('Album').waitFor();
  await isThere('Album/Deep/leaf.txt');
  assert.equal(storage.read(path.join(here, 'Album/Deep/leaf.txt')), 'leaf');
  assert.equal(storage.read(path.join(here, 'two.txt')), 'two');
});

testAmongOthers('documents are uploaded by paste and by drag', async () => {
  await openHere();
  await page.evaluate(() => {
    const transfer = new DataTransfer();
    transfer.items.add(new File(['pasted'], 'pasted.txt'));
    document.activeElement.dispatchEvent(new ClipboardEvent('paste', { clipboardData: transfer, bubbles: true, cancelable: true }));
  });
  await row('pasted.txt').waitFor();
  await page.evaluate(() => {
    const transfer = new DataTransfer();
    transfer.items.add(new File(['dropped'], 'dropped.txt'));
    document.querySelector('.scroller').dispatchEvent(new DragEvent('drop', { dataTransfer: transfer, bubbles: true, cancelable: true }));
  });
  await row('dropped.txt').waitFor();
  assert.equal(storage.read(path.join(here, 'pasted.txt')), 'pasted');
});

testAmongOthers('a whole folder is uploaded by drag', async () => {
  const outside = path.join(storage.folder, `outside ${number}`);
  fs.mkdirSync(path.join(outside, 'Album/Deep/Empty'), { recursive: true });
  for (let each = 0; each < 150; each += 1) fs.writeFileSync(path.join(outside, 'Album', `${each}.txt`), String(each));
  fs.writeFileSync(path.join(outside, 'Album/Deep/leaf.txt'), 'leaf');
  fs.mkdirSync(storage.path(here, 'Target'));
  await openHere(['Target']);
  const client = await context.newCDPSession(page);
  const box = await row('Target').boundingBox();
  const data = { items: [], files: [path.join(outside, 'Album')], dragOperationsMask: 1 };
  for (const type of ['dragEnter', 'dragOver', 'drop']) {
    await client.send('Input.dispatchDragEvent', { type, x: box.x + 60, y: box.y + box.height / 2, data });
  }
  await client.detach();
  await isThere('Target/Album/Deep/Empty');
  await page.getByText('Uploaded').first().waitFor();
  assert.equal(storage.read(path.join(here, 'Target/Album/Deep/leaf.txt')), 'leaf');
  assert.equal(fs.readdirSync(storage.path(here, 'Target/Album')).length, 151);
});

testAmongOthers('a folder is made', async () => {
  await openHere();
  await tool('New folder').click();
  await dialog().getByLabel('Name').fill('Plans');
  await dialog().getByRole('button', { name: 'Make' }).click();
  await row('Plans').waitFor();
  assert.ok(fs.statSync(storage.path(here, 'Plans')).isDirectory());
});

testAmongOthers('a name is changed in place, and changed back', async () => {
  file('draft.txt', 'x');
  await openHere(['draft.txt']);
  await row('draft.txt').click();
  await page.keyboard.press('F2');
  await page.keyboard.type('final');
  await page.keyboard.press('Enter');
  await row('final.txt').waitFor();
  assert.ok(storage.has(path.join(here, 'final.txt')));
  await page.keyboard.press('Control+z');
  await row('draft.txt').waitFor();
});

testAmongOthers('a name that can’t be is refused and said', async () => {
  file('draft.txt');
  await openHere(['draft.txt']);
  await row('draft.txt').click();
  await page.keyboard.press('F2');
  await page.locator('.name-edit').fill('a/b');
  await page.keyboard.press('Enter');
  await page.getByRole('alert').waitFor();
  await row('draft.txt').waitFor();
  await page.getByRole('button', { name: 'Close the message' }).first().click();
});

testAmongOthers('a name that another has is asked about, and what was replaced comes back', async () => {
  file('mine.txt', 'mine');
  file('taken.txt', 'taken');
  await openHere(['mine.txt', 'taken.txt']);
  const renameTo = async (name) => {
    await row('mine.txt').click();
    await page.keyboard.press('F2');
    await page.locator('.name-edit').fill(name);
    await page.keyboard.press('Enter');
  };
  await renameTo('taken.txt');
  await dialog().getByRole('button', { name: 'Keep both' }).click();
  await row('taken 2.txt').waitFor();
  await page.keyboard.press('Control+z');
  await row('mine.txt').waitFor();
  await renameTo('taken.txt');
  await dialog().getByRole('button', { name: 'Skip' }).click();
  await row('mine.txt').waitFor();
  await renameTo('taken.txt');
  await dialog().getByRole('button', { name: 'Replace' }).click();
  await until('it is replaced', () => storage.has(path.join(here, 'taken.txt')) && storage.read(path.join(here, 'taken.txt')) === 'mine');
  await page.getByText('Renamed to taken.txt').waitFor();
  await page.keyboard.press('Control+z');
  await until('both are back', () => storage.has(path.join(here, 'mine.txt')) && storage.has(path.join(here, 'taken.txt')) && storage.read(path.join(here, 'taken.txt')) === 'taken');
});

testAmongOthers('items are moved by drag and by dialog, and back', async () => {
  file('one.txt');
  file('two.txt');
  fs.mkdirSync(storage.path(here, 'Into'));
  await openHere(['one.txt', 'two.txt', 'Into']);
  await row('one.txt').dragTo(row('Into'));
  await isThere('Into/one.txt');
  await row('one.txt').waitFor({ state: 'detached' });
  await page.keyboard.press('Control+z');
  await isThere('one.txt');
  await row('one.txt').waitFor();

  await row('one.txt').click();
  await row('two.txt').click({ modifiers: ['Control'] });
  await tool('Move…').click();
  await dialog().getByRole('button', { name: 'Into' }).click();
  // Its button may still stand beside it.
  await dialog().getByRole('status').filter({ hasText: /^Into$/ }).waitFor();
  await dialog().getByRole('button', { name: 'Move here' }).click();
  await isThere('Into/one.txt');
  await isThere('Into/two.txt');
});

testAmongOthers('items are copied', async () => {
  file('original.txt', 'contents');
  file('Folder/inside.txt', 'inside');
  await openHere(['original.txt', 'Folder']);
  await row('original.txt').click();
  await page.keyboard.press('Control+c');
  await page.keyboard.press('Control+v');
  await row('original 2.txt').waitFor();
  assert.equal(storage.read(path.join(here, 'original 2.txt')), 'contents');
  await row('Folder').click();
  await tool('Copy…').click();
  await dialog().getByRole('button', { name: 'Copy here' }).click();
  await isThere('Folder 2/inside.txt');
});

testAmongOthers('the trash takes items and gives them back, and what is deleted is asked about', async () => {
  file('keep.txt');
  file('rubbish.txt');
  await openHere(['keep.txt', 'rubbish.txt']);
  await row('rubbish.txt').click();
  await page.keyboard.press('Delete');
  await row('rubbish.txt').waitFor({ state: 'detached' });
  await isGone('rubbish.txt');
  await page.getByRole('button', { name: 'Undo' }).last().click();
  await isThere('rubbish.txt');

  await row('keep.txt').click();
  await tool('Move to trash').click();
  await isGone('keep.txt');
  await goTo('Trash');
  await row('keep.txt').click();
  await tool('Put back').click();
  await isThere('keep.txt');

  await openHere(['rubbish.txt']);
  await row('rubbish.txt').click();
  await tool('Move to trash').click();
  await isGone('rubbish.txt');
  await goTo('Trash');
  await row('rubbish.txt').click();
  await tool('Delete…').click();
  await dialog().getByRole('button', { name: 'Cancel' }).click();
  await row('rubbish.txt').waitFor();
  await tool('Delete…').click();
  await dialog().getByRole('button', { name: 'Delete' }).click();
  await row('rubbish.txt').waitFor({ state: 'detached' });
});

testAmongOthers('tags and favourites are given, shown as places, and taken back', async () => {
  file('invoice.txt');
  await openHere(['invoice.txt']);
  await row('invoice.txt').click();
  await tool('Tags…').click();
  await dialog().getByLabel('New tag').fill('Tax');
  await dialog().getByRole('button', { name: 'Done' }).click();
  await page.getByRole('navigation', { name: 'Places' }).getByRole('button', { name: 'Tax' }).click();
  await row('invoice.txt').waitFor();
  await page.keyboard.press('Control+z');
  await row('invoice.txt').waitFor({ state: 'detached' });

  await openHere(['invoice.txt']);
  await row('invoice.txt').click();
  await tool('Favourite').click();
  await row('invoice.txt').locator('.mark').waitFor();
  await goTo('Favourites');
  await row('invoice.txt').waitFor();
  await page.keyboard.press('Control+z');
  await row('invoice.txt').waitFor({ state: 'detached' });
});

testAmongOthers('what was opened is among the recents', async () => {
  file('today.txt', 'x');
  await openHere(['today.txt']);
  await row('today.txt').click();
  await page.keyboard.press('Enter');
  await dialog().waitFor();
  await page.keyboard.press('Escape');
  await goTo('Recents');
  await row('today.txt').waitFor();
});

testAmongOthers('a name that is taken is asked about: keep both, replace, skip, for all', async () => {
  const outside = path.join(storage.folder, `outside ${number}`);
  fs.mkdirSync(outside);
  const send = async (...given) => {
    for (const name of given) fs.writeFileSync(path.join(outside, name), `new ${name}`);
    await page.locator('#files').setInputFiles(given.map((name) => path.join(outside, name)));
  };
  for (const name of ['a.txt', 'b.txt', 'c.txt']) file(name, `old ${name}`);
  await openHere(['a.txt', 'b.txt', 'c.txt']);
  await send('a.txt');
  await dialog().getByRole('button', { name: 'Keep both' }).click();
  await row('a 2.txt').waitFor();
  assert.equal(storage.read(path.join(here, 'a.txt')), 'old a.txt');

  await send('a.txt');
  await dialog().getByRole('button', { name: 'Replace' }).click();
  await until('it is replaced', () => storage.has(path.join(here, 'a.txt')) && storage.read(path.join(here, 'a.txt')) === 'new a.txt');
  await send('b.txt', 'c.txt', 'd.txt');
  await dialog().getByLabel('For all that follow').check();
  await dialog().getByRole('button', { name: 'Skip' }).click();
  await row('d.txt').waitFor();
  assert.equal(storage.read(path.join(here, 'b.txt')), 'old b.txt');
  assert.equal(storage.read(path.join(here, 'c.txt')), 'old c.txt');
  await goTo('Trash');
  await row('a.txt').first().waitFor();
});

testAmongOthers('long work shows how far it is, and is cancelled', async () => {
  await openHere();
  const outside = path.join(storage.folder, 'long.bin');
  fs.writeFileSync(outside, Buffer.alloc(4_000_000));
  const client = await context.newCDPSession(page);
  await client.send('Network.enable');
  await client.send('Network.emulateNetworkConditions', { offline: false, latency: 0, downloadThroughput: -1, uploadThroughput: 20_000 });
  await page.locator('#files').setInputFiles(outside);
  await page.getByRole('progressbar').waitFor();
  await page.getByRole('button', { name: 'Cancel: Upload' }).click();
  await page.getByRole('progressbar').waitFor({ state: 'detached' });
  await client.send('Network.emulateNetworkConditions', { offline: false, latency: 0, downloadThroughput: -1, uploadThroughput: -1 });
  await client.detach();
  assert.ok(!storage.has(path.join(here, 'long.bin')));
  const left = () => fs.readdirSync(storage.path('.TemporaryLocalFolder')).filter((name) => name.startsWith('.staging-'));
  await until('nothing is left behind', () => left().length === 0);
});

testAmongOthers('many items are worked on at once', async () => {
  for (let each = 0; each < 12; each += 1) file(`item ${each}.txt`);
  await openHere(['item 11.txt']);
  await page.locator('.scroller').focus();
  await page.keyboard.press('Control+a');
  await page.getByText('12 items chosen').waitFor({ state: 'attached' });
  await page.keyboard.press('Delete');
  await page.getByText('This folder is empty.').waitFor();
  await page.keyboard.press('Control+z');
  await until('all are back', () => fs.readdirSync(storage.path(here)).length === 12);
}, 'writes');

// MARK: Changes by others

test('changes by others appear, and lose nothing of what is under way', async () => {
  for (let each = 100; each < 400; each += 1) file(`item ${each}.txt`);
  await openHere(['item 100.txt']);
  const scroller = page.locator('.scroller');
  await scroller.evaluate((element) => { element.scrollTop = 4000; });
  await row('item 205.txt').click();
  await page.keyboard.press('F2');
  await page.locator('.name-edit').fill('half a na');
  const placeOf = async () => (await page.locator('.name-edit').boundingBox()).y;
  const before = await placeOf();

  file('aaa new.txt');
  fs.unlinkSync(storage.path(here, 'item 399.txt'));
  fs.writeFileSync(storage.path(here, 'item 204.txt'), 'changed');
  await until('the change is there', async () => (await row('item 204.txt').locator('.size').textContent()) === '7 bytes');
  await until('there is one more, and one less', async () => (await page.getByRole('grid').getAttribute('aria-rowcount')) === '301');
  assert.equal(await page.locator('.name-edit').inputValue(), 'half a na');
  assert.ok(await page.locator('.name-edit').evaluate((element) => element === document.activeElement), 'the focus is where it was');
  assert.ok(Math.abs(await placeOf() - before) < 2, 'the row is where it was');
  await page.keyboard.type('me.txt');
  await page.keyboard.press('Enter');
  await isThere('half a name.txt');

  await row('item 210.txt').click();
  fs.renameSync(storage.path(here, 'item 209.txt'), storage.path(here, 'zzz.txt'));
  await row('item 209.txt').waitFor({ state: 'detached' });
  assert.equal(await row('item 210.txt').getAttribute('aria-selected'), 'true');
  fs.renameSync(storage.path(here, 'item 210.txt'), storage.path(here, 'item 210 renamed.txt'));
  await row('item 210 renamed.txt').waitFor();
  assert.equal(await row('item 210 renamed.txt').getAttribute('aria-selected'), 'true', 'the item is chosen, not its name');
});

test('a folder that goes while it is shown says so', async () => {
  file('Gone/x.txt');
  await openHere(['Gone']);
  await row('Gone').dblclick();
  await row('x.txt').waitFor();
  fs.rmSync(storage.path(here, 'Gone'), { recursive: true });
  await page.getByRole('alert').getByText('This folder is not there any more.').waitFor();
  assert.ok(!await row('x.txt').isVisible());
  await page.getByRole('button', { name: 'To the folder that it was in' }).click();
  await page.getByRole('heading', { level: 1, name: here }).waitFor();
});

test('a folder that gets another name or place while it is shown has it in its path', async () => {
  file('Outer/Inner/x.txt');
  file('Elsewhere/y.txt');
  await openHere(['Outer']);
  await row('Outer').dblclick();
  await row('Inner').dblclick();
  await row('x.txt').waitFor();
  await row('x.txt').click();
  const crumbs = () => page.getByRole('navigation', { name: 'Path' }).locator('li').allTextContents();
  fs.renameSync(storage.path(here, 'Outer/Inner'), storage.path(here, 'Outer/Renamed'));
  await page.getByRole('heading', { level: 1, name: 'Renamed' }).waitFor();
  fs.renameSync(storage.path(here, 'Outer'), storage.path(here, 'Above'));
  await until('the folder above has its name', async () => (await crumbs()).join('/') === `Documents/${here}/Above/Renamed`);
  fs.renameSync(storage.path(here, 'Above/Renamed'), storage.path(here, 'Elsewhere/Renamed'));
  await until('it is where it went', async () => (await crumbs()).join('/') === `Documents/${here}/Elsewhere/Renamed`);
  assert.equal(await row('x.txt').getAttribute('aria-selected'), 'true');
  assert.ok((await page.title()).startsWith('Renamed'));
});

test('rows stay where they are while one is dragged', async () => {
  file('m.txt');
  file('n.txt');
  await openHere(['m.txt', 'n.txt']);
  const box = await row('n.txt').boundingBox();
  await row('m.txt').hover();
  await page.mouse.down();
  await page.mouse.move(box.x + 80, box.y + 10, { steps: 4 });
  file('a new one.txt');
  // Another page sees it; this one holds still.
  const other = await context.newPage();
  await other.goto(`${daemon.origin}/${new URL(page.url()).hash}`);
  await row('a new one.txt', other).waitFor();
  assert.equal(await row('a new one.txt').count(), 0);
  assert.equal((await row('n.txt').boundingBox()).y, box.y);
  await other.close();
  await page.mouse.up();
  await row('a new one.txt').waitFor();
});

test('names of any kind are names', async () => {
  const strange = '<img src=x onerror=alert(1)>&amp;"\'.txt';
  file(strange);
  fs.writeFileSync(Buffer.concat([Buffer.from(storage.path(here)), Buffer.from('/bad \xff.txt', 'latin1')]), '');
  file('\u202Etxt.exe');
  file('new\nline.txt');
  await openHere();
  await until('all are there', async () => (await names()).length === 4);
  assert.ok((await names()).includes(strange));
});

// MARK: Without a mouse

test('everything can be reached by keys alone', async () => {
  file('first.txt', 'first');
  file('second.txt', 'second');
  fs.mkdirSync(storage.path(here, 'A folder'));
  await openHere(['first.txt', 'second.txt', 'A folder']);
  await page.keyboard.press('Home');
  const current = () => page.locator('.scroller').evaluate((element) => document.getElementById(element.getAttribute('aria-activedescendant'))?.querySelector('.name-text').textContent);
  await until('the first is current', async () => await current() === 'A folder');
  await page.keyboard.press('ArrowDown');
  await until('the next is', async () => await current() === 'first.txt');
  await page.keyboard.press('Shift+ArrowDown');
  await until('two are chosen', async () => await page.locator('.row[aria-selected="true"]').count() === 2);
  await page.keyboard.press('a');
  await until('the typed one is current', async () => await current() === 'A folder');
  await page.keyboard.press('Enter');
  await page.getByRole('heading', { level: 1, name: 'A folder' }).waitFor();
  await page.keyboard.press('Backspace');
  await row('second.txt').waitFor();
  await page.keyboard.press('End');
  await page.keyboard.press('Shift+F10');
  await page.getByRole('menuitem', { name: 'Rename' }).waitFor();
  await page.keyboard.press('ArrowDown');
  await page.keyboard.press('ArrowDown');
  await page.keyboard.press('Escape');
  for (let presses = 0; presses < 40; presses += 1) {
    if (await page.evaluate(() => document.activeElement.textContent) === 'Trash') break;
    await page.keyboard.press('Tab');
  }
  assert.equal(await page.evaluate(() => document.activeElement.textContent), 'Trash');
  assert.notEqual(await page.evaluate(() => getComputedStyle(document.activeElement).outlineStyle), 'none', 'where the focus is can be seen');
});

// MARK: Much

test('a big folder has rows only for what is seen', async () => {
  const folder = storage.path(here);
  for (let each = 0; each < 5000; each += 1) fs.writeFileSync(path.join(folder, `${String(each).padStart(5, '0')}.txt`), '');
  await openHere(['00000.txt']);
  await until('all are counted', async () => (await page.getByRole('grid').getAttribute('aria-rowcount')) === '5001');
  assert.ok(await page.locator('.rows .row').count() < 60);
  await page.keyboard.press('End');
  await row('04999.txt').waitFor();
  assert.ok(await page.locator('.rows .row').count() < 60);
  assert.equal(await row('04999.txt').getAttribute('aria-rowindex'), '5001');
  // Also what was never seen is chosen.
  await page.keyboard.press('Home');
  await row('00000.txt').waitFor();
  await page.keyboard.press('Shift+End');
  await page.getByText('5,000 items chosen').waitFor({ state: 'attached' });
  await page.keyboard.press('Escape');
  await page.keyboard.press('Control+a');
  await page.getByText('5,000 items chosen').waitFor({ state: 'attached' });
});

// MARK: Other sites

test('a page of another site gets nothing and does nothing', async () => {
  file('secret.txt', 'secret');
  const { ino } = fs.statSync(storage.path(here));
  const wrong = `<!doctype html><body><iframe src="${daemon.origin}/"></iframe><iframe name="sink"></iframe>
    <form method="post" target="sink" enctype="text/plain" action="${daemon.origin}/rpc"><input name='{"jsonrpc":"2.0","id":1,"method":"createDirectory","params":{"name":"wrong","parent":"fid=${ino}","x":"' value='"}}'></form>
    <form method="post" target="sink" action="${daemon.origin}/upload?parent=fid%3D${ino}&name=wrong"></form><form method="post" target="sink" action="${daemon.origin}/logout"></form>`;
  const site = http.createServer((request, answer) => { answer.setHeader('Content-Type', 'text/html'); answer.end(wrong); });
  await new Promise((resolve) => { site.listen(0, '127.0.0.1', resolve); });
  // The same machine's other port, to which the browser shows the session's cookie; and a name that leads to this machine.
  for (const host of ['127.0.0.1', 'localhost']) {
    const evil = await context.newPage();
    await evil.goto(`http://${host}:${site.address().port}/`);
    const got = await evil.evaluate(async ([origin, folder]) => {
      const tries = { ...Object.fromEntries(['/session', '/events', `/file/${folder}`, '/'].map((target) => [target, () => fetch(origin + target, { credentials: 'include' })])) };
      tries.write = () => fetch(`${origin}/rpc`, { method: 'POST', credentials: 'include', headers: { 'Content-Type': 'application/json' }, body: '{}' });
      tries.blind = async () => { if ((await fetch(`${origin}/upload?parent=${folder}&name=wrong`, { method: 'POST', mode: 'no-cors', credentials: 'include', body: 'x' })).type !== 'opaque') return; throw new Error('opaque'); };
      tries.stream = () => new Promise((resolve, reject) => { const stream = new EventSource(`${origin}/events`, { withCredentials: true }); stream.onopen = resolve; stream.onerror = reject; });
      tries.script = () => new Promise((resolve, reject) => { const script = document.createElement('script'); script.src = `${origin}/session`; script.onload = resolve; script.onerror = reject; document.body.append(script); });
      const done = [];
      for (const [name, attempt] of Object.entries(tries)) await Promise.resolve().then(attempt).then(() => done.push(name), () => {});
      for (const form of document.forms) form.submit();
      return done;
    }, [daemon.origin, `fid=${ino}`]);
    assert.deepEqual(got, [], host);
    for (const form of [0, 1, 2]) {
      await evil.evaluate((index) => new Promise((resolve) => { document.getElementsByName('sink')[0].onload = resolve; document.forms[index].submit(); }), form);
    }
    assert.ok(evil.frames().every((frame) => !frame.url().startsWith(`${daemon.origin}/#`)));
    await evil.close();
  }
  await new Promise((resolve) => { site.close(resolve); site.closeAllConnections(); });
  assert.deepEqual(fs.readdirSync(storage.path(here)), ['secret.txt']);
  await openHere(['secret.txt']);
});

// MARK: Coming and going

test('a link that was used lets nobody in, and signing out ends the session', async () => {
  const other = await browser.newContext();
  other.setDefaultTimeout(PATIENCE);
  const stranger = await other.newPage();
  await stranger.goto(daemon.link);
  await stranger.getByText('This browser has no session.').waitFor();
  assert.ok(!stranger.url().includes('#'), 'the secret is in no address');
  assert.deepEqual(await violations(stranger), []);
  await other.close();
  await page.getByRole('button', { name: 'Sign out' }).click();
  await page.getByText('This browser has no session.').waitFor();
  await page.reload();
  await page.getByText('This browser has no session.').waitFor();
});
