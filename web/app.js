// The certificate administration page: sign-in, the certificate table, the
// service assignment, the create/edit/delete actions and the action log.
import {call, callWithFiles, download, getServer, ApiError} from './api.js';

const CRT = 'ZEPH.Core.Certificate.CRT';
const SERVICE = 'ZEPH.Core.Certificate.Service';
const CORE = 'ZEPH.Core.Certificate';
const CSR = 'ZEPH.Core.Certificate.CSR';
const LE = 'ZEPH.Core.Certificate.LetsEncrypt';
const TOKEN_KEY = 'zeph-token';
const DAY_MS = 24 * 3600 * 1000;
const SUBJECT_KEYS = ['country', 'state', 'city', 'organization', 'department', 'common_name', 'email'];

const $ = (sel) => document.querySelector(sel);
const state = {certificates: [], services: []};

function token() { return sessionStorage.getItem(TOKEN_KEY) || ''; }

function el(tag, props, ...children) {
  const node = document.createElement(tag);
  Object.assign(node, props || {});
  for (const child of children) {
    if (child === null || child === undefined) continue;
    node.append(child instanceof Node ? child : String(child));
  }
  return node;
}

function notice(text, bad) {
  const box = $('#notice');
  box.textContent = text;
  box.classList.toggle('bad', !!bad);
}

function messageOf(error) {
  return error instanceof ApiError ? error.message : `The page failed: ${error.message}`;
}

// Runs a long call while the page stays usable; shows what runs and for how long.
async function withProgress(label, work) {
  const line = el('div', {className: 'running'});
  $('#progress').append(line);
  const started = Date.now();
  const tick = () => { line.textContent = `${label}… ${Math.floor((Date.now() - started) / 1000)} s`; };
  tick();
  const timer = setInterval(tick, 1000);
  try {
    return await work();
  } finally {
    clearInterval(timer);
    line.remove();
  }
}

// ---- dates ----
// The module writes times as "Jan  2 03:04:05 2030 GMT".
export function parseCertTime(text) {
  const m = /^([A-Z][a-z]{2})\s+(\d{1,2}) (\d{2}):(\d{2}):(\d{2}) (\d{4}) GMT$/.exec(text || '');
  if (!m) return null;
  const month = 'JanFebMarAprMayJunJulAugSepOctNovDec'.indexOf(m[1]) / 3;
  if (month < 0) return null;
  return new Date(Date.UTC(+m[6], month, +m[2], +m[3], +m[4], +m[5]));
}

function validityCell(cert) {
  const from = parseCertTime(cert.valid_from);
  const till = parseCertTime(cert.valid_till);
  const cell = el('td', {className: 'validity'});
  const fmt = (d, raw) => (d ? d.toISOString().slice(0, 10) : raw || '?');
  cell.append(el('div', {}, `${fmt(from, cert.valid_from)} – ${fmt(till, cert.valid_till)}`));
  if (till) {
    const days = Math.floor((till.getTime() - Date.now()) / DAY_MS);
    if (days < 0) {
      cell.classList.add('expired');
      cell.append(el('small', {className: 'days'}, 'expired'));
    } else {
      if (days < 30) cell.classList.add('expiring');
      cell.append(el('small', {className: 'days'}, `${days} day${days === 1 ? '' : 's'} left`));
    }
  }
  return cell;
}

function nameText(name) {
  if (!name) return '';
  const parts = [];
  if (name.organization) parts.push(name.organization);
  if (name.country) parts.push(name.country);
  return parts.join(', ');
}

function serviceName(s) { return s.display_name || `${s.subscriber}/${s.service}`; }
function sameService(a, b) { return a.subscriber === b.subscriber && a.service === b.service; }

function certLabel(cert) {
  const cn = (cert.subject && cert.subject.common_name) || cert.id;
  return cert.desc ? `${cert.desc} (${cn})` : cn;
}

