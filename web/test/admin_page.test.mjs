// The administration page in headless Chromium against a real zeph-webapid
// (and the nginx it runs in front of it) on a private root, at a phone's and
// a desktop's width.
//   node --test admin_page.test.mjs
// Environment: ZEPH_BIN_DIR (where zeph-webapid is), ZEPH_WEB_DIR (the
// page), ZEPH_SCREENSHOT_DIR (where screenshots go; default: the cwd).
import {test, before, after} from 'node:test';
import assert from 'node:assert/strict';
import {execFileSync, spawn} from 'node:child_process';
import fs from 'node:fs';
import os from 'node:os';
import path from 'node:path';
import tls from 'node:tls';
import {fileURLToPath} from 'node:url';
import {chromium} from 'playwright-core';

const here = path.dirname(fileURLToPath(import.meta.url));
const binDir = process.env.ZEPH_BIN_DIR || path.resolve(here, '../../build/bin');
const webDir = process.env.ZEPH_WEB_DIR || path.resolve(here, '..');
const shotDir = process.env.ZEPH_SCREENSHOT_DIR || process.cwd();
const WIDTHS = [390, 1280];

let tmp, root, mat, server, port, token, browser, page;
let serverOutput = '';
const policyErrors = [];

function startServer() {
  return new Promise((resolve, reject) => {
    const child = spawn(path.join(binDir, 'zeph-webapid'),
                        ['--root', root, '--listen', '127.0.0.1:0', '--web', webDir],
                        {stdio: ['ignore', 'ignore', 'pipe']});
    child.stderr.on('data', (chunk) => {
      serverOutput += chunk;
      const m = /listening on https:\/\/127\.0\.0\.1:(\d+)/.exec(serverOutput);
      if (m && !port) { port = +m[1]; resolve(child); }
    });
    child.on('exit', (code) => { if (!port) reject(new Error(`zeph-webapid ended (${code}):\n${serverOutput}`)); });
  });
}

// The common name of the certificate the server presents to a new connection.
function presentedCommonName() {
  return new Promise((resolve, reject) => {
    const socket = tls.connect({host: '127.0.0.1', port, rejectUnauthorized: false},
                               () => { resolve(socket.getPeerCertificate().subject.CN); socket.end(); });
    socket.on('error', reject);
  });
}

const run = (cmd, args, opts) => execFileSync(cmd, args, {encoding: 'utf8', stdio: 'pipe', ...opts});
const openssl = (...args) => run('/usr/bin/openssl', args, {cwd: mat});
const archiveDir = (id) => path.join(root, 'usr/zeph/etc/certificate/_archive', id);
const row = (text) => page.locator('#certificates tbody tr', {hasText: text});
const at = (width) => page.setViewportSize({width, height: 900});

async function shot(name) {
  fs.mkdirSync(shotDir, {recursive: true});
  await page.screenshot({path: path.join(shotDir, `web-${name}.png`), fullPage: true});
}

// Waits for the notice line to say `text` (a string or RegExp); a timeout
// names what it said instead.
async function expectNotice(text, bad) {
  try {
    await page.locator(bad ? '#notice.bad' : '#notice', {hasText: text}).waitFor({timeout: 60000});
  } catch (e) {
    await shot('failure');
    throw new Error(`notice "${await page.locator('#notice').innerText()}", expected ${text}`);
  }
}

// A row's action button by accessible name, out of its menu where the
// width folds the actions into one.
async function action(rowText, name) {
  const toggle = row(rowText).locator('.menu-toggle');
  if (await toggle.isVisible() && await toggle.getAttribute('aria-expanded') !== 'true') await toggle.click();
  return row(rowText).getByRole('button', {name});
}

// axe-core's scan of what is on screen (a dialog with the page behind it):
// nothing serious or critical, and rules that did run.
async function axe(what) {
  const result = await page.evaluate(async () => {
    const r = await window.axe.run(document, {resultTypes: ['violations', 'passes']});
    return {passes: r.passes.length, bad: r.violations.filter((v) => ['serious', 'critical'].includes(v.impact))
      .map((v) => `${v.id}: ${v.nodes.map((n) => n.target.join(' ')).join(', ')}`)};
  });
  assert.ok(result.passes > 10, `axe checked nothing in ${what}`);
  assert.deepEqual(result.bad, [], `axe in ${what}`);
}

