// The administration page in headless Chromium against a real zeph-webapid (and its nginx) on a private root.
// Environment: ZEPH_BIN_DIR (where zeph-webapid is), ZEPH_WEB_DIR (the page), ZEPH_SCREENSHOT_DIR (default: cwd).
import {test, before, after} from 'node:test';
import assert from 'node:assert/strict';
import {execFileSync, spawn} from 'node:child_process';
import fs from 'node:fs';
import os from 'node:os';
import path from 'node:path';
import tls from 'node:tls';
import {chromium} from 'playwright-core';

const here = import.meta.dirname;
const binDir = process.env.ZEPH_BIN_DIR || path.resolve(here, '../../build/bin');
const webDir = process.env.ZEPH_WEB_DIR || path.resolve(here, '..');
const shotDir = process.env.ZEPH_SCREENSHOT_DIR || process.cwd();
const WIDTHS = [390, 1280];

let tmp, root, mat, server, port, token, browser, page, serverOutput = '';
const policyErrors = [];

function startServer() {
  return new Promise((resolve, reject) => {
    const child = spawn(path.join(binDir, 'zeph-webapid'), ['--root', root, '--listen', '127.0.0.1:0', '--web', webDir],
                        {stdio: ['ignore', 'ignore', 'pipe']});
    child.stderr.on('data', (chunk) => {
      const m = /listening on https:\/\/127\.0\.0\.1:(\d+)/.exec(serverOutput += chunk);
      if (m && !port) { port = +m[1]; resolve(child); }
    });
    child.on('exit', (code) => { if (!port) reject(new Error(`zeph-webapid ended (${code}):\n${serverOutput}`)); });
  });
}

function presentedCommonName() {
  return new Promise((resolve, reject) => {
    const socket = tls.connect({host: '127.0.0.1', port, rejectUnauthorized: false},
                               () => { resolve(socket.getPeerCertificate().subject.CN); socket.end(); });
    socket.on('error', reject);
  });
}

const run = (cmd, args, opts) => execFileSync(cmd, args, {encoding: 'utf8', stdio: 'pipe', ...opts});
const openssl = (...args) => run('/usr/bin/openssl', args, {cwd: mat});
const etc = (...parts) => path.join(root, 'usr/zeph/etc', ...parts);
const row = (text) => page.locator('#certificates tbody tr', {hasText: text});
const dlg = (id) => page.locator(`#${id}-dialog`);
const button = (name, scope = page) => scope.getByRole('button', {name});
const click = (name, scope) => button(name, scope).click();
const at = (width) => page.setViewportSize({width, height: 900});
const testAt = (width, title, body) => test(`at ${width} px ${title}`, async () => { await at(width); await body(); });
const fill = async (prefix, values) => {
  for (const [field, value] of Object.entries(values)) await page.locator(`#${prefix}-${field}`).fill(value);
};
const choose = async (select, text) =>
  select.selectOption(await select.locator('option', {hasText: text}).getAttribute('value'));
const dangerColour = () => page.locator('#confirm-yes').evaluate((b) => getComputedStyle(b).backgroundColor);
const signIn = async (withToken) => { await page.getByLabel('Access token').fill(withToken); await click('Sign in'); };

async function shot(name) {
  fs.mkdirSync(shotDir, {recursive: true});
  await page.screenshot({path: path.join(shotDir, `web-${name}.png`), fullPage: true});
}

// Waits for the notice line to say `text` (a string or RegExp); a timeout names what it said instead.
async function expectNotice(text, bad) {
  await page.locator(bad ? '#notice.bad' : '#notice', {hasText: text}).waitFor({timeout: 60000}).catch(async () => {
    await shot('failure');
    throw new Error(`notice "${await page.locator('#notice').innerText()}", expected ${text}`);
  });
}

// A row's action button, out of its menu where the width folds the actions into one.
async function action(rowText, name) {
  const toggle = row(rowText).locator('.menu-toggle');
  if (await toggle.isVisible() && await toggle.getAttribute('aria-expanded') !== 'true') await toggle.click();
  return button(name, row(rowText));
}

