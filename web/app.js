// The certificate administration page: sign-in, the expiry overview, the
// certificate table with its row actions, the explicit service binding, the
// dialogs (create, import, requests, Let's Encrypt and its settings, export)
// and the action log.
import {call, callWithFiles, download, getServer, postServer, ApiError, NETWORK, timeouts} from './api.js';

const CRT = 'ZEPH.Core.Certificate.CRT';
const SERVICE = 'ZEPH.Core.Certificate.Service';
const CORE = 'ZEPH.Core.Certificate';
const CSR = 'ZEPH.Core.Certificate.CSR';
const LE = 'ZEPH.Core.Certificate.LetsEncrypt';
const LE_SETTINGS = '/server/letsencrypt/settings';
const TOKEN_KEY = 'zeph-token';
const DAY_MS = 24 * 3600 * 1000;
const SOON_DAYS = 30;
const SUBJECT_KEYS = ['country', 'state', 'city', 'organization', 'department', 'common_name', 'email'];
const KEY_TYPES = [['rsa2048', 'RSA 2048'], ['rsa4096', 'RSA 4096'], ['ec256', 'EC P-256'], ['ec384', 'EC P-384']];

const $ = (sel) => document.querySelector(sel);
const state = {
  certificates: [],
  services: [],
  sort: 'name',
  pending: new Map(),  // service key -> certificate id chosen but not applied
  resume: null,        // the dialog to show again after a new sign-in
};

function token() { return sessionStorage.getItem(TOKEN_KEY) || ''; }

// An element with properties; names with a dash (aria-*, data-*) are attributes.
function el(tag, props, ...children) {
  const node = document.createElement(tag);
  for (const [name, value] of Object.entries(props || {})) {
    if (name.includes('-')) node.setAttribute(name, value);
    else node[name] = value;
  }
  for (const child of children) {
    if (child === null || child === undefined || child === false) continue;
    node.append(child instanceof Node ? child : String(child));
  }
  return node;
}

// ---- notices and errors ----
// kind: '' (done), 'bad' (a failure) or 'network' (the server could not be
// reached; the next refresh that reaches it takes the notice away).
function notice(content, kind) {
  const box = $('#notice');
  box.replaceChildren(...[].concat(content).filter((c) => c !== null && c !== ''));
  box.classList.toggle('bad', kind === 'bad' || kind === 'network');
  box.dataset.kind = kind || '';
}

function messageOf(error) {
  return error instanceof ApiError ? error.message : `The page failed: ${error.message}`;
}

// A token the server no longer takes brings the sign-in form back; the
// dialog of the action, if any, comes back after signing in.
function authLost(error, resume) {
  if (!(error instanceof ApiError) || error.code !== 401) return false;
  signOut(error.message, resume);
  return true;
}

function showError(error, resume) {
  if (authLost(error, resume)) return;
  notice(messageOf(error), error instanceof ApiError && error.code === NETWORK ? 'network' : 'bad');
}

// ---- running calls ----
// Each running call holds lock keys: "cert:<id>" (a certificate being
// changed), "service:<key>", "gen" (the shared request work files),
// "form:<name>" (a dialog's own call) or "*" (everything, for reset).
// Controls name what they conflict with in data-locks ("*": anything running)
// and are disabled while it runs.
const running = new Map();
let runs = 0;

function busyKeys() {
  const keys = new Set();
  for (const r of running.values()) for (const k of r.keys) keys.add(k);
  return keys;
}

function applyLocks() {
  const keys = busyKeys();
  for (const node of document.querySelectorAll('[data-locks]')) {
    const locked = keys.has('*') ||
        node.dataset.locks.split(' ').some((k) => (k === '*' ? keys.size > 0 : keys.has(k)));
    node.disabled = locked || node.dataset.unchanged === 'true';
  }
}

// Runs `work` while a progress line shows what runs and for how long. Only
// the start and the end are told to screen readers, not every second.
async function track(label, keys, work) {
  const id = ++runs;
  const elapsed = el('span', {className: 'elapsed', 'aria-hidden': 'true'});
  const line = el('div', {className: 'running'}, `${label}… `, elapsed);
  $('#progress').append(line);
  const started = Date.now();
  const tick = () => { elapsed.textContent = `${Math.floor((Date.now() - started) / 1000)} s`; };
  tick();
  const timer = setInterval(tick, 1000);
  running.set(id, {label, keys});
  applyLocks();
  $('#progress-status').textContent = `${label}…`;
  try {
    return await work();
  } finally {
    clearInterval(timer);
    line.remove();
    running.delete(id);
    applyLocks();
    if (!running.size) $('#progress-status').textContent = '';
  }
}

// ---- certificates ----
// The module writes times as "Jan  2 03:04:05 2030 GMT".
export function parseCertTime(text) {
  const m = /^([A-Z][a-z]{2})\s+(\d{1,2}) (\d{2}):(\d{2}):(\d{2}) (\d{4}) GMT$/.exec(text || '');
  if (!m) return null;
  const month = 'JanFebMarAprMayJunJulAugSepOctNovDec'.indexOf(m[1]) / 3;
  if (month < 0) return null;
  return new Date(Date.UTC(+m[6], month, +m[2], +m[3], +m[4], +m[5]));
}

function daysLeft(cert) {
  const till = parseCertTime(cert.valid_till);
  return till ? Math.floor((till.getTime() - Date.now()) / DAY_MS) : null;
}

const day = (d) => d.toISOString().slice(0, 10);

function expiryText(cert) {
  const till = parseCertTime(cert.valid_till);
  if (!till) return 'expiry unknown';
  const days = daysLeft(cert);
  if (days < 0) return `expired ${day(till)}`;
  return `expires ${day(till)}, ${days} day${days === 1 ? '' : 's'} left`;
}

const isExpired = (cert) => daysLeft(cert) !== null && daysLeft(cert) < 0;
const commonName = (cert) => (cert.subject && cert.subject.common_name) || cert.id;

function certLabel(cert) {
  const cn = commonName(cert);
  return cert.desc ? `${cert.desc} (${cn})` : cn;
}

// A name for files handed out for a certificate.
function fileBase(name) { return String(name || 'certificate').replace(/[^A-Za-z0-9._-]+/g, '_'); }

function sameName(a, b) {
  return !!a && !!b && SUBJECT_KEYS.every((k) => (a[k] || '') === (b[k] || ''));
}