// Chooses the option of a select whose text holds `text`.
const choose = async (select, text) =>
  select.selectOption(await select.locator('option', {hasText: text}).getAttribute('value'));

async function downloaded(click) {
  const [file] = await Promise.all([page.waitForEvent('download'), click()]);
  const saved = path.join(fs.mkdtempSync(path.join(tmp, 'dl-')), file.suggestedFilename());
  await file.saveAs(saved);
  return saved;
}

function unzip(zip) {
  const out = `${zip}.d`;
  run('/usr/bin/7z', ['x', `-o${out}`, zip]);
  return (name) => run('/usr/bin/find', [out, '-name', name]).trim();
}

// Keys and certificates an administrator brings: a chain whose leaf runs out
// in 20 days, an expired set, a PKCS#12 bundle with a passphrase, junk.
function makeMaterial() {
  fs.writeFileSync(path.join(mat, 'ca.ext'), 'basicConstraints=critical,CA:TRUE\nkeyUsage=keyCertSign,cRLSign\n');
  for (const name of ['shop', 'vault']) fs.writeFileSync(path.join(mat, `${name}.ext`), `subjectAltName=DNS:${name}.example\n`);
  const ec = ['-newkey', 'ec', '-pkeyopt', 'ec_paramgen_curve:P-256', '-nodes'];
  openssl('req', '-x509', ...ec, '-keyout', 'root.key', '-out', 'root.pem', '-days', '30', '-subj', '/CN=Test Root');
  for (const [name, cn, ca, days, ext] of [['inter', 'Test Intermediate', 'root', 30, 'ca.ext'],
                                          ['leaf', 'shop.example', 'inter', 20, 'shop.ext'],
                                          ['vault', 'vault.example', 'root', 90, 'vault.ext']]) {
    openssl('req', ...ec, '-keyout', `${name}.key`, '-out', `${name}.csr`, '-subj', `/CN=${cn}`);
    openssl('x509', '-req', '-in', `${name}.csr`, '-CA', `${ca}.pem`, '-CAkey', `${ca}.key`, '-CAcreateserial',
            '-days', String(days), '-extfile', ext, '-out', `${name}.pem`);
  }
  openssl('pkcs12', '-export', '-inkey', 'vault.key', '-in', 'vault.pem', '-passout', 'pass:s3cret', '-out', 'vault.p12');
  fs.writeFileSync(path.join(mat, 'ca.cnf'), '[ca]\ndefault_ca=d\n[d]\ndatabase=index.txt\nnew_certs_dir=.\n' +
                   'serial=serial\ndefault_md=sha256\npolicy=p\n[p]\ncommonName=supplied\n');
  fs.writeFileSync(path.join(mat, 'index.txt'), '');
  fs.writeFileSync(path.join(mat, 'serial'), '01\n');
  openssl('req', ...ec, '-keyout', 'old.key', '-out', 'old.csr', '-subj', '/CN=old.example');
  openssl('ca', '-batch', '-config', 'ca.cnf', '-selfsign', '-keyfile', 'old.key', '-in', 'old.csr', '-notext',
          '-startdate', '20200101000000Z', '-enddate', '20200201000000Z', '-out', 'old.pem');
  openssl('req', ...ec, '-keyout', 'ext.key', '-out', 'ext.csr', '-subj', '/CN=printer.example');
  fs.writeFileSync(path.join(mat, 'junk.pem'), 'these are not the bytes of a certificate\n');
}

