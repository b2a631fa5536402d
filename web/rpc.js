// The way to the host: a session, one stream of events, requests.

export const ROOT = 'TesselRootContainerItemIdentifier';

// However deep what has missed it is.
const NO_SUCH_ITEM = [['TesselErrorDomain', -1001], ['TSErrorDomain', 2], ['CindralProvider.LocalTesselKitError', 0], ['KsGeneralErrorDomain', 260]];

export class RpcError extends Error {
  constructor(error) {
    super(error.message);
    this.code = error.code;
    this.data = error.data ?? {};
  }

  is(domain, code) {
    return this.data.domain === domain && this.data.code === code;
  }

  get isCollision() { return this.is('TesselErrorDomain', -1003); }
  get isCancellation() { return this.is('KsPOSIXErrorDomain', 125); }
  get isNoSuchItem() { return NO_SUCH_ITEM.some(([domain, code]) => this.is(domain, code)); }
  get isUnknownMethod() { return this.code === -32601; }
}

export class SignedOut extends Error {
  constructor() { super('Open the link that the program has printed'); }
}

let token = null;
let lastRequest = 0;
let stream = null;
let connection = null;
let wasConnected = false;
const progressOf = new Map();
const listeners = { signal: new Set(), queryChanged: new Set(), connected: new Set(), lost: new Set() };

export function listen(name, listener) {
  listeners[name].add(listener);
  return () => listeners[name].delete(listener);
}

function tell(name, value) {
  for (const listener of [...listeners[name]]) listener(value);
}

// Trades the link's secret, which is then in no address any more, or takes up the session that there is.
export async function signIn() {
  const secret = /^#[0-9a-f]{64}$/.test(location.hash) ? location.hash.slice(1) : null;
  if (secret) history.replaceState(null, '', '/');
  let answer = null;
  if (secret) answer = await fetch('/session', { method: 'POST', body: secret });
  if (!answer?.ok) answer = await fetch('/session');
  if (!answer.ok) throw new SignedOut();
  token = (await answer.json()).token;
  openStream();
}

export async function signOut() {
  await fetch('/logout', { method: 'POST', headers: { 'X-Cindral-Token': token } });
  closeStream();
}

function openStream() {
  let arrived;
  connection = new Promise((resolve) => { arrived = resolve; });
  stream = new EventSource('/events');
  let isFirst = true;
  stream.addEventListener('connection', (event) => {
    const name = JSON.parse(event.data);
    if (isFirst) arrived(name);
    else connection = Promise.resolve(name);
    isFirst = false;
    // The page as it begins asks for what it follows by itself.
    if (wasConnected) tell('connected', name);
    wasConnected = true;
  });
  stream.onmessage = (event) => {
    const { method, params } = JSON.parse(event.data);
    if (method === 'progress') progressOf.get(params.request)?.(params);
    else if (listeners[method]) tell(method, params);
  };
  stream.onerror = () => tell('lost', stream.readyState === EventSource.CLOSED);
}

function closeStream() {
  stream?.close();
  stream = null;
}

// A browser has few connections for one service: a page that nobody looks at gives its own back.
document.addEventListener('visibilitychange', () => {
  if (!token) return;
  if (document.visibilityState === 'hidden') closeStream();
  else if (!stream) openStream();
});

async function post(body) {
  const answer = await fetch('/rpc', {
    method: 'POST',
    headers: { 'Content-Type': 'application/json', 'X-Cindral-Token': token, 'X-Cindral-Connection': await connection },
    body: JSON.stringify(body),
  });
  if (answer.status === 401) throw new SignedOut();
  return answer;
}

function result(answer) {
  if (answer.error) throw new RpcError(answer.error);
  return answer.result;
}

// `follow.progress` is told how far it is; `follow.cancel` is set to what cancels it.
export async function call(method, params = {}, follow = null) {
  lastRequest += 1;
  const id = lastRequest;
  if (follow) {
    if (follow.progress) progressOf.set(id, follow.progress);
    follow.cancel = () => post({ jsonrpc: '2.0', method: 'cancel', params: { request: id } });
  }
  try {
    for (let attempt = 0; ; attempt += 1) {
      const answer = await post({ jsonrpc: '2.0', id, method, params });
      // The stream was another when the request was sent: the next one is on its way.
      if (answer.status === 409 && attempt < 20) {
        await new Promise((resolve) => { setTimeout(resolve, 100); });
        continue;
      }
      if (!answer.ok) throw new Error((await answer.json()).message);
      return result(await answer.json());
    }
  } finally {
    progressOf.delete(id);
  }
}

// The address of an archive of the items, good for one download.
export async function archiveAddress(items) {
  const answer = await fetch('/archive', {
    method: 'POST',
    headers: { 'Content-Type': 'application/json', 'X-Cindral-Token': token },
    body: JSON.stringify({ identifiers: items.map((item) => item.identifier) }),
  });
  if (answer.status === 401) throw new SignedOut();
  const { archive, message } = await answer.json();
  if (!answer.ok) throw new Error(message);
  return `/archive/${archive}`;
}

export function fileAddress(item, saves = false) {
  return `/file/${encodeURIComponent(item.identifier)}${saves ? '?save' : ''}`;
}

// Sends a document. As call(), with bytes of its own in `follow.progress`.
export function upload(file, parent, name, follow = {}) {
  return new Promise((resolve, reject) => {
    const request = new XMLHttpRequest();
    request.open('POST', `/upload?parent=${encodeURIComponent(parent)}&name=${encodeURIComponent(name)}`);
    request.setRequestHeader('X-Cindral-Token', token);
    request.setRequestHeader('Content-Type', 'application/octet-stream');
    request.upload.onprogress = (event) => follow.progress?.({ completedBytes: event.loaded, totalBytes: event.total });
    request.onload = () => {
      try {
        const answer = JSON.parse(request.responseText);
        if (request.status !== 200) reject(new Error(answer.message));
        else resolve(result(answer));
      } catch (error) {
        reject(error);
      }
    };
    request.onerror = () => reject(new Error('The connection broke'));
    request.onabort = () => reject(new RpcError({ message: 'Cancelled', data: { domain: 'KsPOSIXErrorDomain', code: 125 } }));
    follow.cancel = () => request.abort();
    request.send(file);
  });
}