// The appliance's own self-signed sets: the directory holds the authority
// (zeph-ca-cert.pem, listed as self_signed_cacrt_info) that issued the
// certificate, and no renewal description makes it a Let's Encrypt set.
// Only these can be recreated: recreate makes a fresh self-signed set, which
// would silently replace a certificate some other authority issued.
function ownSelfSigned(cert) {
  const ca = cert.self_signed_cacrt_info;
  return !!ca && !cert.renewable && sameName(cert.issuer, ca.subject);
}

// Signing needs the authority's certificate and key in the set's directory.
const canSign = (cert) => !!cert.self_signed_cacrt_info;

function nameText(name) {
  if (!name) return '';
  return [name.organization, name.country].filter(Boolean).join(', ');
}

function serviceName(s) { return s.display_name || `${s.subscriber}/${s.service}`; }
function serviceKey(s) { return `${s.subscriber}/${s.service}`; }
function sameService(a, b) { return a.subscriber === b.subscriber && a.service === b.service; }
const isWebAdmin = (s) => s.subscriber === 'system' && s.service === 'default';

function certificateOf(service) {
  return state.certificates.find((c) => (c.services || []).some((s) => sameService(s, service)));
}

function sortedCertificates() {
  const list = [...state.certificates];
  const byName = (a, b) => certLabel(a).localeCompare(certLabel(b));
  if (state.sort === 'expiry') {
    const till = (c) => { const t = parseCertTime(c.valid_till); return t ? t.getTime() : Infinity; };
    list.sort((a, b) => till(a) - till(b) || byName(a, b));
  } else {
    list.sort(byName);
  }
  return list;
}

function validityCell(cert) {
  const from = parseCertTime(cert.valid_from);
  const till = parseCertTime(cert.valid_till);
  const cell = el('td', {className: 'validity', 'data-label': 'Valid'});
  cell.append(el('div', {}, `${from ? day(from) : cert.valid_from || '?'} – ${till ? day(till) : cert.valid_till || '?'}`));
  const days = daysLeft(cert);
  if (days !== null) {
    if (days < 0) cell.classList.add('expired');
    else if (days < SOON_DAYS) cell.classList.add('expiring');
    cell.append(el('small', {className: 'days'}, days < 0 ? 'expired' : `${days} day${days === 1 ? '' : 's'} left`));
  }
  return cell;
}

// The row's actions: buttons named after the certificate, inside a menu
// that narrow screens fold away.
function actionsCell(cert) {
  const label = certLabel(cert);
  const lock = `cert:${cert.id}`;
  const list = el('div', {className: 'actions', id: `actions-${cert.id}`});
  const toggle = el('button', {type: 'button', className: 'menu-toggle', textContent: 'Actions',
                               'aria-expanded': 'false', 'aria-controls': list.id, 'aria-label': `Actions for ${label}`});
  const setOpen = (open) => {
    list.classList.toggle('open', open);
    toggle.setAttribute('aria-expanded', String(open));
  };
  toggle.addEventListener('click', () => {
    setOpen(!list.classList.contains('open'));
    if (list.classList.contains('open')) list.querySelector('button:not(:disabled)')?.focus();
  });
  list.addEventListener('keydown', (event) => {
    if (event.key === 'Escape' && list.classList.contains('open')) { setOpen(false); toggle.focus(); }
  });
  const add = (text, verb, className, locks, action) => {
    const button = el('button', {type: 'button', className, textContent: text,
                                 'aria-label': `${verb} ${label}`, 'data-locks': locks});
    button.addEventListener('click', () => {
      // The menu closes; a dialog the action opens returns focus to the toggle.
      const opener = getComputedStyle(toggle).display === 'none' ? button : toggle;
      setOpen(false);
      action(opener);
    });
    list.append(button);
  };
  add('Edit…', 'Edit', 'edit', lock, (o) => openEdit(cert, o));
  if (!cert.is_default) add('Make default', 'Make default', 'make-default', lock, (o) => makeDefault(cert, o));
  add('Export…', 'Export', 'export', lock, (o) => openExport(cert, o));
  if (ownSelfSigned(cert)) add('Recreate…', 'Recreate', 'recreate', lock, (o) => confirmRecreate(cert, o));
  if (cert.renewable) add('Renew…', 'Renew', 'le-renew', lock, (o) => confirmLeRenew(cert, o));
  if (!ownSelfSigned(cert)) add('New request…', 'New request for', 'csr', 'gen', (o) => confirmRequest(cert, o));
  if (cert.user_deletable !== false && !cert.is_default) {
    add('Delete…', 'Delete', 'delete danger', lock, (o) => confirmDelete(cert, o));
  }
  return el('td', {className: 'actions-cell', 'data-label': 'Actions'}, toggle, list);
}

function renderCertificates() {
  const body = $('#certificates tbody');
  body.replaceChildren();
  for (const cert of sortedCertificates()) {
    const row = el('tr', {'data-id': cert.id});
    const desc = el('td', {className: 'desc', 'data-label': 'Description'}, cert.desc || '');
    if (cert.is_default) desc.append(el('span', {className: 'badge default'}, 'default'));
    if (cert.renewable) desc.append(el('span', {className: 'badge renew'}, 'Let\'s Encrypt'));
    else if (ownSelfSigned(cert)) desc.append(el('span', {className: 'badge self'}, 'self-signed'));
    row.append(desc);
    row.append(el('td', {className: 'subject', 'data-label': 'Subject'}, commonName(cert),
                  el('small', {}, nameText(cert.subject))));
    const issuer = el('td', {className: 'issuer', 'data-label': 'Issuer'}, (cert.issuer && cert.issuer.common_name) || '',
                      el('small', {}, nameText(cert.issuer)));
    const ca = cert.self_signed_cacrt_info;
    if (ca) issuer.append(el('small', {}, `own authority: ${(ca.subject && ca.subject.common_name) || '?'}`));
    row.append(issuer);
    row.append(el('td', {className: 'san', 'data-label': 'Alternative names'}, (cert.sub_alt_name || []).join(', ')));
    row.append(el('td', {className: 'key', 'data-label': 'Key'}, cert.is_ecc ? 'EC' : 'RSA',
                  el('small', {}, cert.signature_algorithm || '')));
    row.append(validityCell(cert));
    row.append(el('td', {className: 'services', 'data-label': 'Services'},
                  (cert.services || []).map(serviceName).join(', ')));
    row.append(actionsCell(cert));
    body.append(row);
  }
  if (!state.certificates.length) {
    body.append(el('tr', {}, el('td', {colSpan: 8}, 'No certificates.')));
  }
}