// ---- certificate table ----
function renderCertificates() {
  const body = $('#certificates tbody');
  body.replaceChildren();
  for (const cert of state.certificates) {
    const row = el('tr', {});
    row.dataset.id = cert.id;
    const desc = el('td', {className: 'desc'}, cert.desc || '');
    if (cert.is_default) desc.append(el('span', {className: 'badge default'}, 'default'));
    if (cert.renewable) desc.append(el('span', {className: 'badge renew'}, 'renewable'));
    row.append(desc);
    const subject = el('td', {className: 'subject'}, (cert.subject && cert.subject.common_name) || '');
    subject.append(el('small', {}, nameText(cert.subject)));
    row.append(subject);
    const issuer = el('td', {className: 'issuer'}, (cert.issuer && cert.issuer.common_name) || '');
    issuer.append(el('small', {}, nameText(cert.issuer)));
    const ca = cert.self_signed_cacrt_info;
    if (ca) issuer.append(el('small', {}, `own authority: ${(ca.subject && ca.subject.common_name) || '?'}`));
    row.append(issuer);
    row.append(el('td', {className: 'san'}, (cert.sub_alt_name || []).join(', ')));
    const key = el('td', {className: 'key'}, cert.is_ecc ? 'EC' : 'RSA');
    key.append(el('small', {}, cert.signature_algorithm || ''));
    row.append(key);
    row.append(validityCell(cert));
    row.append(el('td', {className: 'services'}, (cert.services || []).map(serviceName).join(', ')));
    const actions = el('div', {className: 'actions'});
    actions.append(el('button', {type: 'button', className: 'edit', textContent: 'Edit',
                                 onclick: () => openEdit(cert)}));
    if (!cert.is_default) {
      actions.append(el('button', {type: 'button', className: 'make-default', textContent: 'Make default',
                                   onclick: () => setProperties(cert, cert.desc || '', true)}));
    }
    actions.append(el('button', {type: 'button', className: 'export', textContent: 'Export',
                                 onclick: () => exportSet({file: 'archive', id: cert.id}, certLabel(cert))}));
    actions.append(el('button', {type: 'button', className: 'recreate', textContent: 'Recreate',
                                 onclick: () => confirmRecreate(cert)}));
    actions.append(el('button', {type: 'button', className: 'csr', textContent: 'New request',
                                 onclick: () => renewRequest(cert)}));
    if (cert.renewable) {
      actions.append(el('button', {type: 'button', className: 'le-renew', textContent: 'Renew',
                                   onclick: () => change(`Renewing ${certLabel(cert)}`,
                                     () => call(token(), LE, 'renew', {id: cert.id}), `${certLabel(cert)} was renewed.`)}));
    }
    if (cert.user_deletable !== false && !cert.is_default) {
      actions.append(el('button', {type: 'button', className: 'delete danger', textContent: 'Delete',
                                   onclick: () => confirmDelete(cert)}));
    }
    row.append(el('td', {}, actions));
    body.append(row);
  }
}

// ---- services ----
function certificateOf(service) {
  return state.certificates.find((c) => (c.services || []).some((s) => sameService(s, service)));
}

function renderServices() {
  const body = $('#services tbody');
  body.replaceChildren();
  for (const service of state.services) {
    const current = certificateOf(service);
    const id = `svc-${service.subscriber}-${service.service}`.replace(/[^A-Za-z0-9_-]/g, '_');
    const select = el('select', {id});
    select.dataset.subscriber = service.subscriber;
    select.dataset.service = service.service;
    if (!current) select.append(el('option', {value: '', textContent: '(none)'}));
    for (const cert of state.certificates) {
      select.append(el('option', {value: cert.id, textContent: certLabel(cert),
                                  selected: current && current.id === cert.id}));
    }
    select.addEventListener('change', () => bindService(service, current ? current.id : '', select));
    body.append(el('tr', {}, el('td', {}, el('label', {htmlFor: id, textContent: serviceName(service)})),
                   el('td', {}, select)));
  }
}