before(async () => {
  tmp = fs.mkdtempSync(path.join(os.tmpdir(), 'zeph-web-'));
  // Started as root, the server's nginx workers run as www-data and must
  // reach its run directory below the root.
  fs.chmodSync(tmp, 0o755);
  root = path.join(tmp, 'root');
  mat = fs.mkdtempSync(path.join(tmp, 'material-'));
  makeMaterial();
  // A second service beside the web administration, and an ACME server
  // nobody answers at: nothing leaves the machine.
  run(path.join(binDir, 'zephcert'), ['--root', root, 'init']);
  const servicesFile = path.join(root, 'usr/zeph/etc/certificate/_archive/SERVICES');
  const services = JSON.parse(fs.readFileSync(servicesFile, 'utf8'));
  services.push({...services[0], display_name: 'File sharing', subscriber: 'smb', service: 'default'});
  delete services[1].display_name_i18n;
  fs.writeFileSync(servicesFile, JSON.stringify(services));
  fs.writeFileSync(path.join(root, 'usr/zeph/etc/letsencrypt/config.json'),
                   JSON.stringify({directory_url: 'https://127.0.0.1:9/directory', timeout_s: 10}));
  server = await startServer();
  token = fs.readFileSync(path.join(root, 'usr/zeph/etc/webapid/token'), 'utf8').trim();
  browser = await chromium.launch({
    executablePath: process.env.ZEPH_CHROMIUM || '/usr/bin/chromium',
    args: ['--no-sandbox', '--disable-gpu', '--disable-quic', '--no-first-run',
           '--disable-background-networking', '--disable-component-update', '--disable-sync'],
  });
  const context = await browser.newContext({ignoreHTTPSErrors: true, viewport: {width: 1280, height: 900}});
  // axe-core from the disk into every page, past the page's own policy.
  await context.addInitScript({path: path.join(here, 'node_modules/axe-core/axe.min.js')});
  page = await context.newPage();
  page.on('console', (m) => { if (/Content Security Policy/.test(m.text())) policyErrors.push(m.text()); });
  await page.goto(`https://127.0.0.1:${port}/`);
});

after(async () => {
  if (browser) await browser.close();
  if (server) server.kill('SIGTERM');
  if (tmp) fs.rmSync(tmp, {recursive: true, force: true});
});

test('a wrong token is refused; signing in focuses the heading and survives a reload', async () => {
  await axe('the sign-in form');
  await page.getByLabel('Access token').fill('0'.repeat(64));
  await page.getByRole('button', {name: 'Sign in'}).click();
  await page.locator('#sign-in-error', {hasText: 'The token was not accepted'}).waitFor();
  assert.equal(await page.locator('#app-view').isHidden(), true);
  await page.getByLabel('Access token').fill(token);
  await page.getByRole('button', {name: 'Sign in'}).click();
  await row('arvelon').waitFor();
  assert.equal(await page.evaluate(() => document.activeElement.tagName), 'H1');
  await page.reload();
  await row('arvelon').waitFor();
  assert.match(await page.locator('#events').innerText(), /made the default certificate/);
});

for (const [width, name, keyType] of [[390, 'portal', 'EC P-256'], [1280, 'intranet', 'EC P-384']]) {
  test(`at ${width} px the create dialog keeps its input through a refusal and a lost sign-in`, async () => {
    await at(width);
    await page.getByRole('button', {name: 'Create self-signed…'}).click();
    const dialog = page.locator('#create-dialog');
    for (const [field, value] of [['desc', `${name} site`], ['common_name', name], ['alias', `${name}.local`],
                                  ['ca_common_name', `${name} CA`]]) await page.locator(`#c-${field}`).fill(value);
    await page.locator('#c-key_type').selectOption({label: keyType});
    await page.locator('#c-ca_key_type').selectOption({label: keyType});
    await axe('the create dialog');
    const create = '**/ZEPH.Core.Certificate.CRT/1/create';
    await page.route(create, (r) => r.fulfill({json: {success: false, error: {code: 5503, data: null}}}), {times: 1});
    await dialog.getByRole('button', {name: 'Create'}).click();
    await page.locator('#create-error', {hasText: 'missing or not valid'}).waitFor();
    assert.equal(await page.locator('#c-common_name').inputValue(), name);
    // A token refused midway brings the sign-in back, then the dialog as it was.
    await page.route(create, (r) => r.fulfill({status: 401, json: {success: false, error: {code: 401, data: {message: 'no token'}}}}),
                     {times: 1});
    await dialog.getByRole('button', {name: 'Create'}).click();
    await page.locator('#sign-in-error', {hasText: 'not accepted'}).waitFor();
    await page.getByLabel('Access token').fill(token);
    await page.getByRole('button', {name: 'Sign in'}).click();
    await dialog.waitFor();
    assert.equal(await page.locator('#c-ca_common_name').inputValue(), `${name} CA`);
    assert.equal(await page.locator('#c-key_type option:checked').innerText(), keyType);
    await dialog.getByRole('button', {name: 'Create'}).click();
    await row(`${name} site`).waitFor({timeout: 120000});
    assert.match(await row(`${name} site`).locator('.key').innerText(), /^EC/);
  });
}