function renderSummary() {
  let expired = 0;
  let soon = 0;
  for (const cert of state.certificates) {
    const days = daysLeft(cert);
    if (days === null) continue;
    if (days < 0) expired++;
    else if (days < SOON_DAYS) soon++;
  }
  const parts = [];
  if (expired) parts.push(`${expired} expired`);
  if (soon) parts.push(`${soon} expire${soon === 1 ? 's' : ''} within ${SOON_DAYS} days`);
  const box = $('#expiry-summary');
  box.textContent = parts.length ? parts.join(', ') : `No certificate expires within ${SOON_DAYS} days.`;
  box.classList.toggle('bad', parts.length > 0);
}

// ---- services ----
// Choosing a certificate only marks it; Apply binds it after a confirmation.
function renderServices() {
  const body = $('#services tbody');
  body.replaceChildren();
  const certs = [...state.certificates].sort((a, b) => certLabel(a).localeCompare(certLabel(b)));
  for (const service of state.services) {
    const key = serviceKey(service);
    const current = certificateOf(service);
    const currentId = current ? current.id : '';
    if (state.pending.has(key) && !certs.some((c) => c.id === state.pending.get(key))) state.pending.delete(key);
    const chosen = state.pending.has(key) ? state.pending.get(key) : currentId;
    const id = `svc-${key}`.replace(/[^A-Za-z0-9_-]/g, '_');
    const select = el('select', {id, 'data-service': key});
    if (!current) select.append(el('option', {value: '', textContent: '(none)'}));
    for (const cert of certs) {
      select.append(el('option', {value: cert.id, textContent: `${certLabel(cert)} — ${expiryText(cert)}`,
                                  selected: cert.id === chosen}));
    }
    const apply = el('button', {type: 'button', className: 'apply', textContent: 'Apply',
                                'aria-label': `Apply to ${serviceName(service)}`, 'data-locks': `service:${key}`});
    const mark = () => {
      if (select.value === currentId) state.pending.delete(key);
      else state.pending.set(key, select.value);
      apply.dataset.unchanged = String(select.value === currentId);
      applyLocks();
    };
    select.addEventListener('change', mark);
    apply.addEventListener('click', () => applyBinding(service, select.value, apply));
    apply.dataset.unchanged = String(chosen === currentId);
    body.append(el('tr', {},
      el('td', {'data-label': 'Service'}, el('label', {htmlFor: id, textContent: serviceName(service)})),
      el('td', {className: 'binding', 'data-label': 'Certificate'}, el('div', {className: 'toolbar'}, select, apply))));
  }
  if (!state.services.length) body.append(el('tr', {}, el('td', {colSpan: 2}, 'No services are registered.')));
}

async function applyBinding(service, id, opener) {
  const cert = state.certificates.find((c) => c.id === id);
  const current = certificateOf(service);
  if (!cert || (current && current.id === id)) return;
  const nodes = [el('p', {}, `${serviceName(service)} will use ${certLabel(cert)} (${expiryText(cert)}).`)];
  if (current) nodes.push(el('p', {}, `It uses ${certLabel(current)} now.`));
  if (isWebAdmin(service)) {
    nodes.push(el('p', {className: 'warning'}, 'This is the web administration service: the certificate of ' +
      'this very page is swapped at once. The browser may warn about the new certificate and ask you to ' +
      'accept it before the page works again.'));
  }
  if (isExpired(cert)) {
    nodes.push(el('p', {className: 'warning'}, `${certLabel(cert)} has expired: clients will refuse it.`));
  }
  if (!await askConfirm('Bind certificate', nodes, isExpired(cert) ? 'Bind anyway' : 'Bind', false, opener)) return;
  const key = serviceKey(service);
  try {
    const data = await track(`Binding ${certLabel(cert)} to ${serviceName(service)}`, [`service:${key}`],
      () => call(token(), SERVICE, 'set', {settings: [{service, id, old_id: current ? current.id : ''}]}));
    state.pending.delete(key);
    if (data && data.restart_httpd) {
      await reconnect(`${serviceName(service)} now uses ${certLabel(cert)}. The administration page now uses the new certificate.`);
      return;
    }
    await refresh();
    if (data && data.err_settings && data.err_settings.length) {
      notice(`The certificate could not be deployed to ${serviceName(service)}.`, 'bad');
    } else {
      notice(`${serviceName(service)} now uses ${certLabel(cert)}.`);
    }
  } catch (e) {
    if (authLost(e)) return;
    await refresh();
    showError(e);
  }
}

// The server presents a new certificate from the next connection on: reload
// the data over a new connection and say what happened.
async function reconnect(text) {
  notice(`${text} Reconnecting…`);
  for (let attempt = 0; attempt < 5; attempt++) {
    try {
      await getServer(token(), '/server/health');
      await refresh();
      notice(`${text} Reconnected; the browser may ask to accept the new certificate on the next visit.`);
      return;
    } catch (e) {
      await new Promise((resolve) => setTimeout(resolve, 1000));
    }
  }
  notice(`${text} Reload the page and accept the new certificate.`, 'bad');
}

// ---- dialogs ----
// Modal dialogs keep the focus inside and give it back to what opened them.
function showDialog(dialog, opener) {
  dialog.opener = opener || document.activeElement;
  // The browser itself gives the focus back to what had it when the dialog
  // opened: that should be the opener, not a menu item that folds away.
  if (opener && opener !== document.activeElement && opener.getClientRects().length) opener.focus();
  if (!dialog.open) dialog.showModal();
}

function focusable(root) {
  return [...root.querySelectorAll('button, input, select, textarea, a[href], [tabindex]:not([tabindex="-1"])')]
    .filter((n) => !n.disabled && n.getClientRects().length > 0);
}

function setUpDialog(dialog) {
  dialog.addEventListener('keydown', (event) => {
    if (event.key !== 'Tab') return;
    const items = focusable(dialog);
    if (!items.length) return;
    const first = items[0];
    const last = items[items.length - 1];
    if (event.shiftKey && document.activeElement === first) {
      event.preventDefault();
      last.focus();
    } else if (!event.shiftKey && document.activeElement === last) {
      event.preventDefault();
      first.focus();
    }
  });
  dialog.addEventListener('close', () => {
    const opener = dialog.opener;
    dialog.opener = null;
    if ($('#app-view').hidden) return;
    if (opener && opener.isConnected && opener.getClientRects().length) { opener.focus(); return; }
    // The row was drawn anew: its counterpart by certificate, else the heading.
    const row = opener && opener.closest && opener.closest('tr[data-id]');
    const again = row && $(`#certificates tr[data-id="${row.dataset.id}"]`);
    const target = again && focusable(again)[0];
    (target || $('#page-title')).focus();
  });
  for (const button of dialog.querySelectorAll('.cancel')) button.addEventListener('click', () => dialog.close());
}