// axe-core's scan of what is on screen: nothing serious or critical, and rules that did run.
async function axe(what) {
  const result = await page.evaluate(async () => {
    const r = await window.axe.run(document, {resultTypes: ['violations', 'passes']});
    return {passes: r.passes.length, bad: r.violations.filter((v) => ['serious', 'critical'].includes(v.impact))
      .map((v) => `${v.id}: ${v.nodes.map((n) => n.target.join(' ')).join(', ')}`)};
  });
  assert.ok(result.passes > 10, `axe checked nothing in ${what}`);
  assert.deepEqual(result.bad, [], `axe in ${what}`);
}

async function downloaded(button) {
  const [file] = await Promise.all([page.waitForEvent('download'), button.click()]);
  const saved = path.join(fs.mkdtempSync(path.join(tmp, 'dl-')), file.suggestedFilename());
  return file.saveAs(saved).then(() => saved);
}

function unzip(zip) {
  run('/usr/bin/7z', ['x', `-o${zip}.d`, zip]);
  return (name) => run('/usr/bin/find', [`${zip}.d`, '-name', name]).trim();
}

// What an administrator brings: a chain whose leaf runs out in 20 days, an expired set, a PKCS#12 file, junk.
function makeMaterial() {
  const put = (name, text) => fs.writeFileSync(path.join(mat, name), text);
  put('ca.ext', 'basicConstraints=critical,CA:TRUE\nkeyUsage=keyCertSign,cRLSign\n');
  for (const name of ['shop', 'vault']) put(`${name}.ext`, `subjectAltName=DNS:${name}.example\n`);
  const ec = ['-newkey', 'ec', '-pkeyopt', 'ec_paramgen_curve:P-256', '-nodes'];
  const req = (name, cn) => openssl('req', ...ec, '-keyout', `${name}.key`, '-out', `${name}.csr`, '-subj', `/CN=${cn}`);
  openssl('req', '-x509', ...ec, '-keyout', 'root.key', '-out', 'root.pem', '-days', '30', '-subj', '/CN=Test Root');
  for (const [name, cn, ca, days, ext] of [['inter', 'Test Intermediate', 'root', 30, 'ca.ext'],
                                          ['leaf', 'shop.example', 'inter', 20, 'shop.ext'],
                                          ['vault', 'vault.example', 'root', 90, 'vault.ext']]) {
    req(name, cn);
    openssl('x509', '-req', '-in', `${name}.csr`, '-CA', `${ca}.pem`, '-CAkey', `${ca}.key`, '-CAcreateserial',
            '-days', String(days), '-extfile', ext, '-out', `${name}.pem`);
  }
  openssl('pkcs12', '-export', '-inkey', 'vault.key', '-in', 'vault.pem', '-passout', 'pass:s3cret', '-out', 'vault.p12');
  put('ca.cnf', '[ca]\ndefault_ca=d\n[d]\ndatabase=index.txt\nnew_certs_dir=.\n' +
      'serial=serial\ndefault_md=sha256\npolicy=p\n[p]\ncommonName=supplied\n');
  put('index.txt', ''); put('serial', '01\n');
  req('old', 'old.example');
  openssl('ca', '-batch', '-config', 'ca.cnf', '-selfsign', '-keyfile', 'old.key', '-in', 'old.csr', '-notext',
          '-startdate', '20200101000000Z', '-enddate', '20200201000000Z', '-out', 'old.pem');
  req('ext', 'printer.example');
  put('junk.pem', 'these are not the bytes of a certificate\n');
}

