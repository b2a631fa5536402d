// A storage of its own, a daemon that serves it, and a real browser that was let in.

import { spawn, execFileSync } from 'node:child_process';
import fs from 'node:fs';
import os from 'node:os';
import path from 'node:path';
import readline from 'node:readline';
import { createRequire } from 'node:module';

const require = createRequire(path.join(process.env.CINDRAL_NODE_MODULES, 'anchor.js'));
const { chromium } = require('playwright-core');
const axe = fs.readFileSync(require.resolve('axe-core/axe.min.js'), 'utf8');

// A test that waits this long has failed; nothing is measured by it.
export const PATIENCE = Number(process.env.CINDRAL_PATIENCE ?? 60_000);

export class Storage {
  constructor() {
    this.folder = fs.realpathSync(fs.mkdtempSync(path.join(os.tmpdir(), 'cindral-browser-')));
    this.root = path.join(this.folder, 'Documents');
    this.applications = path.join(this.folder, 'applications');
    fs.mkdirSync(this.root);
    fs.mkdirSync(this.applications);
  }

  path(...names) { return path.join(this.root, ...names); }

  write(name, contents = '') {
    fs.mkdirSync(path.dirname(this.path(name)), { recursive: true });
    fs.writeFileSync(this.path(name), contents);
    return this.path(name);
  }

  read(name) { return fs.readFileSync(this.path(name), 'utf8'); }

  has(name) { return fs.existsSync(this.path(name)); }

  // An application whose documents are published.
  addApplication(identifier, name) {
    const container = path.join(this.folder, 'data', identifier);
    fs.mkdirSync(path.join(container, 'Documents'), { recursive: true });
    fs.writeFileSync(path.join(this.applications, `${identifier}.desktop`), ['[Desktop Entry]', 'Type=Application', `Name=${name}`,
      'Exec=true', 'X-Cindral-SupportsDocumentBrowser=true', `X-Cindral-DataContainer=${container}`, ''].join('\n'));
    return path.join(container, 'Documents');
  }

  remove() { fs.rmSync(this.folder, { recursive: true, force: true }); }
}

export class Daemon {
  static async start(storage, words = []) {
    const daemon = new Daemon();
    const environment = { ...process.env, HOME: storage.folder, CINDRAL_LOG: 'error' };
    for (const name of Object.keys(environment)) if (name.startsWith('XDG_')) delete environment[name];
    daemon.process = spawn(process.env.CINDRAL_PROGRAM, ['serve', '--http', '--json', '--storage', storage.root, '--state', path.join(storage.folder, 'state'),
      '--apps', storage.applications, '--no-flatpak', ...words], { env: environment, stdio: ['ignore', 'pipe', 'inherit'] });
    daemon.ended = new Promise((resolve) => { daemon.process.once('exit', resolve); });
    const lines = readline.createInterface({ input: daemon.process.stdout });
    const [line] = await Promise.race([new Promise((resolve) => { lines.once('line', (text) => resolve([text])); }), daemon.ended.then((status) => [null, status])]);
    if (line === null) throw new Error('the daemon ended');
    daemon.link = JSON.parse(line).url;
    daemon.origin = new URL(daemon.link).origin;
    return daemon;
  }

  async stop() {
    this.process.kill('SIGTERM');
    return this.ended;
  }
}

export async function launch() {
  const words = process.getuid() === 0 ? ['--no-sandbox'] : [];
  return chromium.launch({ executablePath: execFileSync('sh', ['-c', 'command -v chromium'], { encoding: 'utf8' }).trim(), args: words });
}