function askConfirm(title, nodes, yesLabel, danger, opener) {
  const dialog = $('#confirm-dialog');
  $('#confirm-title').textContent = title;
  $('#confirm-text').replaceChildren(...nodes);
  const yes = $('#confirm-yes');
  yes.textContent = yesLabel;
  yes.classList.toggle('danger-confirm', !!danger);
  dialog.returnValue = '';
  return new Promise((resolve) => {
    dialog.addEventListener('close', () => resolve(dialog.returnValue === 'yes'), {once: true});
    showDialog(dialog, opener);
    $('#confirm-no').focus();
  });
}

// Field errors: the sentence beside the field, which is marked invalid.
function clearErrors(form) {
  for (const box of form.querySelectorAll('.field-error, .error')) box.textContent = '';
  for (const field of form.querySelectorAll('[aria-invalid]')) field.removeAttribute('aria-invalid');
}

function fieldError(field, text) {
  const box = document.getElementById(`${field.id}-error`);
  box.textContent = text;
  field.setAttribute('aria-invalid', 'true');
  field.focus();
}

function keyOptions() {
  for (const select of document.querySelectorAll('select.key-type')) {
    for (const [value, text] of KEY_TYPES) {
      select.append(el('option', {value, textContent: text, selected: value === select.dataset.default}));
    }
  }
}

// "rsa4096" -> {key_type: "rsa", key_length: 4096}; "ec256" -> {key_type: "ec256"}.
function keyParams(choice, prefix) {
  const m = /^rsa(\d+)$/.exec(choice);
  return m ? {[`${prefix}key_type`]: 'rsa', [`${prefix}key_length`]: +m[1]} : {[`${prefix}key_type`]: choice};
}

// ---- changes to certificates ----
// Runs a call that may move the administration page's certificate, and says
// how it ended.
async function change(label, keys, work, done) {
  try {
    const data = await track(label, keys, work);
    if (data && data.restart_httpd) {
      await reconnect(`${done} The administration page now uses the new certificate.`);
      return data;
    }
    await refresh();
    notice(done);
    return data;
  } catch (e) {
    if (authLost(e)) return null;
    if (e.data && e.data.restart_httpd) {
      await reconnect('The administration page moved to another certificate.');
    } else {
      await refresh();
    }
    showError(e);
    return null;
  }
}

async function confirmExpired(cert, opener) {
  if (!isExpired(cert)) return true;
  return askConfirm('Expired certificate', [
    el('p', {className: 'warning'}, `${certLabel(cert)} has expired (${expiryText(cert)}).`),
    el('p', {}, 'The default certificate is given to new services and to those whose certificate is deleted: ' +
      'their clients will refuse it.')], 'Make it the default anyway', false, opener);
}

async function makeDefault(cert, opener) {
  if (!await confirmExpired(cert, opener)) return;
  await setProperties(cert, cert.desc || '', true);
}

function openEdit(cert, opener) {
  const dialog = $('#edit-dialog');
  const form = $('#edit-form');
  $('#edit-title').textContent = `Edit ${certLabel(cert)}`;
  form.desc.value = cert.desc || '';
  form.as_default.checked = !!cert.is_default;
  form.as_default.disabled = !!cert.is_default;
  clearErrors(form);
  form.onsubmit = async (event) => {
    event.preventDefault();
    const asDefault = form.as_default.checked && !cert.is_default;
    if (asDefault && !await confirmExpired(cert)) return;
    if (await setProperties(cert, form.desc.value.trim(), asDefault, form.querySelector('.error'))) dialog.close();
  };
  showDialog(dialog, opener);
}

async function setProperties(cert, desc, asDefault, errorBox) {
  try {
    await track(`Saving ${certLabel(cert)}`, [`cert:${cert.id}`],
      () => call(token(), CRT, 'set', {id: cert.id, desc, as_default: asDefault}));
    await refresh();
    notice(asDefault ? `${certLabel({...cert, desc})} is now the default certificate.` : 'The description was saved.');
    return true;
  } catch (e) {
    if (authLost(e, errorBox ? $('#edit-dialog') : null)) return false;
    if (errorBox) errorBox.textContent = messageOf(e);
    else showError(e);
    return false;
  }
}

function webAdminWarning(cert) {
  return (cert.services || []).some(isWebAdmin)
    ? el('p', {className: 'warning'}, 'The web administration service uses it: the certificate of this page ' +
        'changes at once, and the browser may ask you to accept the new one.')
    : null;
}

async function confirmDelete(cert, opener) {
  const moving = (cert.services || []).map(serviceName);
  const def = state.certificates.find((c) => c.is_default);
  const nodes = [el('p', {}, `Delete the certificate ${certLabel(cert)}? Its keys are removed for good.`)];
  if (moving.length) {
    nodes.push(el('p', {}, `These services will move to the default certificate${def ? ` (${certLabel(def)})` : ''}:`));
    nodes.push(el('ul', {className: 'moving'}, ...moving.map((n) => el('li', {}, n))));
  } else {
    nodes.push(el('p', {}, 'No service uses it.'));
  }
  if (!await askConfirm('Delete certificate', nodes, 'Delete', true, opener)) return;
  await change(`Deleting ${certLabel(cert)}`, [`cert:${cert.id}`], () => call(token(), CRT, 'delete', {ids: [cert.id]}),
               `${certLabel(cert)} was deleted.`);
}

async function confirmRecreate(cert, opener) {
  const ca = cert.self_signed_cacrt_info.subject.common_name || 'its authority';
  const nodes = [
    el('p', {}, `Recreate makes new keys and a new certificate for ${certLabel(cert)}, signed again by its own ` +
      `authority ${ca}. It keeps its names (${(cert.sub_alt_name || []).join(', ') || commonName(cert)}) and its ` +
      'services; the old keys are gone for good.'),
    el('p', {}, 'Clients that trusted or pinned the old certificate will have to accept the new one.'),
    webAdminWarning(cert)].filter(Boolean);
  if (!await askConfirm('Recreate certificate', nodes, 'Recreate', false, opener)) return;
  await change(`Recreating ${certLabel(cert)}`, [`cert:${cert.id}`], () => call(token(), CRT, 'recreate', {id: cert.id}),
               `${certLabel(cert)} has new keys.`);
}