// Each attempt at its width; a refusal names the field and keeps the dialog.
const IMPORTS = [
  [390, 'Junk', {cert: 'junk.pem', key: 'leaf.key'}, '', '#i-cert', /holds no certificate/],
  [390, 'Vault', {pkcs12: 'vault.p12'}, '', '#i-passphrase', /needs a passphrase/],
  [390, 'Vault', {pkcs12: 'vault.p12'}, 'wrong', '#i-passphrase', /does not open/],
  [390, 'Vault', {pkcs12: 'vault.p12'}, 's3cret', null, /imported\.\s*Warning: .*vault\.example/],
  [1280, 'Shop', {key: 'inter.key', cert: 'leaf.pem'}, '', '#i-key', /does not belong to the certificate/],
  [1280, 'Shop', {key: 'leaf.key', cert: 'leaf.pem', inter_cert: 'inter.pem'}, '', null, /Shop was imported/],
  [1280, 'Legacy box', {key: 'old.key', cert: 'old.pem'}, '', null, /Warning: the certificate expired/],
];
for (const [width, desc, files, passphrase, field, expect] of IMPORTS) {
  test(`at ${width} px importing ${desc} from ${Object.values(files).join(', ')} says ${expect.source}`, async () => {
    await at(width);
    const dialog = page.locator('#import-dialog');
    if (!await dialog.isVisible()) await page.getByRole('button', {name: 'Import…'}).click();
    await page.locator('#i-desc').fill(desc);
    for (const part of ['key', 'cert', 'inter', 'pkcs12']) {
      const file = files[part === 'inter' ? 'inter_cert' : part];
      await page.locator(`#i-${part}`).setInputFiles(file ? path.join(mat, file) : []);
    }
    await page.locator('#i-passphrase').fill(passphrase);
    await dialog.getByRole('button', {name: 'Import'}).click();
    if (!field) {
      await expectNotice(expect);
      await row(desc).waitFor();
      return;
    }
    await page.locator(`${field}-error`).filter({hasText: expect}).waitFor();
    assert.equal(await page.locator(field).getAttribute('aria-invalid'), 'true');
    assert.equal(await page.locator('#i-desc').inputValue(), desc);
    await axe('the import dialog with a refusal');
  });
}

for (const [width, service, target, cn] of [[390, 'File sharing', 'Shop', null], [1280, 'Web administration', 'portal site', 'portal']]) {
  test(`at ${width} px ${service} is bound only through Apply and a confirmation`, async () => {
    await at(width);
    let sets = 0;
    page.on('request', (r) => { if (r.url().includes('Certificate.Service/1/set')) sets++; });
    const select = page.getByLabel(service, {exact: true});
    await select.focus();
    await page.keyboard.press('ArrowDown');
    await choose(select, target);
    assert.match(await select.locator('option:checked').innerText(), /— expires \d{4}-\d\d-\d\d, \d+ days left$/);
    await Promise.all([page.waitForResponse(/CRT\/1\/list/), page.getByRole('button', {name: 'Refresh'}).click()]);
    assert.equal(sets, 0, 'choosing deployed at once');
    // An expired certificate is bound only past a warning.
    await choose(select, 'Legacy box');
    await page.getByRole('button', {name: `Apply to ${service}`}).click();
    const confirm = page.locator('#confirm-dialog');
    assert.match(await confirm.innerText(), /Legacy box \(old\.example\) has expired/);
    await confirm.getByRole('button', {name: 'Cancel'}).click();
    await choose(select, target);
    await page.getByRole('button', {name: `Apply to ${service}`}).click();
    const text = await confirm.innerText();
    assert.match(text, new RegExp(`${service} will use ${target}`));
    assert.equal(/certificate of this very page is swapped/.test(text), service === 'Web administration');
    await axe('the binding confirmation');
    await confirm.getByRole('button', {name: 'Bind'}).click();
    await expectNotice(cn ? 'Reconnected' : `${service} now uses ${target}`);
    assert.equal(sets, 1);
    assert.match(await row(target).locator('.services').innerText(), new RegExp(service));
    if (cn) assert.equal(await presentedCommonName(), cn);
  });
}