before(async () => {
  tmp = fs.mkdtempSync(path.join(os.tmpdir(), 'zeph-web-'));
  fs.chmodSync(tmp, 0o755); // started as root, the server's nginx workers (www-data) must reach its run directory
  root = path.join(tmp, 'root');
  mat = fs.mkdtempSync(path.join(tmp, 'material-'));
  makeMaterial();
  // A second service beside the web administration, and an ACME server nobody answers at.
  run(path.join(binDir, 'zephcert'), ['--root', root, 'init']);
  const services = JSON.parse(fs.readFileSync(etc('certificate/_archive/SERVICES'), 'utf8'));
  services.push({...services[0], display_name: 'File sharing', display_name_i18n: undefined, subscriber: 'smb',
                 service: 'default'});
  fs.writeFileSync(etc('certificate/_archive/SERVICES'), JSON.stringify(services));
  fs.writeFileSync(etc('letsencrypt/config.json'),
                   JSON.stringify({directory_url: 'https://127.0.0.1:9/directory', timeout_s: 10}));
  server = await startServer();
  token = fs.readFileSync(etc('webapid/token'), 'utf8').trim();
  browser = await chromium.launch({executablePath: process.env.ZEPH_CHROMIUM || '/usr/bin/chromium',
    args: ['--no-sandbox', '--disable-gpu', '--disable-quic', '--no-first-run', '--disable-background-networking',
           '--disable-component-update', '--disable-sync']});
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
  await signIn('0'.repeat(64));
  await page.locator('#sign-in-error', {hasText: 'The token was not accepted'}).waitFor();
  assert.equal(await page.locator('#app-view').isHidden(), true);
  await signIn(token);
  await row('arvelon').waitFor();
  assert.equal(await page.evaluate(() => document.activeElement.tagName), 'H1');
  await page.reload();
  await row('arvelon').waitFor();
  assert.match(await page.locator('#events').innerText(), /made the default certificate/);
});

for (const [width, name, keyType] of [[390, 'portal', 'EC P-256'], [1280, 'intranet', 'EC P-384']])
  testAt(width, 'the create dialog keeps its input through a refusal and a lost sign-in', async () => {
    await click('Create self-signed…');
    await fill('c', {desc: `${name} site`, common_name: name, alias: `${name}.local`, ca_common_name: `${name} CA`});
    for (const field of ['key_type', 'ca_key_type']) await page.locator(`#c-${field}`).selectOption({label: keyType});
    await axe('the create dialog');
    const refuse = (status, error) =>
      page.route('**/*.CRT/1/create', (r) => r.fulfill({status, json: {success: false, error}}), {times: 1});
    await refuse(200, {code: 5503, data: null});
    await click('Create', dlg('create'));
    await page.locator('#create-error', {hasText: 'missing or not valid'}).waitFor();
    assert.equal(await page.locator('#c-common_name').inputValue(), name);
    // A token refused midway brings the sign-in back, then the dialog as it was.
    await refuse(401, {code: 401, data: {message: 'no token'}});
    await click('Create', dlg('create'));
    await page.locator('#sign-in-error', {hasText: 'not accepted'}).waitFor();
    await signIn(token);
    await dlg('create').waitFor();
    assert.equal(await page.locator('#c-ca_common_name').inputValue(), `${name} CA`);
    assert.equal(await page.locator('#c-key_type option:checked').innerText(), keyType);
    await click('Create', dlg('create'));
    await row(`${name} site`).waitFor({timeout: 120000});
    assert.match(await row(`${name} site`).locator('.key').innerText(), /^EC/);
  });

// Each attempt at its width; a refusal names the field and keeps the dialog.
const IMPORTS = [
  [390, 'Junk', {cert: 'junk.pem', key: 'leaf.key'}, '', '#i-cert', /holds no certificate/],
  [390, 'Vault', {pkcs12: 'vault.p12'}, '', '#i-passphrase', /needs a passphrase/],
  [390, 'Vault', {pkcs12: 'vault.p12'}, 'wrong', '#i-passphrase', /does not open/],
  [390, 'Vault', {pkcs12: 'vault.p12'}, 's3cret', null, /imported\.\s*Warning: .*vault\.example/],
  [1280, 'Shop', {key: 'inter.key', cert: 'leaf.pem'}, '', '#i-key', /does not belong to the certificate/],
  [1280, 'Shop', {key: 'leaf.key', cert: 'leaf.pem', inter: 'inter.pem'}, '', null, /Shop was imported/],
  [1280, 'Legacy box', {key: 'old.key', cert: 'old.pem'}, '', null, /Warning: the certificate expired/],
];
for (const [width, desc, files, passphrase, field, expect] of IMPORTS)
  testAt(width, `importing ${desc} from ${Object.values(files).join(', ')} says ${expect.source}`, async () => {
    if (!await dlg('import').isVisible()) await click('Import…');
    await page.locator('#i-desc').fill(desc);
    for (const part of ['key', 'cert', 'inter', 'pkcs12'])
      await page.locator(`#i-${part}`).setInputFiles(files[part] ? path.join(mat, files[part]) : []);
    await page.locator('#i-passphrase').fill(passphrase);
    await click('Import', dlg('import'));
    if (!field) { await expectNotice(expect); return row(desc).waitFor(); }
    await page.locator(`${field}-error`).filter({hasText: expect}).waitFor();
    assert.equal(await page.locator(field).getAttribute('aria-invalid'), 'true');
    assert.equal(await page.locator('#i-desc').inputValue(), desc);
    await axe('the import dialog with a refusal');
  });