async function confirmLeRenew(cert, opener) {
  const names = (cert.sub_alt_name || []).join(', ') || commonName(cert);
  const nodes = [
    el('p', {}, `Renew asks the ACME server that issued ${certLabel(cert)} (Let's Encrypt) for a new certificate ` +
      `for ${names}, with a new key. It replaces the current one when it arrives, and the services using it get ` +
      'it at once. If the request fails, the current certificate stays as it is.'),
    webAdminWarning(cert)].filter(Boolean);
  if (!await askConfirm('Renew with Let\'s Encrypt', nodes, 'Renew', false, opener)) return;
  await change(`Renewing ${certLabel(cert)}`, [`cert:${cert.id}`], () => call(token(), LE, 'renew', {id: cert.id}),
               `${certLabel(cert)} was renewed.`);
}

async function confirmRequest(cert, opener) {
  const name = `${fileBase(commonName(cert))}-request.zip`;
  const select = el('select', {id: 'confirm-key-type'},
    el('option', {value: '', textContent: 'RSA, as long as the current key (2048 bits for an EC one)'}),
    el('option', {value: 'ec256', textContent: 'EC P-256'}), el('option', {value: 'ec384', textContent: 'EC P-384'}));
  const nodes = [
    el('p', {}, `This makes a new private key and a signing request with the subject of ${certLabel(cert)}, ` +
      `and downloads both as ${name}.`),
    el('p', {}, `${certLabel(cert)} itself does not change. Send the request to your certificate authority; when ` +
      'it answers, import its certificate together with the new key (Import…, replacing this certificate).'),
    el('label', {htmlFor: 'confirm-key-type'}, 'Key type'), select];
  if (!await askConfirm('New signing request', nodes, 'Make request', false, opener)) return;
  const params = {id: cert.id};
  if (select.value) params.key_type = select.value;
  try {
    const file = await track(`Making a key and request for ${certLabel(cert)}`, ['gen'], async () => {
      await call(token(), CSR, 'renew', params);
      return download(token(), CORE, 'export', {file: 'csr_set'});
    });
    if (!file) { notice(`There was no request to download for ${certLabel(cert)}.`, 'bad'); return; }
    const saved = save(file, name);
    notice(`The key and request for ${certLabel(cert)} were downloaded as ${saved}. The new private key is ` +
           'in it: keep it safe.');
  } catch (e) {
    showError(e);
  }
}

async function confirmReset() {
  const removed = sortedCertificates().filter((c) => c.user_deletable !== false).map(certLabel);
  const nodes = [el('p', {}, 'Reset makes a new default certificate and binds every service to it.')];
  if (removed.length) {
    nodes.push(el('p', {}, 'These certificates will be removed for good:'));
    nodes.push(el('ul', {className: 'moving'}, ...removed.map((n) => el('li', {}, n))));
  }
  if (!await askConfirm('Reset certificates', nodes, 'Reset', true, $('#show-reset'))) return;
  await change('Resetting the certificates', ['*'], () => call(token(), CORE, 'reset', {}), 'The certificates were reset.');
}

// ---- downloads ----
// Saves a downloaded file; the server's generic "archive.zip" gives way to
// a name after what is inside. Answers the name used.
function save(file, fallback) {
  const name = file.name && file.name !== 'archive.zip' ? file.name : fallback;
  const url = URL.createObjectURL(file.blob);
  const link = el('a', {href: url, download: name});
  document.body.append(link);
  link.click();
  link.remove();
  setTimeout(() => URL.revokeObjectURL(url), 60000);
  return name;
}

function openExport(cert, opener) {
  const dialog = $('#export-dialog');
  const form = $('#export-form');
  form.reset();
  clearErrors(form);
  form.classList.remove('pkcs12');
  $('#export-title').textContent = `Export ${certLabel(cert)}`;
  $('#export-key-warning').textContent = `The file holds the private key of ${certLabel(cert)}. Keep it safe: ` +
      'whoever has it can pose as this server. Do not send it by e-mail or leave it where others can read it.';
  form.onchange = () => form.classList.toggle('pkcs12', form.format.value === 'pkcs12');
  form.onsubmit = async (event) => {
    event.preventDefault();
    clearErrors(form);
    const pkcs12 = form.format.value === 'pkcs12';
    const params = {file: 'archive', id: cert.id};
    if (pkcs12) {
      const passphrase = form.passphrase.value;
      if (!passphrase || /[\r\n]/.test(passphrase)) {
        fieldError(form.passphrase, 'Give a passphrase of one line: whoever opens the file needs it.');
        return;
      }
      Object.assign(params, {format: 'pkcs12', passphrase, legacy: form.legacy.checked});
    }
    try {
      const file = await track(`Packing ${certLabel(cert)}`, [`cert:${cert.id}`],
        () => download(token(), CORE, 'export', params));
      if (!file) { $('#export-error').textContent = `There is nothing to download for ${certLabel(cert)}.`; return; }
      const name = save(file, `${fileBase(commonName(cert))}.${pkcs12 ? 'p12' : 'zip'}`);
      dialog.close();
      notice(`${certLabel(cert)} was downloaded as ${name}. The private key is inside: keep the file safe.`);
    } catch (e) {
      if (authLost(e, dialog)) return;
      if (pkcs12 && e.code === 5503) fieldError(form.passphrase, messageOf(e));
      else $('#export-error').textContent = messageOf(e);
    }
  };
  showDialog(dialog, opener);
}

// ---- create ----
function setUpCreate() {
  const dialog = $('#create-dialog');
  const form = $('#create-form');
  $('#show-create').addEventListener('click', () => showDialog(dialog));
  form.addEventListener('submit', async (event) => {
    event.preventDefault();
    clearErrors(form);
    if (!form.reportValidity()) return;
    const params = {desc: form.desc.value.trim(), as_default: form.as_default.checked,
                    alias: form.alias.value.split(/[;,\s]+/).filter(Boolean).join(';'),
                    ...keyParams(form.key_type.value, ''), ...keyParams(form.ca_key_type.value, 'ca_')};
    for (const key of SUBJECT_KEYS) {
      params[key] = form[key] ? form[key].value.trim() : '';
      params[`ca_${key}`] = form[`ca_${key}`] ? form[`ca_${key}`].value.trim() : '';
    }
    const label = params.desc || params.common_name;
    // The dialog stays open (it may be closed meanwhile): its input is kept
    // until the certificate exists, and a refusal is shown inside it.
    try {
      await track(`Creating ${label}`, ['form:create'], () => call(token(), CRT, 'create', params));
    } catch (e) {
      if (authLost(e, dialog)) return;
      $('#create-error').textContent = messageOf(e);
      if (!dialog.open) notice(`${messageOf(e)} The form keeps what was typed: open Create self-signed… again.`, 'bad');
      return;
    }
    dialog.close();
    form.reset();
    await refresh();
    notice(`The certificate ${label} was created.`);
  });
}