for (const width of WIDTHS) {
  test(`at ${width} px the expiry summary, the server's warnings and both sort orders show`, async () => {
    await at(width);
    // The daily renewal run warns of certificates in use that run out.
    try { run(path.join(binDir, 'zeph-letsencrypt'), ['renew-due'], {env: {...process.env, ZEPH_ROOT: root}}); } catch (e) {}
    await page.getByRole('button', {name: 'Refresh'}).click();
    await page.locator('#server-warnings', {hasText: /shop\.example.* expires in \d+ days .*File sharing uses it/}).waitFor();
    assert.equal(await page.locator('#expiry-summary').innerText(), '1 expired, 1 expires within 30 days');
    const labels = () => page.locator('#certificates tbody tr .subject').evaluateAll((cells) => cells.map((c) => c.firstChild.textContent));
    await page.getByLabel('Sort by').selectOption('expiry');
    assert.deepEqual((await labels()).slice(0, 2), ['old.example', 'shop.example']);
    await page.getByLabel('Sort by').selectOption('name');
    assert.deepEqual(await labels(), ['arvelon', 'intranet', 'old.example', 'portal', 'shop.example', 'vault.example']);
    await (await action('Legacy box', 'Make default')).click();
    const confirm = page.locator('#confirm-dialog');
    assert.match(await confirm.innerText(), /Legacy box \(old\.example\) has expired/);
    await confirm.getByRole('button', {name: 'Cancel'}).click();
    assert.doesNotMatch(await row('Legacy box').locator('.desc').innerText(), /default/);
  });
}

// What each kind of set offers: Recreate for the appliance's own self-signed
// sets only, New request or Let's Encrypt renewal for the others.
const OFFERS = [
  ['portal site', 'Recreate', /signed again by its own authority portal CA/, ['New request for', 'Renew']],
  ['Shop', 'New request for', /Shop \(shop\.example\) itself does not change.*import its certificate/s, ['Recreate', 'Renew']],
  ['Vault', 'Renew', /asks the ACME server .*If the request fails, the current certificate stays/s, ['Recreate']],
];
for (const width of WIDTHS) {
  test(`at ${width} px rows offer what fits the set, named after it, and signing lists only own authorities`, async () => {
    await at(width);
    fs.writeFileSync(path.join(archiveDir(await row('Vault').getAttribute('data-id')), 'renew.json'), '{}');
    await page.getByRole('button', {name: 'Refresh'}).click();
    await page.locator('#certificates .badge.renew').waitFor();
    for (const [label, offered, says, absent] of OFFERS) {
      for (const name of absent) assert.equal(await (await action(label, name)).count(), 0, `${name} for ${label}`);
      const opener = await action(label, offered);
      await opener.click();
      const confirm = page.locator('#confirm-dialog');
      assert.match(await confirm.innerText(), says);
      await confirm.getByRole('button', {name: 'Cancel'}).click();
      // Focus returns to what opened the dialog: the button, or the menu it is folded in.
      await page.waitForFunction((id) => document.activeElement.closest('tr')?.dataset.id === id,
                                 await row(label).getAttribute('data-id'), {timeout: 5000});
    }
    await (await action('Shop', 'Delete Shop (shop.example)')).click();
    const yes = page.locator('#confirm-yes');
    assert.equal(await yes.evaluate((b) => getComputedStyle(b).backgroundColor), 'rgb(164, 14, 38)');
    await axe('the delete confirmation');
    await page.locator('#confirm-dialog').getByRole('button', {name: 'Cancel'}).click();
    await page.getByRole('button', {name: 'Signing requests…'}).click();
    assert.deepEqual(await page.locator('#s-id option').evaluateAll((o) => o.map((n) => n.textContent.split(' — ')[0])),
                     ['arvelon', 'intranet site (intranet)', 'portal site (portal)']);
    await axe('the requests dialog');
    await page.locator('#csr-dialog').getByRole('button', {name: 'Close'}).click();
  });
}