for (const [width, service, target, cn] of [[390, 'File sharing', 'Shop', null],
                                            [1280, 'Web administration', 'portal site', 'portal']])
  testAt(width, `${service} is bound only through Apply and a confirmation`, async () => {
    let sets = 0;
    page.on('request', (r) => { if (r.url().includes('Certificate.Service/1/set')) sets++; });
    const select = page.getByLabel(service, {exact: true});
    const apply = async (text) => { await choose(select, text); await click(`Apply to ${service}`); };
    await select.focus();
    await page.keyboard.press('ArrowDown');
    await choose(select, target);
    assert.match(await select.locator('option:checked').innerText(), /— expires \d{4}-\d\d-\d\d, \d+ days left$/);
    await Promise.all([page.waitForResponse(/CRT\/1\/list/), click('Refresh')]);
    assert.equal(sets, 0, 'choosing deployed at once');
    // An expired certificate is bound only past a warning.
    await apply('Legacy box');
    assert.match(await dlg('confirm').innerText(), /Legacy box \(old\.example\) has expired/);
    await click('Cancel', dlg('confirm'));
    await apply(target);
    const text = await dlg('confirm').innerText();
    assert.match(text, new RegExp(`${service} will use ${target}`));
    assert.equal(/certificate of this very page is swapped/.test(text), service === 'Web administration');
    await axe('the binding confirmation');
    await click('Bind', dlg('confirm'));
    await expectNotice(cn ? 'Reconnected' : `${service} now uses ${target}`);
    assert.equal(sets, 1);
    assert.match(await row(target).locator('.services').innerText(), new RegExp(service));
    if (cn) assert.equal(await presentedCommonName(), cn);
  });

for (const width of WIDTHS)
  testAt(width, 'the expiry summary, the server\'s warnings and both sort orders show', async () => {
    // The daily renewal run warns of certificates in use that run out.
    try { run(path.join(binDir, 'zeph-letsencrypt'), ['renew-due'], {env: {...process.env, ZEPH_ROOT: root}}); } catch {}
    await click('Refresh');
    await page.locator('#server-warnings', {hasText: /shop\.example.* expires in \d+ days .*File sharing uses it/}).waitFor();
    assert.equal(await page.locator('#expiry-summary').innerText(), '1 expired, 1 expires within 30 days');
    const labels = () => page.locator('#certificates tbody tr .subject')
      .evaluateAll((cells) => cells.map((c) => c.firstChild.textContent));
    await page.getByLabel('Sort by').selectOption('expiry');
    assert.deepEqual((await labels()).slice(0, 2), ['old.example', 'shop.example']);
    await page.getByLabel('Sort by').selectOption('name');
    assert.deepEqual(await labels(), ['arvelon', 'intranet', 'old.example', 'portal', 'shop.example', 'vault.example']);
    await (await action('Legacy box', 'Make default')).click();
    assert.match(await dlg('confirm').innerText(), /Legacy box \(old\.example\) has expired/);
    await click('Cancel', dlg('confirm'));
    assert.doesNotMatch(await row('Legacy box').locator('.desc').innerText(), /default/);
  });

