// Takes the pictures that the README shows, and every view in light and dark, to be looked at.
//
// usage: CINDRAL_PROGRAM=… CINDRAL_NODE_MODULES=… node tests/browser/pictures.mjs FOLDER

import fs from 'node:fs';
import path from 'node:path';
import { Storage, Daemon, launch } from './harness.mjs';

const into = process.argv[2];
const HARBOUR = '<svg xmlns="http://www.w3.org/2000/svg" viewBox="0 0 54 40"><path fill="#8ec3e6" d="M0 0h54v24H0z"/><path fill="#2f7195" d="M0 24h54v16H0z"/><path fill="#fff" d="M27 8v16h-9z"/><path fill="#b5322f" d="M17 24h20l-3 5H20z"/></svg>';
const HILLS = '<svg xmlns="http://www.w3.org/2000/svg" viewBox="0 0 54 40"><path fill="#f8d9a4" d="M0 0h54v40H0z"/><circle cx="40" cy="12" r="5" fill="#ef7f3c"/><path fill="#5b8a4c" d="M0 40l16-24 14 18 8-10 16 16z"/></svg>';

const storage = new Storage();
storage.addApplication('org.example.Sketch', 'Sketch');
storage.write('Budget.csv', 'a,b\n1,2\n');
storage.write('Harbour.svg', HARBOUR);
storage.write('Hills.svg', HILLS);
for (const name of ['Letters/Ada.txt', 'Letters/Grace.txt', 'Recipes/Bread.txt', 'Recipes/Soup.txt', 'Song.tonemill/score']) storage.write(name, name);
storage.write('Plan for the garden.txt', 'Peas along the wall.\nBeans behind them.\n'.repeat(60));
for (let number = 7; number <= 12; number += 1) storage.write(`Scan ${number}.txt`, 'x'.repeat(13_100 * number));
const given = path.join(storage.folder, 'Budget.csv');
fs.writeFileSync(given, 'a,b\n3,4\n');

const daemon = await Daemon.start(storage);
const browser = await launch();
try {
  const page = await browser.newPage({ viewport: { width: 1240, height: 620 }, reducedMotion: 'reduce' });
  await page.goto(daemon.link);
  const row = (name) => page.locator('.rows .row').filter({ has: page.locator(`.name-text:text-is("${name}")`) });
  const tool = (name) => page.getByRole('toolbar').getByRole('button', { name, exact: true });
  const place = async (name) => {
    await page.getByRole('navigation', { name: 'Places' }).getByRole('button', { name }).click();
    await page.getByRole('heading', { level: 1, name }).waitFor();
  };
  const take = async (name) => {
    for (const colorScheme of ['light', 'dark']) {
      await page.emulateMedia({ colorScheme });
      await page.screenshot({ path: path.join(into, `${name}${colorScheme === 'dark' ? ' dark' : ''}.png`) });
    }
    await page.emulateMedia({ colorScheme: 'light' });
  };
  const quiet = () => page.locator('.message .close').evaluateAll((buttons) => buttons.forEach((button) => button.click()));

  await row('Budget.csv').click();
  await tool('Favourite').click();
  await row('Budget.csv').locator('.mark').waitFor();
  await row('Plan for the garden.txt').click();
  await tool('Tags…').click();
  await page.getByRole('dialog').getByLabel('New tag').fill('Spring');
  await take('tags');
  await page.getByRole('dialog').getByRole('button', { name: 'Done' }).click();
  await page.getByRole('navigation', { name: 'Places' }).getByRole('button', { name: 'Spring' }).waitFor();
  await quiet();
  await tool('Information').click();
  await page.locator('.details dl').waitFor();
  await take('list');
  await tool('Information').click();
  await tool('Icons').click();
  await page.locator('.picture').first().waitFor();
  await page.evaluate(() => Promise.all([...document.querySelectorAll('.picture img, img.picture')].map((image) => image.decode())));
  await take('icons');
  await tool('Icons').click();
  await page.locator('#files').setInputFiles(given);
  await page.getByRole('dialog').waitFor();
  await take('clash');
  await page.getByRole('dialog').getByRole('button', { name: 'Skip' }).click();
  await row('Plan for the garden.txt').dblclick();
  await page.locator('pre:has-text("Peas")').waitFor();
  await take('preview');
  await page.keyboard.press('Escape');
  await row('Scan 9.txt').click({ button: 'right' });
  await page.getByRole('menu').waitFor();
  await take('menu');
  await page.keyboard.press('Escape');
  await tool('Move…').click();
  await page.getByRole('dialog').getByRole('button', { name: 'Letters' }).waitFor();
  await take('move');
  await page.keyboard.press('Escape');
  await row('Scan 12.txt').click();
  await tool('Move to trash').click();
  await row('Scan 12.txt').waitFor({ state: 'detached' });
  await page.setViewportSize({ width: 320, height: 560 });
  await take('narrow');
  await page.setViewportSize({ width: 1240, height: 620 });
  await quiet();
  for (const name of ['Recents', 'Favourites', 'Spring', 'Trash', 'Sketch']) {
    await place(name);
    await take(name.toLowerCase());
  }
  await page.locator('#search').fill('scan');
  await row('Scan 9.txt').waitFor();
  await take('search');
  await page.evaluate(() => { location.hash = '#folder=fid%3D999999999'; });
  await page.getByRole('alert').waitFor();
  await take('gone');
  await page.getByRole('button', { name: 'Sign out' }).click();
  await page.getByText('This browser has no session.').waitFor();
  await take('signed out');
} finally {
  await browser.close();
  await daemon.stop();
  storage.remove();
}