// Every file handed out is named after what is in it and says what it holds.
const DOWNLOADS = [
  [390, 'a zip export', async () => {
    await (await action('Shop', 'Export Shop')).click();
    assert.match(await page.locator('#export-dialog').innerText(), /holds the private key of Shop.*Keep it safe/s);
    await axe('the export dialog');
    return page.locator('#export-dialog').getByRole('button', {name: 'Download'});
  }, 'shop.example.zip', /private key is inside: keep the file safe/, (get) => assert.ok(get('privkey.pem'))],
  [1280, 'a PKCS#12 export', async () => {
    await (await action('portal site', 'Export')).click();
    await page.getByLabel('PKCS#12 file (.p12)').check();
    await page.getByRole('button', {name: 'Download'}).click();
    await page.locator('#x-passphrase-error', {hasText: 'Give a passphrase'}).waitFor();
    await page.locator('#x-passphrase').fill('s3cret');
    return page.getByRole('button', {name: 'Download'});
  }, 'portal.p12', /private key is inside/, null,
  (file) => assert.match(openssl('pkcs12', '-in', file, '-passin', 'pass:s3cret', '-nokeys'), /subject=CN = portal/)],
  [390, 'a new request', async () => {
    await page.getByRole('button', {name: 'Signing requests…'}).click();
    for (const [f, v] of [['common_name', 'mail.example'], ['organization', 'Example'], ['department', 'Mail'],
                          ['city', 'Delft'], ['state', 'ZH'], ['country', 'NL'], ['email', 'pm@mail.example']]) {
      await page.locator(`#r-${f}`).fill(v);
    }
    await page.locator('#r-key_type').selectOption({label: 'EC P-384'});
    return page.getByRole('button', {name: 'Create request'});
  }, 'mail.example-request.zip', /key and request for mail\.example were downloaded/,
  (get) => assert.match(openssl('pkey', '-in', get('server.key'), '-noout', '-text'), /NIST CURVE: P-384/)],
  [1280, 'a request for an imported set', async () => {
    await (await action('Shop', 'New request for')).click();
    return page.locator('#confirm-dialog').getByRole('button', {name: 'Make request'});
  }, 'shop.example-request.zip', /key and request for Shop \(shop\.example\) were downloaded/,
  (get) => assert.match(openssl('req', '-in', get('server.csr'), '-noout', '-subject'), /CN = shop\.example/)],
  [390, 'a signed request', async () => {
    await page.getByRole('button', {name: 'Signing requests…'}).click();
    await page.locator('#s-csr').setInputFiles(path.join(mat, 'ext.csr'));
    await page.locator('#s-id').selectOption({index: 2});
    return page.getByRole('button', {name: 'Sign and download'});
  }, 'ext-signed.zip', /signed certificate was downloaded/,
  (get) => assert.match(openssl('x509', '-in', get('server.crt'), '-noout', '-issuer'), /portal CA/)],
];
for (const [width, what, open, name, says, inZip, check] of DOWNLOADS) {
  test(`at ${width} px ${what} downloads as ${name}`, async () => {
    await at(width);
    const button = await open();
    const file = await downloaded(() => button.click());
    assert.equal(path.basename(file), name);
    await expectNotice(says);
    if (inZip) inZip(unzip(file));
    if (check) check(file);
  });
}

for (const width of WIDTHS) {
  test(`at ${width} px a stuck recreate locks its certificate, is told once and given up after its bound`, async () => {
    await at(width);
    await page.goto(`https://127.0.0.1:${port}/?long-timeout-ms=3000`);
    await row('intranet site').waitFor();
    let held;
    await page.route('**/*.CRT/1/recreate', (r) => { held = r; });
    await (await action('intranet site', 'Recreate')).click();
    await page.locator('#confirm-dialog').getByRole('button', {name: 'Recreate'}).click();
    await page.locator('#progress', {hasText: 'Recreating intranet site'}).waitFor();
    await page.evaluate(() => {
      window.liveChanges = 0;
      const watch = new MutationObserver((m) => { window.liveChanges += m.length; });
      for (const n of document.querySelectorAll('[aria-live], [role=status], [role=alert]')) {
        watch.observe(n, {childList: true, subtree: true, characterData: true});
      }
    });
    await page.locator('#progress', {hasText: /[1-9] s/}).waitFor();
    assert.equal(await page.evaluate(() => window.liveChanges), 0, 'the progress is announced every second');
    assert.equal(await (await action('intranet site', 'Recreate')).isDisabled(), true);
    assert.equal(await (await action('portal site', 'Recreate')).isEnabled(), true);
    await expectNotice('did not answer within 3 seconds', true);
    assert.equal(await (await action('intranet site', 'Recreate')).isEnabled(), true);
    await page.unroute('**/*.CRT/1/recreate');
    await held.abort().catch(() => {});
    await page.goto(`https://127.0.0.1:${port}/`);
    await row('intranet site').waitFor();
  });
}