// Recreate for the appliance's own self-signed sets only, New request or Let's Encrypt renewal for the others.
const OFFERS = [
  ['portal site', 'Recreate', /signed again by its own authority portal CA/, ['New request for', 'Renew']],
  ['Shop', 'New request for', /Shop \(shop\.example\) itself does not change.*import its certificate/s, ['Recreate', 'Renew']],
  ['Vault', 'Renew', /asks the ACME server .*If the request fails, the current certificate stays/s, ['Recreate']],
];
for (const width of WIDTHS)
  testAt(width, 'rows offer what fits the set, named after it, and signing lists only own authorities', async () => {
    fs.writeFileSync(etc('certificate/_archive', await row('Vault').getAttribute('data-id'), 'renew.json'), '{}');
    await click('Refresh');
    await page.locator('#certificates .badge.renew').waitFor();
    for (const [label, offered, says, absent] of OFFERS) {
      for (const name of absent) assert.equal(await (await action(label, name)).count(), 0, `${name} for ${label}`);
      await (await action(label, offered)).click();
      assert.match(await dlg('confirm').innerText(), says);
      await click('Cancel', dlg('confirm'));
      // Focus returns to what opened the dialog: the button, or the menu it is folded in.
      await page.waitForFunction((id) => document.activeElement.closest('tr')?.dataset.id === id,
                                 await row(label).getAttribute('data-id'), {timeout: 5000});
    }
    await (await action('Shop', 'Delete Shop (shop.example)')).click();
    assert.equal(await dangerColour(), 'rgb(164, 14, 38)');
    await axe('the delete confirmation');
    await click('Cancel', dlg('confirm'));
    await click('Signing requests…');
    assert.deepEqual(await page.locator('#s-id option').evaluateAll((o) => o.map((n) => n.textContent.split(' — ')[0])),
                     ['arvelon', 'intranet site (intranet)', 'portal site (portal)']);
    await axe('the requests dialog');
    await click('Close', dlg('csr'));
  });

// Every file handed out is named after what is in it and says what it holds.
const DOWNLOADS = [
  [390, 'a zip export', async () => {
    await (await action('Shop', 'Export Shop')).click();
    assert.match(await dlg('export').innerText(), /holds the private key of Shop.*Keep it safe/s);
    await axe('the export dialog');
    return button('Download', dlg('export'));
  }, 'shop.example.zip', /private key is inside: keep the file safe/, (get) => assert.ok(get('privkey.pem'))],
  [1280, 'a PKCS#12 export', async () => {
    await (await action('portal site', 'Export')).click();
    await page.getByLabel('PKCS#12 file (.p12)').check();
    await click('Download');
    await page.locator('#x-passphrase-error', {hasText: 'Give a passphrase'}).waitFor();
    await page.locator('#x-passphrase').fill('s3cret');
    return button('Download');
  }, 'portal.p12', /private key is inside/, null,
  (file) => assert.match(openssl('pkcs12', '-in', file, '-passin', 'pass:s3cret', '-nokeys'), /subject=CN = portal/)],
  [390, 'a new request', async () => {
    await click('Signing requests…');
    await fill('r', {common_name: 'mail.example', organization: 'Example', department: 'Mail', city: 'Delft',
                     state: 'ZH', country: 'NL', email: 'pm@mail.example'});
    await page.locator('#r-key_type').selectOption({label: 'EC P-384'});
    return button('Create request');
  }, 'mail.example-request.zip', /key and request for mail\.example were downloaded/,
  (get) => assert.match(openssl('pkey', '-in', get('server.key'), '-noout', '-text'), /NIST CURVE: P-384/)],
  [1280, 'a request for an imported set', async () => {
    await (await action('Shop', 'New request for')).click();
    return button('Make request', dlg('confirm'));
  }, 'shop.example-request.zip', /key and request for Shop \(shop\.example\) were downloaded/,
  (get) => assert.match(openssl('req', '-in', get('server.csr'), '-noout', '-subject'), /CN = shop\.example/)],
  [390, 'a signed request', async () => {
    await click('Signing requests…');
    await page.locator('#s-csr').setInputFiles(path.join(mat, 'ext.csr'));
    await page.locator('#s-id').selectOption({index: 2});
    return button('Sign and download');
  }, 'ext-signed.zip', /signed certificate was downloaded/,
  (get) => assert.match(openssl('x509', '-in', get('server.crt'), '-noout', '-issuer'), /portal CA/)],
];
for (const [width, what, open, name, says, inZip, check] of DOWNLOADS)
  testAt(width, `${what} downloads as ${name}`, async () => {
    const file = await downloaded(await open());
    assert.equal(path.basename(file), name);
    await expectNotice(says);
    if (inZip) inZip(unzip(file));
    if (check) check(file);
  });