// What the page has said that no page should: errors of scripts, breaches of its policy, requests to elsewhere.
export function watchPage(page, origin) {
  const complaints = [];
  page.on('pageerror', (error) => complaints.push(`error: ${error.message}`));
  page.on('console', (message) => {
    // A request that is refused is said by the browser too; the page says it in its own way.
    if (message.type() === 'error' && !/Failed to load resource/.test(message.text())) complaints.push(`console: ${message.text()}`);
  });
  page.on('request', (request) => {
    // The browser's own viewers are made of parts of the browser's.
    if (!/^(blob|data|chrome|chrome-extension):/.test(request.url()) && !request.url().startsWith(`${origin}/`)) complaints.push(`request: ${request.url()}`);
  });
  return complaints;
}

// What axe-core finds wrong on the page as it is now, with all its rules, or with those that are named. It runs beside the page,
// not in it: the page's policy keeps it out.
export async function violations(page, rules = null) {
  const client = await page.context().newCDPSession(page);
  const evaluate = async (expression, contextId) => {
    const { result, exceptionDetails } = await client.send('Runtime.evaluate', { expression, contextId, awaitPromise: true, returnByValue: true });
    if (exceptionDetails) throw new Error(exceptionDetails.exception?.description ?? exceptionDetails.text);
    return result.value;
  };
  const { frameTree } = await client.send('Page.getFrameTree');
  // The same world each time, for as long as the page is the same: reading the rules takes longer than looking.
  const { executionContextId } = await client.send('Page.createIsolatedWorld', { frameId: frameTree.frame.id, worldName: 'axe' });
  if (!await evaluate('typeof axe === "object"', executionContextId)) await evaluate(`${axe}; 0`, executionContextId);
  const options = { resultTypes: ['violations'], iframes: false, ...(rules ? { runOnly: rules } : {}) };
  const found = await evaluate(`axe.run(document, ${JSON.stringify(options)}).then((results) => results.violations.map(
    (each) => each.id + ': ' + each.nodes.map((node) => node.target.join(' ') + ' ' + (node.any[0]?.message ?? node.all[0]?.message ?? '')).join('; ')))`, executionContextId);
  await client.detach();
  return found;
}

// Another program that is at work in a folder all the while, until it is told to stop: it makes documents, writes to them, gives
// them other names and takes them away again, before and behind all others. Or, told to write, it writes to those that are there.
export class Meddler {
  constructor(folder, how = 'comings') {
    this.process = spawn(process.execPath, ['-e', `(${meddle})(process.argv[1], process.argv[2])`, folder, how], { stdio: ['pipe', 'ignore', 'inherit'] });
    this.ended = new Promise((resolve) => { this.process.once('exit', resolve); });
  }

  async stop() {
    this.process.stdin.end();
    return this.ended;
  }
}

function meddle(folder, how) {
  const fs = require('node:fs');
  const path = require('node:path');
  const attempt = (work) => { try { work(); } catch (error) { if (error.code !== 'ENOENT') throw error; } };
  const name = (turn, state) => path.join(folder, `${turn % 2 ? 'zz' : '00'} of another ${turn} ${state}.txt`);
  let turn = 0;
  const comings = () => {
    fs.writeFileSync(name(turn, 'new'), '');
    if (turn >= 1) fs.appendFileSync(name(turn - 1, 'new'), 'more');
    if (turn >= 2) fs.renameSync(name(turn - 2, 'new'), name(turn - 2, 'renamed'));
    if (turn >= 3) fs.unlinkSync(name(turn - 3, 'renamed'));
  };
  const writes = () => {
    for (const each of fs.readdirSync(folder)) {
      // Not made anew where it has gone meanwhile.
      attempt(() => { const file = fs.openSync(path.join(folder, each), fs.constants.O_WRONLY | fs.constants.O_APPEND); fs.writeSync(file, 'x'); fs.closeSync(file); });
    }
  };
  const timer = setInterval(() => { (how === 'writes' ? writes : comings)(); turn += 1; }, 60);
  process.stdin.on('end', () => {
    clearInterval(timer);
    if (how === 'comings') for (const each of fs.readdirSync(folder)) if (each.includes(' of another ')) attempt(() => fs.unlinkSync(path.join(folder, each)));
  }).resume();
}