for (const [width, domain, field, says] of [[390, 'nas.example.org, *.example.org', '#l-domain-error', /wildcard name without DNS-01|not valid/],
                                            [1280, 'nas.example.org', '#le-error', /cannot be reached or used/]]) {
  test(`at ${width} px a lost connection clears on refresh; Let's Encrypt keeps its input and checks the names`, async () => {
    await at(width);
    await page.route('**/*.CRT/1/set', (r) => r.abort('connectionrefused'), {times: 1});
    await (await action('Vault', 'Make default')).click();
    await expectNotice('The server cannot be reached', true);
    await Promise.all([page.waitForResponse(/server\/events/), page.getByRole('button', {name: 'Refresh'}).click()]);
    await page.waitForFunction(() => !/cannot be reached/.test(document.querySelector('#notice').textContent),
                               null, {timeout: 5000});

    await page.getByRole('button', {name: 'Let\'s Encrypt…'}).click();
    const input = page.getByLabel('Domain names');
    assert.ok(await input.evaluate((n) => { new RegExp(`^(?:${n.pattern})$`, 'v'); return true; }));
    for (const [value, valid] of [['not a domain!', false], ['nas', false], ['-x.example.org', false],
                                  ['nas.example.org', true], ['nas.example.org, *.example.org', true]]) {
      await input.fill(value);
      assert.equal(await input.evaluate((n) => n.validity.valid), valid, value);
    }
    await input.fill(domain);
    await page.locator('#l-desc').fill('Public');
    await page.locator('#l-email').fill('admin@example.org');
    await axe('the Let\'s Encrypt dialog');
    await page.getByRole('button', {name: 'Request certificate'}).click();
    await page.locator(field).filter({hasText: says}).waitFor({timeout: 60000});
    assert.equal(await input.inputValue(), domain);
    await page.locator('#le-dialog').getByRole('button', {name: 'Close'}).click();
  });
}

const SETTINGS = [
  [390, () => page.locator('#ls-timeout_s').fill('0'), /"timeout_s" must be an integer from 1 to 3600/],
  [1280, async () => {
    await page.getByLabel('Challenge').selectOption('dns');
    await page.getByLabel('DNS provider').selectOption('cloudflare');
    await page.locator('#ls-env-CF_DNS_API_TOKEN').fill('token-kept-secret');
  }, null],
];
for (const [width, change, refusal] of SETTINGS) {
  test(`at ${width} px the Let's Encrypt settings ${refusal ? 'show a refusal at its field' : 'keep secrets as "is set"'}`, async () => {
    await at(width);
    const open = async () => {
      await page.getByRole('button', {name: 'Let\'s Encrypt settings…'}).click();
      await page.waitForFunction(() => document.querySelector('#ls-timeout_s').value !== '');
    };
    await open();
    assert.equal(await page.getByLabel('ACME server').inputValue(), 'custom');
    assert.equal(await page.getByLabel('Directory URL').inputValue(), 'https://127.0.0.1:9/directory');
    await change();
    await axe('the Let\'s Encrypt settings');
    await page.locator('#le-settings-dialog').getByRole('button', {name: 'Save'}).click();
    if (refusal) {
      await page.locator('#ls-timeout_s-error').filter({hasText: refusal}).waitFor();
      assert.equal(await page.locator('#ls-timeout_s').getAttribute('aria-invalid'), 'true');
    } else {
      await expectNotice('settings were saved');
      assert.match(fs.readFileSync(path.join(root, 'usr/zeph/etc/letsencrypt/config.json'), 'utf8'), /token-kept-secret/);
      await open();
      await page.locator('#ls-env-CF_DNS_API_TOKEN-state', {hasText: '(is set)'}).waitFor();
      assert.equal(await page.locator('#ls-env-CF_DNS_API_TOKEN').inputValue(), '');
      assert.doesNotMatch(await page.content(), /token-kept-secret/);
    }
    await page.locator('#le-settings-dialog').getByRole('button', {name: 'Close'}).click();
  });
}

