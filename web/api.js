// Talks to zeph-webapid: method calls under /api/, the server's own routes
// under /server/. Every request carries the session's token and is given up
// after a bound, so that a stuck call never leaves the page waiting for ever.

const MESSAGES = {
  5501: 'The certificate manager could not complete the action.',
  5503: 'Some of the values given are missing or not valid.',
  5510: 'The certificate file is missing or cannot be read.',
  5511: 'The private key file is missing or cannot be read.',
  5512: 'The intermediate certificate file cannot be read.',
  5514: 'The certificate and the private key do not belong together.',
  5515: 'No certificate chain could be built from the files given.',
  5517: 'The intermediate certificate does not form a chain with the certificate.',
  5518: 'DSA keys are not supported; use an RSA or EC key.',
  5520: 'The Let\'s Encrypt server cannot be reached or used.',
  5521: 'The Let\'s Encrypt server refused the account.',
  5522: 'The domain name is not valid or the server rejects it.',
  5523: 'The Let\'s Encrypt server refused the request because of its rate limits.',
  5524: 'The domain could not be validated: the challenge failed.',
  5525: 'The new certificate could not be stored in the archive.',
  5526: 'This certificate was not issued through Let\'s Encrypt, so it cannot be renewed.',
  5527: 'The Let\'s Encrypt tool failed to run.',
  5528: 'The Let\'s Encrypt configuration file is not valid.',
  5529: 'The Let\'s Encrypt request took too long and was stopped.',
  5530: 'The Let\'s Encrypt server refused the revocation.',
  400: 'The server could not read the request.',
  401: 'The token was not accepted. Sign in again.',
  404: 'The server does not know this action.',
  413: 'A file or the request is too large.',
  415: 'The server does not accept this kind of request.',
  429: 'Too many requests at once; try again in a moment.',
  502: 'The certificate service behind the web server does not answer.',
};

// Codes of the page's own failures, beside the server's.
export const NETWORK = 0;
export const TIMED_OUT = -1;

// The sentence shown to the administrator for an error code.
export function errorSentence(code) {
  if (Object.prototype.hasOwnProperty.call(MESSAGES, code)) return MESSAGES[code];
  if (code >= 5520 && code <= 5530) return MESSAGES[5520];
  return `The action failed (error ${code}).`;
}

// "the key is encrypted" -> "The key is encrypted."
function sentence(text) {
  const t = text.trim();
  return t.charAt(0).toUpperCase() + t.slice(1) + (/[.!?]$/.test(t) ? '' : '.');
}

// An answer that is not success. `reason` and `setting` say what caused it
// when the server knows (an import's file, a Let's Encrypt setting).
export class ApiError extends Error {
  constructor(code, data) {
    super(errorSentence(code));
    this.code = code;
    this.data = data;
    this.reason = '';
    this.setting = '';
    if (data && typeof data === 'object') {
      if (typeof data.reason === 'string') this.reason = data.reason;
      if (typeof data.setting === 'string') this.setting = data.setting;
      if (typeof data.message === 'string' && data.message) {
        // Refusals of an import or a setting are sentences of their own;
        // the server's other errors only add a detail.
        this.message = this.reason || this.setting
          ? sentence(data.message) : `${this.message} (${data.message})`;
      } else if (typeof data.msg === 'string' && data.msg) {
        this.message = `${this.message} The tool said: ${data.msg}`;
      }
    }
  }
}

// Bounds on one request, in milliseconds: most calls answer at once; making
// keys and talking to an ACME server take long. The page may change them.
export const timeouts = {normal: 30000, long: 600000};

// Methods that make keys or wait for an ACME server.
const LONG = new Set(['ZEPH.Core.Certificate.CRT/create', 'ZEPH.Core.Certificate.CRT/recreate',
  'ZEPH.Core.Certificate.CSR/create', 'ZEPH.Core.Certificate.CSR/renew',
  'ZEPH.Core.Certificate.LetsEncrypt/create', 'ZEPH.Core.Certificate.LetsEncrypt/renew',
  'ZEPH.Core.Certificate/reset']);

