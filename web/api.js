// Talks to zeph-webapid: method calls under /api/, the server's own routes
// under /server/. Every request carries the session's token.

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
};

// The sentence shown to the administrator for an error code.
export function errorSentence(code) {
  if (Object.prototype.hasOwnProperty.call(MESSAGES, code)) return MESSAGES[code];
  if (code >= 5520 && code <= 5530) return MESSAGES[5520];
  return `The action failed (error ${code}).`;
}

export class ApiError extends Error {
  constructor(code, data) {
    super(errorSentence(code));
    this.code = code;
    this.data = data;
  }
}

const NETWORK_ERROR = 'The server cannot be reached. Check that it runs, ' +
    'then reload the page (a new certificate may have to be accepted first).';

async function send(token, path, init) {
  const headers = Object.assign({Authorization: `Bearer ${token}`}, init.headers || {});
  let response;
  try {
    response = await fetch(path, Object.assign({}, init, {headers, cache: 'no-store'}));
  } catch (e) {
    const err = new ApiError(0, null);
    err.message = NETWORK_ERROR;
    throw err;
  }
  return response;
}

async function readJson(response) {
  let body = null;
  try {
    body = await response.json();
  } catch (e) {
    throw new ApiError(response.status || 5501, null);
  }
  if (!body || body.success !== true) {
    const error = (body && body.error) || {};
    throw new ApiError(error.code || response.status, error.data);
  }
  return body.data;
}

// GET of a /server/ route; answers its data.
export async function getServer(token, route) {
  return readJson(await send(token, route, {method: 'GET'}));
}

// Calls one method with JSON parameters; answers the method's data.
export async function call(token, api, method, params) {
  const response = await send(token, `/api/${api}/1/${method}`, {
    method: 'POST',
    headers: {'Content-Type': 'application/json'},
    body: JSON.stringify(params || {}),
  });
  return readJson(response);
}

// Calls one method with file parts (FormData of File objects) and parameters.
export async function callWithFiles(token, api, method, params, files) {
  const form = new FormData();
  form.append('params', JSON.stringify(params || {}));
  // The bytes are read first: the form the files came from may be reset
  // while the request is on its way.
  for (const [name, file] of Object.entries(files)) {
    if (file) form.append(name, new Blob([await file.arrayBuffer()]), file.name);
  }
  const response = await send(token, `/api/${api}/1/${method}`, {method: 'POST', body: form});
  return readJson(response);
}

// Calls a method that answers with a file; answers {blob, name} or null
// when the method had nothing to hand out.
export async function download(token, api, method, params) {
  const response = await send(token, `/api/${api}/1/${method}`, {
    method: 'POST',
    headers: {'Content-Type': 'application/json'},
    body: JSON.stringify(params || {}),
  });
  if (response.status === 204) return null;
  const type = response.headers.get('Content-Type') || '';
  if (type.includes('application/json')) {
    await readJson(response);
    return null;
  }
  if (!response.ok) throw new ApiError(response.status, null);
  const disposition = response.headers.get('Content-Disposition') || '';
  const match = /filename="?([^";]+)"?/.exec(disposition);
  return {blob: await response.blob(), name: match ? match[1] : 'download'};
}