for (const width of WIDTHS)
  testAt(width, 'a stuck recreate locks its certificate, is told once and given up after its bound', async () => {
    const visit = async (q) => { await page.goto(`https://127.0.0.1:${port}/${q}`); await row('intranet site').waitFor(); };
    await visit('?long-timeout-ms=3000');
    let held;
    await page.route('**/*.CRT/1/recreate', (r) => { held = r; });
    await (await action('intranet site', 'Recreate')).click();
    await click('Recreate', dlg('confirm'));
    await page.locator('#progress', {hasText: 'Recreating intranet site'}).waitFor();
    await page.evaluate(() => {
      window.liveChanges = 0;
      const watch = new MutationObserver((m) => { window.liveChanges += m.length; });
      for (const n of document.querySelectorAll('[aria-live], [role=status], [role=alert]'))
        watch.observe(n, {childList: true, subtree: true, characterData: true});
    });
    await page.locator('#progress', {hasText: /[1-9] s/}).waitFor();
    assert.equal(await page.evaluate(() => window.liveChanges), 0, 'the progress is announced every second');
    assert.equal(await (await action('intranet site', 'Recreate')).isDisabled(), true);
    assert.equal(await (await action('portal site', 'Recreate')).isEnabled(), true);
    await expectNotice('did not answer within 3 seconds', true);
    assert.equal(await (await action('intranet site', 'Recreate')).isEnabled(), true);
    await page.unroute('**/*.CRT/1/recreate');
    await held.abort().catch(() => {});
    await visit('');
  });

for (const [width, domain, field, says] of [[390, 'nas.example.org, *.example.org', '#l-domain-error',
                                             /wildcard name without DNS-01|not valid/],
                                            [1280, 'nas.example.org', '#le-error', /cannot be reached or used/]])
  testAt(width, 'a lost connection clears on refresh; Let\'s Encrypt keeps its input and checks the names', async () => {
    await page.route('**/*.CRT/1/set', (r) => r.abort('connectionrefused'), {times: 1});
    await (await action('Vault', 'Make default')).click();
    await expectNotice('The server cannot be reached', true);
    await Promise.all([page.waitForResponse(/server\/events/), click('Refresh')]);
    await page.waitForFunction(() => !/cannot be reached/.test(document.querySelector('#notice').textContent),
                               null, {timeout: 5000});
    await click('Let\'s Encrypt…');
    const input = page.getByLabel('Domain names');
    assert.ok(await input.evaluate((n) => { new RegExp(`^(?:${n.pattern})$`, 'v'); return true; }));
    for (const [value, valid] of [['not a domain!', false], ['nas', false], ['-x.example.org', false],
                                  ['nas.example.org', true], ['nas.example.org, *.example.org', true]]) {
      await input.fill(value);
      assert.equal(await input.evaluate((n) => n.validity.valid), valid, value);
    }
    await input.fill(domain);
    await fill('l', {desc: 'Public', email: 'admin@example.org'});
    await axe('the Let\'s Encrypt dialog');
    await click('Request certificate');
    await page.locator(field).filter({hasText: says}).waitFor({timeout: 60000});
    assert.equal(await input.inputValue(), domain);
    await click('Close', dlg('le'));
  });