async function bindService(service, oldId, select) {
  const id = select.value;
  select.disabled = true;
  try {
    const data = await withProgress(`Deploying to ${serviceName(service)}`, () =>
      call(token(), SERVICE, 'set', {settings: [{service, id, old_id: oldId}]}));
    if (data && data.restart_httpd) {
      await reconnect('The administration page now uses the new certificate.');
      return;
    }
    await refresh();
    if (data && data.err_settings && data.err_settings.length) {
      notice(`The certificate could not be deployed to ${serviceName(service)}.`, true);
    } else {
      notice(`${serviceName(service)} now uses the selected certificate.`);
    }
  } catch (e) {
    notice(messageOf(e), true);
    await refresh();
  } finally {
    select.disabled = false;
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
  notice(`${text} Reload the page and accept the new certificate.`, true);
}

// ---- edit / default ----
function openEdit(cert) {
  const dialog = $('#edit-dialog');
  const form = $('#edit-form');
  form.desc.value = cert.desc || '';
  form.as_default.checked = !!cert.is_default;
  form.as_default.disabled = !!cert.is_default;
  form.querySelector('.error').textContent = '';
  form.onsubmit = async (event) => {
    event.preventDefault();
    const ok = await setProperties(cert, form.desc.value.trim(), form.as_default.checked && !cert.is_default,
                                   form.querySelector('.error'));
    if (ok) dialog.close();
  };
  dialog.showModal();
}

async function setProperties(cert, desc, asDefault, errorBox) {
  try {
    await call(token(), CRT, 'set', {id: cert.id, desc, as_default: asDefault});
    await refresh();
    notice(asDefault ? `${certLabel({...cert, desc})} is now the default certificate.`
                     : 'The description was saved.');
    return true;
  } catch (e) {
    if (errorBox) errorBox.textContent = messageOf(e);
    else notice(messageOf(e), true);
    return false;
  }
}

// ---- confirmation ----
function askConfirm(title, nodes, yesLabel) {
  const dialog = $('#confirm-dialog');
  $('#confirm-title').textContent = title;
  $('#confirm-text').replaceChildren(...nodes);
  $('#confirm-yes').textContent = yesLabel;
  dialog.returnValue = '';
  return new Promise((resolve) => {
    dialog.onclose = () => resolve(dialog.returnValue === 'yes');
    dialog.showModal();
  });
}

// Runs a call that may move the administration page's certificate.
async function change(label, work, done) {
  try {
    const data = await withProgress(label, work);
    if (data && data.restart_httpd) {
      await reconnect(`${done} The administration page now uses the new certificate.`);
      return data;
    }
    await refresh();
    notice(done);
    return data;
  } catch (e) {
    notice(messageOf(e), true);
    if (e.data && e.data.restart_httpd) await reconnect('The administration page moved to another certificate.');
    else await refresh();
    return null;
  }
}

// ---- delete ----
async function confirmDelete(cert) {
  const moving = (cert.services || []).map(serviceName);
  const def = state.certificates.find((c) => c.is_default);
  const nodes = [el('p', {}, `Delete the certificate ${certLabel(cert)}? Its keys are removed for good.`)];
  if (moving.length) {
    nodes.push(el('p', {}, `These services will move to the default certificate${def ? ` (${certLabel(def)})` : ''}:`));
    nodes.push(el('ul', {className: 'moving'}, ...moving.map((n) => el('li', {}, n))));
  } else {
    nodes.push(el('p', {}, 'No service uses it.'));
  }
  if (!await askConfirm('Delete certificate', nodes, 'Delete')) return;
  await change(`Deleting ${certLabel(cert)}`, () => call(token(), CRT, 'delete', {ids: [cert.id]}),
               `${certLabel(cert)} was deleted.`);
}

async function confirmRecreate(cert) {
  const nodes = [el('p', {}, `Make new keys for ${certLabel(cert)}? It keeps its names and services; ` +
                             'clients that pinned the old key will have to accept the new one.')];
  if (!await askConfirm('Recreate certificate', nodes, 'Recreate')) return;
  await change(`Recreating ${certLabel(cert)}`, () => call(token(), CRT, 'recreate', {id: cert.id}),
               `${certLabel(cert)} has new keys.`);
}

async function confirmReset() {
  const removed = state.certificates.filter((c) => c.user_deletable !== false).map(certLabel);
  const nodes = [el('p', {}, 'Reset makes a new default certificate and binds every service to it.')];
  if (removed.length) {
    nodes.push(el('p', {}, 'These certificates will be removed:'));
    nodes.push(el('ul', {className: 'moving'}, ...removed.map((n) => el('li', {}, n))));
  }
  if (!await askConfirm('Reset certificates', nodes, 'Reset')) return;
  await change('Resetting the certificates', () => call(token(), CORE, 'reset', {}), 'The certificates were reset.');
}

// ---- downloads ----
function save(file) {
  const url = URL.createObjectURL(file.blob);
  const link = el('a', {href: url, download: file.name});
  document.body.append(link);
  link.click();
  link.remove();
  setTimeout(() => URL.revokeObjectURL(url), 60000);
}

async function exportSet(params, what) {
  try {
    const file = await withProgress(`Packing ${what}`, () => download(token(), CORE, 'export', params));
    if (!file) { notice(`There is nothing to download for ${what}.`, true); return; }
    save(file);
    notice(`${what} was downloaded as ${file.name}.`);
  } catch (e) {
    notice(messageOf(e), true);
  }
}

async function renewRequest(cert) {
  try {
    await withProgress(`Making a request for ${certLabel(cert)}`, () => call(token(), CSR, 'renew', {id: cert.id}));
    await exportSet({file: 'csr_set'}, 'The new key and request');
  } catch (e) {
    notice(messageOf(e), true);
  }
}

// ---- import, requests, Let's Encrypt ----
function certOptions(select, withNew) {
  select.replaceChildren();
  if (withNew) select.append(el('option', {value: '', textContent: 'Nothing: a new certificate'}));
  for (const cert of state.certificates) select.append(el('option', {value: cert.id, textContent: certLabel(cert)}));
}

function setUpForms() {
  const importDialog = $('#import-dialog');
  const importForm = $('#import-form');
  $('#show-import').addEventListener('click', () => { certOptions(importForm.elements.namedItem('id'), true); importDialog.showModal(); });
  importForm.addEventListener('submit', (event) => {
    event.preventDefault();
    if (!importForm.reportValidity()) return;
    // Import takes "as_default" as a text, unlike the other methods.
    const params = {desc: importForm.desc.value.trim()};
    if (importForm.as_default.checked) params.as_default = 'true';
    if (importForm.elements.namedItem('id').value) params.id = importForm.elements.namedItem('id').value;
    const files = {key: importForm.key.files[0], cert: importForm.cert.files[0],
                   inter_cert: importForm.inter_cert.files[0]};
    importDialog.close();
    change('Importing', () => callWithFiles(token(), CORE, 'import', params, files),
           `The certificate ${params.desc || files.cert.name} was imported.`)
      .then(() => importForm.reset());
  });

  const csrDialog = $('#csr-dialog');
  const csrForm = $('#csr-form');
  const signForm = $('#sign-form');
  $('#show-csr').addEventListener('click', () => { certOptions(signForm.elements.namedItem('id'), false); csrDialog.showModal(); });
  csrForm.addEventListener('submit', async (event) => {
    event.preventDefault();
    if (!csrForm.reportValidity()) return;
    const params = {key_length: +csrForm.key_length.value};
    for (const key of SUBJECT_KEYS) params[key] = csrForm[key].value.trim();
    csrDialog.close();
    try {
      await withProgress('Making a key and request', () => call(token(), CSR, 'create', params));
      await exportSet({file: 'csr_set'}, 'The key and request');
    } catch (e) {
      notice(messageOf(e), true);
    }
  });
  signForm.addEventListener('submit', async (event) => {
    event.preventDefault();
    if (!signForm.reportValidity()) return;
    const params = {id: signForm.elements.namedItem('id').value, days: +signForm.days.value,
                    alias: signForm.alias.value.split(/[;,\s]+/).filter(Boolean).join(';')};
    const files = {csr: signForm.csr.files[0]};
    csrDialog.close();
    try {
      await withProgress('Signing the request', () => callWithFiles(token(), CSR, 'sign', params, files));
      await exportSet({file: 'signed_set'}, 'The signed certificate');
    } catch (e) {
      notice(messageOf(e), true);
    }
  });

  const leDialog = $('#le-dialog');
  const leForm = $('#le-form');
  $('#show-le').addEventListener('click', async () => {
    leDialog.showModal();
    try {
      const accounts = await call(token(), `${LE}.Account`, 'list', {});
      $('#le-accounts').replaceChildren(...(accounts.email || []).map((a) => el('option', {value: a.contact})));
    } catch (e) { /* the list only helps typing */ }
  });
  leForm.addEventListener('submit', (event) => {
    event.preventDefault();
    if (!leForm.reportValidity()) return;
    const params = {desc: leForm.desc.value.trim(), domain_name: leForm.domain_name.value.trim(),
                    as_default: leForm.as_default.checked};
    if (leForm.email.value.trim()) params.email = leForm.email.value.trim();
    leDialog.close();
    leForm.reset();
    change(`Requesting a certificate for ${params.domain_name}`, () => call(token(), LE, 'create', params),
           `Let's Encrypt issued a certificate for ${params.domain_name}.`);
  });
  $('#show-reset').addEventListener('click', () => confirmReset());
}

// ---- create ----
function setUpCreate() {
  const dialog = $('#create-dialog');
  const form = $('#create-form');
  $('#show-create').addEventListener('click', () => dialog.showModal());
  form.addEventListener('submit', (event) => {
    event.preventDefault();
    if (!form.reportValidity()) return;
    const params = {desc: form.desc.value.trim(), as_default: form.as_default.checked,
                    key_length: +form.key_length.value, ca_key_length: +form.ca_key_length.value,
                    alias: form.alias.value.split(/[;,\s]+/).filter(Boolean).join(';')};
    for (const key of SUBJECT_KEYS) {
      params[key] = form[key] ? form[key].value.trim() : '';
      params[`ca_${key}`] = form[`ca_${key}`] ? form[`ca_${key}`].value.trim() : '';
    }
    dialog.close();
    form.reset();
    const label = params.desc || params.common_name;
    // Not awaited: the page stays usable while the keys are made.
    withProgress(`Creating ${label}`, () => call(token(), CRT, 'create', params))
      .then(async () => { await refresh(); notice(`The certificate ${label} was created.`); })
      .catch((e) => notice(messageOf(e), true));
  });
}

// ---- action log ----
function renderEvents(events) {
  const list = $('#events');
  list.replaceChildren();
  for (const event of events) {
    const item = el('li', {className: event.severity || ''});
    if (event.time) {
      const when = new Date(event.time * 1000);
      item.append(el('time', {dateTime: when.toISOString()}, when.toLocaleString()));
    }
    item.append(event.message || '');
    list.append(item);
  }
  if (!events.length) list.append(el('li', {}, 'Nothing recorded yet.'));
}

// ---- loading ----
async function refresh() {
  const [list, services, events] = await Promise.allSettled([
    call(token(), CRT, 'list', {}),
    getServer(token(), '/server/services'),
    getServer(token(), '/server/events?limit=50'),
  ]);
  for (const result of [list, services, events]) {
    if (result.status === 'rejected' && result.reason.code === 401) { signOut(messageOf(result.reason)); return; }
  }
  $('#table-error').textContent = list.status === 'rejected' ? messageOf(list.reason) : '';
  if (list.status === 'fulfilled') state.certificates = (list.value && list.value.certificates) || [];
  $('#services-error').textContent = services.status === 'rejected' ? messageOf(services.reason) : '';
  if (services.status === 'fulfilled') state.services = services.value.services || [];
  renderCertificates();
  renderServices();
  if (events.status === 'fulfilled') renderEvents(events.value.events || []);
}

function showView(signedIn) {
  $('#sign-in-view').hidden = signedIn;
  $('#app-view').hidden = !signedIn;
  $('#sign-out').hidden = !signedIn;
}

function signOut(reason) {
  sessionStorage.removeItem(TOKEN_KEY);
  showView(false);
  $('#sign-in-error').textContent = reason || '';
  $('#token').focus();
}

async function signIn(value) {
  sessionStorage.setItem(TOKEN_KEY, value);
  try {
    await getServer(value, '/server/health');
  } catch (e) {
    signOut(messageOf(e));
    return;
  }
  showView(true);
  notice('');
  await refresh();
}

function start() {
  $('#sign-in').addEventListener('submit', (event) => {
    event.preventDefault();
    signIn($('#token').value.trim());
  });
  $('#sign-out').addEventListener('click', () => signOut(''));
  $('#refresh').addEventListener('click', () => refresh());
  for (const button of document.querySelectorAll('dialog .cancel')) {
    button.addEventListener('click', () => button.closest('dialog').close());
  }
  setUpCreate();
  setUpForms();
  if (token()) signIn(token());
  else signOut('');
}

start();
