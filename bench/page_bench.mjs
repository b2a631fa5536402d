// The page in Chromium on a big folder: until the first rows are there, and until a change on the disk is a row.
//
// usage: node page_bench.mjs STORAGE STATE, by http_bench.py --page

import { spawn } from 'node:child_process';
import fs from 'node:fs';
import path from 'node:path';
import readline from 'node:readline';
import { launch } from '../tests/browser/harness.mjs';

const [storage, state] = process.argv.slice(2);
const daemon = spawn(process.env.CINDRAL_PROGRAM, ['serve', '--http', '--json', '--storage', storage, '--state', state, '--no-flatpak'], { stdio: ['ignore', 'pipe', 'ignore'] });
const [line] = await new Promise((resolve) => { readline.createInterface({ input: daemon.stdout }).once('line', (text) => resolve([text])); });
const browser = await launch();
const middle = (values) => values.sort((a, b) => a - b)[Math.floor(values.length / 2)];
try {
  const page = await browser.newPage({ viewport: { width: 1100, height: 700 } });
  await page.goto(JSON.parse(line).url);
  const rows = page.locator('.rows .row');
  await rows.first().waitFor();
  const identifier = (await rows.first().getAttribute('id')).replace('row-', '');
  // Measured in the page: from the click to the frame that shows the rows.
  const show = (address, name) => page.evaluate(([hash, first]) => new Promise((resolve) => {
    const begin = performance.now();
    const seen = new MutationObserver(() => {
      if (document.querySelector('.rows .row .name-text')?.textContent !== first) return;
      seen.disconnect();
      requestAnimationFrame(() => requestAnimationFrame(() => resolve(performance.now() - begin)));
    });
    seen.observe(document.body, { subtree: true, childList: true, characterData: true });
    location.hash = hash;
  }), [address, name]);
  const openings = [];
  for (let round = 0; round < 11; round += 1) {
    openings.push(await show(`#folder=${encodeURIComponent(identifier)}`, 'Document 0.txt'));
    await show('#', 'Big');
  }
  console.log(`the first screen of the folder: median ${middle(openings).toFixed(0)} ms, longest ${Math.max(...openings).toFixed(0)} ms`);
  await show(`#folder=${encodeURIComponent(identifier)}`, 'Document 0.txt');
  // The clock is one; what the driver of the browser adds is not in it.
  const now = () => performance.timeOrigin + performance.now();
  const appears = (name) => page.evaluate((wanted) => new Promise((resolve) => {
    const seen = new MutationObserver(() => {
      if (![...document.querySelectorAll('.rows .name-text')].some((each) => each.textContent === wanted)) return;
      seen.disconnect();
      requestAnimationFrame(() => resolve(performance.timeOrigin + performance.now()));
    });
    seen.observe(document.body, { subtree: true, childList: true, characterData: true });
  }), name);
  const changes = [];
  for (let round = 0; round < 21; round += 1) {
    await new Promise((resolve) => { setTimeout(resolve, 1_500); });
    const name = `a new one ${round}.txt`;
    const appeared = appears(name);
    await page.evaluate(() => {});
    const begin = now();
    fs.writeFileSync(path.join(storage, 'Big', name), '');
    changes.push(await appeared - begin);
  }
  console.log(`a change on the disk until its row is there: median ${middle(changes).toFixed(0)} ms, longest ${Math.max(...changes).toFixed(0)} ms`);
  // A screen's height at each frame, all rows of 500 screens.
  const frames = await page.evaluate(() => new Promise((resolve) => {
    const scroller = document.querySelector('.scroller');
    const times = [];
    const step = (time) => {
      times.push(time);
      scroller.scrollTop += scroller.clientHeight;
      if (times.length < 500) requestAnimationFrame(step);
      else resolve(times.slice(1).map((each, index) => each - times[index]).sort((a, b) => a - b));
    };
    requestAnimationFrame(step);
  }));
  console.log(`scrolling by a screen a frame: median ${middle(frames).toFixed(0)} ms a frame, 95th percentile ${frames[Math.floor(frames.length * 0.95)].toFixed(0)} ms, longest ${frames.at(-1).toFixed(0)} ms`);
} finally {
  await browser.close();
  daemon.kill('SIGTERM');
}