export function isLong(api, method) { return LONG.has(`${api}/${method}`); }

function seconds(ms) {
  if (ms >= 120000) return `${Math.round(ms / 60000)} minutes`;
  const s = Math.round(ms / 1000);
  return `${s} second${s === 1 ? '' : 's'}`;
}

function networkError() {
  const err = new ApiError(NETWORK, null);
  err.message = 'The server cannot be reached. Check that it runs, ' +
      'then reload the page (a new certificate may have to be accepted first).';
  return err;
}

function timeoutError(ms) {
  const err = new ApiError(TIMED_OUT, null);
  err.message = `The server did not answer within ${seconds(ms)}, so the page stopped waiting. ` +
      'The action may still finish on the server: refresh the list to see.';
  return err;
}

// Sends one request and reads its answer with `read`, both within `bound` ms.
async function send(token, path, init, bound, read) {
  const headers = Object.assign({Authorization: `Bearer ${token}`}, init.headers || {});
  const abort = new AbortController();
  const timer = setTimeout(() => abort.abort(), bound);
  try {
    const response = await fetch(path, Object.assign({}, init, {headers, cache: 'no-store', signal: abort.signal}));
    return await read(response);
  } catch (e) {
    if (e instanceof ApiError) throw e;
    if (abort.signal.aborted) throw timeoutError(bound);
    throw networkError();
  } finally {
    clearTimeout(timer);
  }
}

async function readJson(response) {
  let body = null;
  try {
    body = await response.json();
  } catch (e) {
    if (e && e.name === 'AbortError') throw e;
    throw new ApiError(response.status || 5501, null);
  }
  if (!body || body.success !== true) {
    const error = (body && body.error) || {};
    throw new ApiError(error.code || response.status, error.data);
  }
  return body.data;
}

// GET of a /server/ route; answers its data.
export function getServer(token, route) {
  return send(token, route, {method: 'GET'}, timeouts.normal, readJson);
}

// POST of a JSON object to a /server/ route; answers its data.
export function postServer(token, route, body) {
  return send(token, route, {method: 'POST', headers: {'Content-Type': 'application/json'},
                             body: JSON.stringify(body)}, timeouts.normal, readJson);
}

function bound(api, method) { return isLong(api, method) ? timeouts.long : timeouts.normal; }

// Calls one method with JSON parameters; answers the method's data.
export function call(token, api, method, params) {
  return send(token, `/api/${api}/1/${method}`, {
    method: 'POST',
    headers: {'Content-Type': 'application/json'},
    body: JSON.stringify(params || {}),
  }, bound(api, method), readJson);
}

// Calls one method with file parts (File objects by part name) and parameters.
export async function callWithFiles(token, api, method, params, files) {
  const form = new FormData();
  form.append('params', JSON.stringify(params || {}));
  // The bytes are read first: the form the files came from may be reset
  // while the request is on its way.
  for (const [name, file] of Object.entries(files)) {
    if (file) form.append(name, new Blob([await file.arrayBuffer()]), file.name);
  }
  return send(token, `/api/${api}/1/${method}`, {method: 'POST', body: form}, bound(api, method), readJson);
}

// Calls a method that answers with a file; answers {blob, name} (name: the
// file name the server gave, or '') or null when there was nothing to hand out.
export function download(token, api, method, params) {
  return send(token, `/api/${api}/1/${method}`, {
    method: 'POST',
    headers: {'Content-Type': 'application/json'},
    body: JSON.stringify(params || {}),
  }, bound(api, method), async (response) => {
    if (response.status === 204) return null;
    const type = response.headers.get('Content-Type') || '';
    if (type.includes('application/json')) {
      await readJson(response);
      return null;
    }
    if (!response.ok) throw new ApiError(response.status, null);
    const disposition = response.headers.get('Content-Disposition') || '';
    const match = /filename="?([^";]+)"?/.exec(disposition);
    return {blob: await response.blob(), name: match ? match[1] : ''};
  });
}