// ---- import ----
// Which field a refusal of the import is about.
function importField(form, error) {
  const given = (name) => form[name].files.length > 0;
  if (['passphrase_required', 'passphrase_wrong', 'key_encrypted'].includes(error.reason)) return form.passphrase;
  switch (error.code) {
    case 5510:
      return given('pkcs12') && (!given('cert') || /PKCS#12/.test(error.message)) ? form.pkcs12 : form.cert;
    case 5511: case 5514: case 5518:
      return given('key') ? form.key : given('pkcs12') ? form.pkcs12 : form.cert;
    case 5512: case 5517:
      return form.inter_cert;
    default:
      return null;
  }
}

function setUpImport() {
  const dialog = $('#import-dialog');
  const form = $('#import-form');
  $('#show-import').addEventListener('click', () => {
    certOptions(form.elements.namedItem('id'), state.certificates, 'Nothing: a new certificate');
    showDialog(dialog);
  });
  form.addEventListener('submit', async (event) => {
    event.preventDefault();
    clearErrors(form);
    if (!form.cert.files.length && !form.pkcs12.files.length) {
      fieldError(form.cert, 'Choose a certificate file, or a PKCS#12 file above.');
      return;
    }
    // Import takes "as_default" as a text, unlike the other methods.
    const params = {desc: form.desc.value.trim()};
    if (form.as_default.checked) params.as_default = 'true';
    if (form.elements.namedItem('id').value) params.id = form.elements.namedItem('id').value;
    if (form.passphrase.value) params.passphrase = form.passphrase.value;
    const files = {key: form.key.files[0], cert: form.cert.files[0], inter_cert: form.inter_cert.files[0],
                   pkcs12: form.pkcs12.files[0]};
    const label = params.desc || (files.cert || files.pkcs12).name;
    let data;
    try {
      data = await track(`Importing ${label}`, ['form:import'], () => callWithFiles(token(), CORE, 'import', params, files));
    } catch (e) {
      if (authLost(e, dialog)) return;
      const field = importField(form, e);
      if (field) fieldError(field, messageOf(e));
      else $('#import-error').textContent = messageOf(e);
      return;
    }
    dialog.close();
    form.reset();
    await refresh();
    const warnings = (data && Array.isArray(data.warnings)) ? data.warnings : [];
    notice([`The certificate ${label} was imported.`,
            warnings.length ? el('ul', {className: 'import-warnings'},
              ...warnings.map((w) => el('li', {}, `Warning: ${w.message || w.reason}`))) : null],
           warnings.length ? 'bad' : '');
  });
}

// ---- requests ----
function certOptions(select, certs, none) {
  select.replaceChildren();
  if (none) select.append(el('option', {value: '', textContent: none}));
  for (const cert of certs) select.append(el('option', {value: cert.id, textContent: `${certLabel(cert)} — ${expiryText(cert)}`}));
}

function setUpRequests() {
  const dialog = $('#csr-dialog');
  const csrForm = $('#csr-form');
  const signForm = $('#sign-form');
  $('#show-csr').addEventListener('click', () => {
    const signers = sortedCertificates().filter(canSign);
    certOptions(signForm.elements.namedItem('id'), signers);
    $('#sign-none').hidden = signers.length > 0;
    signForm.querySelector('button[type=submit]').dataset.unchanged = String(!signers.length);
    applyLocks();
    showDialog(dialog);
  });
  csrForm.addEventListener('submit', async (event) => {
    event.preventDefault();
    clearErrors(csrForm);
    if (!csrForm.reportValidity()) return;
    const params = keyParams(csrForm.key_type.value, '');
    for (const key of SUBJECT_KEYS) params[key] = csrForm[key].value.trim();
    try {
      const file = await track('Making a key and request', ['gen'], async () => {
        await call(token(), CSR, 'create', params);
        return download(token(), CORE, 'export', {file: 'csr_set'});
      });
      if (!file) { $('#csr-error').textContent = 'The request was made but there was nothing to download.'; return; }
      const name = save(file, `${fileBase(params.common_name)}-request.zip`);
      dialog.close();
      notice(`The key and request for ${params.common_name} were downloaded as ${name}. The private key is ` +
             'in it: keep it safe.');
    } catch (e) {
      if (!authLost(e, dialog)) $('#csr-error').textContent = messageOf(e);
    }
  });
  signForm.addEventListener('submit', async (event) => {
    event.preventDefault();
    clearErrors(signForm);
    if (!signForm.reportValidity()) return;
    const params = {id: signForm.elements.namedItem('id').value, days: +signForm.days.value,
                    alias: signForm.alias.value.split(/[;,\s]+/).filter(Boolean).join(';')};
    const request = signForm.csr.files[0];
    try {
      const file = await track('Signing the request', ['gen'], async () => {
        await callWithFiles(token(), CSR, 'sign', params, {csr: request});
        return download(token(), CORE, 'export', {file: 'signed_set'});
      });
      if (!file) { $('#sign-error').textContent = 'The request could not be signed: is it a PEM signing request?'; return; }
      const name = save(file, `${fileBase(request.name.replace(/\.[^.]*$/, ''))}-signed.zip`);
      dialog.close();
      notice(`The signed certificate was downloaded as ${name}.`);
    } catch (e) {
      if (!authLost(e, dialog)) $('#sign-error').textContent = messageOf(e);
    }
  });
}

// ---- Let's Encrypt ----
function challengeHint(settings) {
  if (!settings) return 'The domain must reach this appliance on port 80 while the certificate is issued.';
  if (settings.challenge === 'dns') return `The DNS provider ${settings.dns_provider} proves the domain with a record; wildcard names work.`;
  if (settings.challenge === 'webroot') return `The web server serving ${settings.http_webroot} on port 80 proves the domain.`;
  return 'The domain must reach this appliance on port 80 while the certificate is issued.';
}

function setUpLetsEncrypt() {
  const dialog = $('#le-dialog');
  const form = $('#le-form');
  $('#show-le').addEventListener('click', async () => {
    showDialog(dialog);
    const [accounts, settings] = await Promise.allSettled([
      call(token(), `${LE}.Account`, 'list', {}), getServer(token(), LE_SETTINGS)]);
    // Both only help typing; the request itself says what is wrong.
    if (accounts.status === 'fulfilled') {
      $('#le-accounts').replaceChildren(...((accounts.value && accounts.value.email) || []).map((a) => el('option', {value: a.contact})));
    }
    $('#le-challenge-hint').textContent = challengeHint(settings.status === 'fulfilled' ? settings.value : null);
  });
  form.addEventListener('submit', async (event) => {
    event.preventDefault();
    clearErrors(form);
    if (!form.reportValidity()) return;
    const params = {desc: form.desc.value.trim(),
                    domain_name: form.domain_name.value.split(',').map((n) => n.trim()).filter(Boolean).join(','),
                    as_default: form.as_default.checked};
    if (form.email.value.trim()) params.email = form.email.value.trim();
    let data;
    try {
      data = await track(`Requesting a certificate for ${params.domain_name}`, ['form:le'],
                         () => call(token(), LE, 'create', params));
    } catch (e) {
      if (authLost(e, dialog)) return;
      if (e.code === 5522) fieldError(form.domain_name, messageOf(e));
      else if (e.code === 5521) fieldError(form.email, messageOf(e));
      else $('#le-error').textContent = messageOf(e);
      if (!dialog.open) notice(`${messageOf(e)} The form keeps what was typed: open Let's Encrypt… again.`, 'bad');
      return;
    }
    dialog.close();
    form.reset();
    const done = `Let's Encrypt issued a certificate for ${params.domain_name}.`;
    if (data && data.restart_httpd) await reconnect(done);
    else { await refresh(); notice(done); }
  });
}

// The settings dialog shows what is set; secrets only as "is set".
const leSettings = {current: null, providers: null};

function settingsView(form, s) {
  form.directory.value = s.directory || 'custom';
  form.directory_url.value = s.directory_url || '';
  $('#ls-ca_bundle-state').textContent = s.ca_bundle_is_set
    ? `Extra roots are set: ${(s.ca_bundle_subjects || []).join('; ') || 'a bundle'}.` : 'None: the system\'s roots are trusted.';
  $('#ls-ca_bundle_remove-label').hidden = !s.ca_bundle_is_set;
  form.eab_kid.value = s.eab_kid || '';
  form.eab_hmac_key.value = '';
  $('#ls-eab_hmac_key-state').textContent = s.eab_hmac_key_is_set ? 'An HMAC key is set.' : 'No HMAC key is set.';
  form.challenge.value = s.challenge || 'http';
  form.http_address.value = s.http_address || '';
  form.http_webroot.value = s.http_webroot || '';
  form.dns_resolvers.value = (s.dns_resolvers || []).join(', ');
  form.dns_disable_cp.checked = !!s.dns_disable_cp;
  form.key_type.value = s.key_type || 'rsa2048';
  form.timeout_s.value = s.timeout_s ?? '';
  settingsShape(form);
}

function settingsShape(form) {
  form.classList.toggle('custom', form.directory.value === 'custom');
  for (const c of ['http', 'webroot', 'dns']) form.classList.toggle(c, form.challenge.value === c);
}

async function providerFields(form, code) {
  const box = $('#ls-credentials .fields');
  box.replaceChildren();
  $('#ls-credentials').hidden = !code;
  if (!code) return;
  let info;
  try {
    info = await getServer(token(), `/server/letsencrypt/dns-providers/${encodeURIComponent(code)}`);
  } catch (e) {
    box.append(el('p', {className: 'error'}, messageOf(e)));
    return;
  }
  const s = leSettings.current || {};
  const kept = code === s.dns_provider ? new Set(s.environment_names || []) : new Set();
  const rows = [...(info.credentials || []).map((v) => [v, true]), ...(info.additional || []).map((v) => [v, false])];
  for (const [variable, secret] of rows) {
    const id = `ls-env-${variable.name}`;
    const hint = el('small', {id: `${id}-state`}, variable.description || '', kept.has(variable.name) ? ' (is set)' : '');
    box.append(el('label', {htmlFor: id}, variable.name, hint),
               el('input', {id, type: secret ? 'password' : 'text', autocomplete: 'off', 'data-env': variable.name,
                            placeholder: kept.has(variable.name) ? 'is set; leave empty to keep' : '',
                            'aria-describedby': `${id}-state`}));
  }
}

// The members that differ from what the server has.
function settingsChange(form, s) {
  const out = {};
  const url = form.directory.value === 'custom' ? form.directory_url.value.trim()
    : (s.known_directories || {})[form.directory.value];
  if (url !== undefined && url !== s.directory_url) out.directory_url = url;
  if (form.ca_bundle_remove.checked) out.ca_bundle_pem = '';
  if (form.eab_kid.value.trim() !== (s.eab_kid || '')) out.eab_kid = form.eab_kid.value.trim();
  if (form.eab_hmac_key.value) out.eab_hmac_key = form.eab_hmac_key.value;
  const challenge = form.challenge.value;
  if (challenge !== s.challenge) out.challenge = challenge;
  if (challenge === 'http' && form.http_address.value.trim() !== (s.http_address || '')) out.http_address = form.http_address.value.trim();
  if (challenge === 'webroot' && form.http_webroot.value.trim() !== (s.http_webroot || '')) out.http_webroot = form.http_webroot.value.trim();
  if (challenge === 'dns') {
    if (form.dns_provider.value !== (s.dns_provider || '')) out.dns_provider = form.dns_provider.value;
    const environment = {};
    for (const input of form.querySelectorAll('[data-env]')) if (input.value) environment[input.dataset.env] = input.value;
    if (Object.keys(environment).length) out.environment = environment;
    const resolvers = form.dns_resolvers.value.split(/[\s,]+/).filter(Boolean);
    if (resolvers.join(',') !== (s.dns_resolvers || []).join(',')) out.dns_resolvers = resolvers;
    if (form.dns_disable_cp.checked !== !!s.dns_disable_cp) out.dns_disable_cp = form.dns_disable_cp.checked;
  }
  if (form.key_type.value !== s.key_type) out.key_type = form.key_type.value;
  const timeout = form.timeout_s.value.trim();
  if (timeout !== String(s.timeout_s ?? '')) out.timeout_s = timeout === '' ? '' : Number(timeout);
  return out;
}

function setUpLeSettings() {
  const dialog = $('#le-settings-dialog');
  const form = $('#le-settings-form');
  $('#show-le-settings').addEventListener('click', async () => {
    clearErrors(form);
    form.reset();
    showDialog(dialog);
    try {
      const [settings, providers] = await Promise.all([getServer(token(), LE_SETTINGS),
        leSettings.providers ? {providers: leSettings.providers} : getServer(token(), '/server/letsencrypt/dns-providers')]);
      leSettings.current = settings;
      leSettings.providers = providers.providers || [];
      form.dns_provider.replaceChildren(el('option', {value: '', textContent: 'Choose a provider'}),
        ...leSettings.providers.map((p) => el('option', {value: p, textContent: p})));
      form.dns_provider.value = settings.dns_provider || '';
      settingsView(form, settings);
      await providerFields(form, form.dns_provider.value);
    } catch (e) {
      if (!authLost(e, dialog)) $('#ls-error').textContent = messageOf(e);
    }
  });
  form.directory.addEventListener('change', () => settingsShape(form));
  form.challenge.addEventListener('change', () => settingsShape(form));
  form.dns_provider.addEventListener('change', () => providerFields(form, form.dns_provider.value));
  form.addEventListener('submit', async (event) => {
    event.preventDefault();
    clearErrors(form);
    const s = leSettings.current;
    if (!s) return;
    const body = settingsChange(form, s);
    const bundle = form.ca_bundle.files[0];
    if (bundle) body.ca_bundle_pem = await bundle.text();
    if (!Object.keys(body).length) { dialog.close(); notice('Nothing was changed in the Let\'s Encrypt settings.'); return; }
    try {
      leSettings.current = await track('Saving the Let\'s Encrypt settings', ['form:le-settings'],
                                       () => postServer(token(), LE_SETTINGS, body));
      dialog.close();
      notice('The Let\'s Encrypt settings were saved.');
    } catch (e) {
      if (authLost(e, dialog)) return;
      const setting = e.setting === 'ca_bundle_pem' ? form.ca_bundle : form.querySelector(`#ls-${e.setting}`);
      if (e.setting === 'environment') $('#ls-environment-error').textContent = messageOf(e);
      else if (setting && e.setting) fieldError(setting, messageOf(e));
      else $('#ls-error').textContent = messageOf(e);
    }
  });
}

// ---- action log and the server's warnings ----
function eventItem(event) {
  const item = el('li', {className: event.severity || ''});
  if (event.time) {
    const when = new Date(event.time * 1000);
    item.append(el('time', {dateTime: when.toISOString()}, when.toLocaleString()));
  }
  item.append(event.message || '');
  return item;
}

function renderEvents(events) {
  const list = $('#events');
  list.replaceChildren(...events.slice(0, 50).map(eventItem));
  if (!events.length) list.append(el('li', {}, 'Nothing recorded yet.'));
  // The newest warning of each kind (the daily expiry warnings repeat).
  const seen = new Set();
  const warnings = events.filter((e) => e.severity === 'warning' && !seen.has(e.message) && seen.add(e.message)).slice(0, 5);
  $('#server-warnings ul').replaceChildren(...warnings.map(eventItem));
  $('#server-warnings').hidden = !warnings.length;
}

// ---- loading ----
async function refresh() {
  const [list, services, events] = await Promise.allSettled([
    call(token(), CRT, 'list', {}),
    getServer(token(), '/server/services'),
    getServer(token(), '/server/events?limit=100'),
  ]);
  for (const result of [list, services, events]) {
    if (result.status === 'rejected' && authLost(result.reason)) return false;
  }
  $('#table-error').textContent = list.status === 'rejected' ? messageOf(list.reason) : '';
  if (list.status === 'fulfilled') state.certificates = (list.value && list.value.certificates) || [];
  $('#services-error').textContent = services.status === 'rejected' ? messageOf(services.reason) : '';
  if (services.status === 'fulfilled') state.services = services.value.services || [];
  renderSummary();
  renderCertificates();
  renderServices();
  if (events.status === 'fulfilled') renderEvents(events.value.events || []);
  applyLocks();
  const reached = [list, services, events].every((r) => r.status === 'fulfilled');
  if (reached && $('#notice').dataset.kind === 'network') notice('');
  return reached;
}

function showView(signedIn) {
  $('#sign-in-view').hidden = signedIn;
  $('#app-view').hidden = !signedIn;
  $('#sign-out').hidden = !signedIn;
}

function signOut(reason, resume) {
  sessionStorage.removeItem(TOKEN_KEY);
  const open = resume || [...document.querySelectorAll('dialog[open]')].find((d) => d.id !== 'confirm-dialog');
  if (open) state.resume = open;
  for (const dialog of document.querySelectorAll('dialog[open]')) dialog.close();
  showView(false);
  $('#sign-in-error').textContent = reason || '';
  $('#token').value = '';
  $('#token').focus();
}

async function signIn(value) {
  sessionStorage.setItem(TOKEN_KEY, value);
  try {
    await getServer(value, '/server/health');
  } catch (e) {
    sessionStorage.removeItem(TOKEN_KEY);
    showView(false);
    $('#sign-in-error').textContent = messageOf(e);
    $('#token').focus();
    return;
  }
  showView(true);
  notice('');
  $('#page-title').focus();
  if (!await refresh()) return;
  // What was being done when the token was refused comes back as it was.
  const resume = state.resume;
  state.resume = null;
  if (resume) {
    const box = resume.querySelector('.error');
    if (box) box.textContent = 'You are signed in again. Check the form and send it again.';
    showDialog(resume, $('#page-title'));
  }
}

// ?timeout-ms=N and ?long-timeout-ms=N change how long the page waits for
// an answer (normal calls, and calls that make keys or talk to an ACME server).
function readBounds() {
  const query = new URLSearchParams(location.search);
  for (const [name, key] of [['timeout-ms', 'normal'], ['long-timeout-ms', 'long']]) {
    const value = Number(query.get(name));
    if (Number.isInteger(value) && value > 0) timeouts[key] = value;
  }
}

function start() {
  readBounds();
  keyOptions();
  $('#sign-in').addEventListener('submit', (event) => {
    event.preventDefault();
    signIn($('#token').value.trim());
  });
  $('#sign-out').addEventListener('click', () => signOut(''));
  $('#refresh').addEventListener('click', () => refresh());
  $('#sort').addEventListener('change', () => { state.sort = $('#sort').value; renderCertificates(); applyLocks(); });
  $('#show-reset').addEventListener('click', () => confirmReset());
  for (const dialog of document.querySelectorAll('dialog')) setUpDialog(dialog);
  setUpCreate();
  setUpImport();
  setUpRequests();
  setUpLetsEncrypt();
  setUpLeSettings();
  if (token()) signIn(token());
  else signOut('');
}

start();