const SETTINGS = [
  [390, () => page.locator('#ls-timeout_s').fill('0'), /"timeout_s" must be an integer from 1 to 3600/],
  [1280, async () => {
    await page.getByLabel('Challenge').selectOption('dns');
    await page.getByLabel('DNS provider').selectOption('cloudflare');
    await page.locator('#ls-env-CF_DNS_API_TOKEN').fill('token-kept-secret');
  }, null],
];
for (const [width, change, refusal] of SETTINGS)
  testAt(width, `the Let's Encrypt settings ${refusal ? 'show a refusal at its field' : 'keep secrets as "is set"'}`, async () => {
    const open = async () => {
      await click('Let\'s Encrypt settings…');
      await page.waitForFunction(() => document.querySelector('#ls-timeout_s').value !== '');
    };
    await open();
    assert.equal(await page.getByLabel('ACME server').inputValue(), 'custom');
    assert.equal(await page.getByLabel('Directory URL').inputValue(), 'https://127.0.0.1:9/directory');
    await change();
    await axe('the Let\'s Encrypt settings');
    await click('Save', dlg('le-settings'));
    if (refusal) {
      await page.locator('#ls-timeout_s-error').filter({hasText: refusal}).waitFor();
      assert.equal(await page.locator('#ls-timeout_s').getAttribute('aria-invalid'), 'true');
    } else {
      await expectNotice('settings were saved');
      assert.match(fs.readFileSync(etc('letsencrypt/config.json'), 'utf8'), /token-kept-secret/);
      await open();
      await page.locator('#ls-env-CF_DNS_API_TOKEN-state', {hasText: '(is set)'}).waitFor();
      assert.equal(await page.locator('#ls-env-CF_DNS_API_TOKEN').inputValue(), '');
      assert.doesNotMatch(await page.content(), /token-kept-secret/);
    }
    await click('Close', dlg('le-settings'));
  });

for (const width of [390, 768, 1280, 1920])
  testAt(width, `nothing scrolls sideways, rows are ${width < 1024 ? 'cards with a menu' : 'a table'}, Reset stays in its card`, async () => {
    const fits = () => page.evaluate(() => document.scrollingElement.scrollWidth <= innerWidth);
    assert.ok(await fits(), 'the page scrolls sideways');
    const [card, reset] = await Promise.all(['#certs-card', '#show-reset'].map((s) => page.locator(s).boundingBox()));
    assert.ok(reset.x >= card.x && reset.x + reset.width <= card.x + card.width, 'Reset leaves its card');
    assert.equal(await row('Shop').evaluate((r) => getComputedStyle(r).display), width < 1024 ? 'block' : 'table-row');
    assert.equal(await button('Delete Shop', row('Shop')).isVisible(), width >= 1024);
    for (const opener of ['Create self-signed…', 'Import…', 'Signing requests…', 'Let\'s Encrypt settings…']) {
      await click(opener);
      const box = await page.locator('dialog[open]').boundingBox();
      assert.ok(box.x >= 0 && box.x + box.width <= width && await fits(), `${opener} at ${width} px`);
      await page.keyboard.press('Escape');
    }
    if (width !== 768) await shot(`main-${width}`);
    await axe(`the main view at ${width} px`);
  });

for (const width of WIDTHS)
  testAt(width, 'keyboard focus is visible, stays inside a dialog and comes back', async () => {
    await page.locator('#refresh').focus();
    await page.keyboard.press('Tab');
    assert.deepEqual(await page.evaluate(() => {
      const s = getComputedStyle(document.activeElement);
      return [document.activeElement.id, s.outlineStyle, parseFloat(s.outlineWidth) >= 2];
    }), ['show-create', 'solid', true]);
    await page.keyboard.press('Enter');
    await button('Close', dlg('create')).focus();
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

testAt(1280, 'reset warns in a danger style, lists what goes and leaves one new default certificate', async () => {
  await click('Reset…');
  assert.match(await dlg('confirm').locator('.moving').innerText(), /portal site.*Shop/s);
  assert.equal(await dangerColour(), 'rgb(164, 14, 38)');
  await axe('the reset confirmation');
  await click('Reset', dlg('confirm'));
  await expectNotice('The certificates were reset.');
  await page.waitForFunction(() => document.querySelectorAll('#certificates tbody tr').length === 1);
  assert.equal(await presentedCommonName(), 'arvelon');
});

test('the page kept to its content security policy and the server reported no sanitizer errors', () => {
  assert.deepEqual(policyErrors, []);
  // Only says something in a -DZEPH_SANITIZE=ON build (leaks are reported at exit, after this).
  assert.doesNotMatch(serverOutput, /AddressSanitizer|runtime error:/);
});