for (const width of [390, 768, 1280, 1920]) {
  test(`at ${width} px nothing scrolls sideways, rows are ${width < 1024 ? 'cards with a menu' : 'a table'}, Reset stays in its card`, async () => {
    await at(width);
    const fits = () => page.evaluate(() => document.scrollingElement.scrollWidth <= innerWidth);
    assert.ok(await fits(), 'the page scrolls sideways');
    const card = await page.locator('#certs-card').boundingBox();
    const reset = await page.locator('#show-reset').boundingBox();
    assert.ok(reset.x >= card.x && reset.x + reset.width <= card.x + card.width, 'Reset leaves its card');
    assert.equal(await row('Shop').evaluate((r) => getComputedStyle(r).display), width < 1024 ? 'block' : 'table-row');
    assert.equal(await row('Shop').getByRole('button', {name: 'Delete Shop'}).isVisible(), width >= 1024);
    for (const opener of ['Create self-signed…', 'Import…', 'Signing requests…', 'Let\'s Encrypt settings…']) {
      await page.getByRole('button', {name: opener}).click();
      const box = await page.locator('dialog[open]').boundingBox();
      assert.ok(box.x >= 0 && box.x + box.width <= width && await fits(), `${opener} at ${width} px`);
      await page.keyboard.press('Escape');
    }
    if (width !== 768) await shot(`main-${width}`);
    await axe(`the main view at ${width} px`);
  });
}

for (const width of WIDTHS) {
  test(`at ${width} px keyboard focus is visible, stays inside a dialog and comes back`, async () => {
    await at(width);
    await page.locator('#refresh').focus();
    await page.keyboard.press('Tab');
    assert.deepEqual(await page.evaluate(() => {
      const s = getComputedStyle(document.activeElement);
      return [document.activeElement.id, s.outlineStyle, parseFloat(s.outlineWidth) >= 2];
    }), ['show-create', 'solid', true]);
    await page.keyboard.press('Enter');
    await page.locator('#create-dialog').getByRole('button', {name: 'Close'}).focus();
    for (const key of ['Tab', 'Shift+Tab', 'Shift+Tab']) {
      await page.keyboard.press(key);
      assert.ok(await page.evaluate(() => !!document.activeElement.closest('#create-dialog[open]')), `focus left after ${key}`);
    }
    await page.keyboard.press('Escape');
    assert.equal(await page.evaluate(() => document.activeElement.id), 'show-create');
    await (await action('Vault', 'Edit Vault')).click();
    await axe('the edit dialog');
    await page.keyboard.press('Escape');
  });
}

test('reset warns in a danger style, lists what goes and leaves one new default certificate', async () => {
  await at(1280);
  await page.getByRole('button', {name: 'Reset…'}).click();
  const dialog = page.locator('#confirm-dialog');
  assert.match(await dialog.locator('.moving').innerText(), /portal site.*Shop/s);
  assert.equal(await page.locator('#confirm-yes').evaluate((b) => getComputedStyle(b).backgroundColor), 'rgb(164, 14, 38)');
  await axe('the reset confirmation');
  await dialog.getByRole('button', {name: 'Reset'}).click();
  await expectNotice('The certificates were reset.');
  await page.waitForFunction(() => document.querySelectorAll('#certificates tbody tr').length === 1);
  assert.equal(await presentedCommonName(), 'arvelon');
});

test('the page kept to its content security policy and the server reported no sanitizer errors', () => {
  assert.deepEqual(policyErrors, []);
  // Only says something in a -DZEPH_SANITIZE=ON build (errors found while
  // running; leaks are reported at exit, after this).
  assert.doesNotMatch(serverOutput, /AddressSanitizer|runtime error:/);
});
