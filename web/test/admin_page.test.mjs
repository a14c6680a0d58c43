// The administration page in headless Chromium against a real zeph-webapid
// (and the nginx it runs in front of it) on a private root.
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

let tmp, root, server, port, token, browser, page;
let serverOutput = '';

function startServer() {
  return new Promise((resolve, reject) => {
    const child = spawn(path.join(binDir, 'zeph-webapid'),
                        ['--root', root, '--listen', '127.0.0.1:0', '--web', webDir],
                        {stdio: ['ignore', 'ignore', 'pipe']});
    let output = '';
    child.stderr.on('data', (chunk) => {
      output += chunk;
      serverOutput += chunk;
      const m = /listening on https:\/\/127\.0\.0\.1:(\d+)/.exec(output);
      if (m && !port) { port = +m[1]; resolve(child); }
    });
    child.on('exit', (code) => { if (!port) reject(new Error(`zeph-webapid ended (${code}):\n${output}`)); });
  });
}

// The common name of the certificate the server presents to a new connection.
function presentedCommonName() {
  return new Promise((resolve, reject) => {
    const socket = tls.connect({host: '127.0.0.1', port, rejectUnauthorized: false}, () => {
      const cert = socket.getPeerCertificate();
      socket.end();
      resolve(cert.subject.CN);
    });
    socket.on('error', reject);
  });
}

function archiveDir(id) { return path.join(root, 'usr/zeph/etc/certificate/_archive', id); }

async function shot(name) {
  fs.mkdirSync(shotDir, {recursive: true});
  await page.screenshot({path: path.join(shotDir, `web-${name}.png`), fullPage: true});
}

// Waits for the notice line to say `text`; a timeout names what it said instead.
async function expectNotice(text, bad) {
  try {
    await page.locator(bad ? '#notice.bad' : '#notice', {hasText: text}).waitFor({timeout: 60000});
  } catch (e) {
    await shot('failure');
    throw new Error(`notice "${await page.locator('#notice').innerText()}", expected "${text}"`);
  }
}

const row = (text) => page.locator('#certificates tbody tr', {hasText: text});

async function createCertificate(desc, commonName) {
  await page.getByRole('button', {name: 'Create self-signed…'}).click();
  const dialog = page.locator('#create-dialog');
  await dialog.getByLabel('Description').fill(desc);
  await dialog.getByLabel('Common name (host name)').fill(commonName);
  await dialog.getByLabel('Alternative names').fill(`${commonName}.local, 10.0.0.7`);
  await dialog.getByLabel('Country (two letters)').first().fill('DE');
  await page.locator('#c-key_length').selectOption('2048');
  await page.locator('#c-ca_common_name').fill(`${commonName} CA`);
  await page.locator('#c-ca_key_length').selectOption('2048');
  await dialog.getByRole('button', {name: 'Create'}).click();
  // While the keys are made the progress line runs and the table still answers.
  await row(desc).waitFor({timeout: 120000});
}

before(async () => {
  tmp = fs.mkdtempSync(path.join(os.tmpdir(), 'zeph-web-'));
  // Started as root, the server's nginx workers run as www-data and must
  // reach its run directory below the root.
  fs.chmodSync(tmp, 0o755);
  root = path.join(tmp, 'root');
  server = await startServer();
  token = fs.readFileSync(path.join(root, 'usr/zeph/etc/webapid/token'), 'utf8').trim();
  browser = await chromium.launch({
    executablePath: process.env.ZEPH_CHROMIUM || '/usr/bin/chromium',
    args: ['--no-sandbox', '--disable-gpu', '--disable-quic', '--no-first-run',
           '--disable-background-networking', '--disable-component-update', '--disable-sync'],
  });
  const context = await browser.newContext({ignoreHTTPSErrors: true, viewport: {width: 1280, height: 900}});
  page = await context.newPage();
  await page.goto(`https://127.0.0.1:${port}/`);
});

after(async () => {
  if (browser) await browser.close();
  if (server) server.kill('SIGTERM');
  if (tmp) fs.rmSync(tmp, {recursive: true, force: true});
});

test('a wrong token is refused with a sentence, the right one shows the default certificate', async () => {
  await page.getByLabel('Access token').fill('0'.repeat(64));
  await page.getByRole('button', {name: 'Sign in'}).click();
  await assert.doesNotReject(page.locator('#sign-in-error', {hasText: 'The token was not accepted'}).waitFor());
  assert.equal(await page.locator('#app-view').isHidden(), true);

  await page.getByLabel('Access token').fill(token);
  await page.getByRole('button', {name: 'Sign in'}).click();
  const first = row('arvelon');
  await first.waitFor();
  assert.match(await first.locator('.desc').innerText(), /default/);
  assert.match(await first.locator('.services').innerText(), /Web administration/);
  assert.match(await first.locator('.days').innerText(), /\d+ days left/);
  assert.match(await page.locator('#events').innerText(), /made the default certificate/);
  // The token lives in the tab's session: a reload stays signed in.
  await page.reload();
  await row('arvelon').waitFor();
  await shot('signed-in');
});

test('a created certificate is listed, becomes the default and serves the page', async () => {
  await createCertificate('Office portal', 'portal');
  const created = row('Office portal');
  assert.match(await created.locator('.subject').innerText(), /portal/);
  assert.match(await created.locator('.issuer').innerText(), /portal CA/);
  assert.match(await created.locator('.san').innerText(), /portal\.local, 10\.0\.0\.7, portal/);

  await created.getByRole('button', {name: 'Make default'}).click();
  await expectNotice('is now the default certificate');
  assert.match(await row('Office portal').locator('.desc').innerText(), /default/);
  assert.doesNotMatch(await row('arvelon').locator('.desc').innerText(), /default/);

  await page.getByLabel('Web administration').selectOption({label: 'Office portal (portal)'});
  await expectNotice('now uses the new certificate');
  await expectNotice('Reconnected');
  assert.equal(await presentedCommonName(), 'portal');
  assert.match(await row('Office portal').locator('.services').innerText(), /Web administration/);
  assert.match(await page.locator('#events').innerText(), /portal/);
  await shot('bound');
});

test('deleting a certificate asks first and moves its services to the default', async () => {
  await createCertificate('Short lived', 'temp');
  await page.getByLabel('Web administration').selectOption({label: 'Short lived (temp)'});
  await expectNotice('Reconnected');
  assert.equal(await presentedCommonName(), 'temp');

  await row('Short lived').getByRole('button', {name: 'Delete'}).click();
  const dialog = page.locator('#confirm-dialog');
  assert.match(await dialog.innerText(), /These services will move to the default certificate \(Office portal/);
  assert.match(await dialog.locator('.moving').innerText(), /Web administration/);
  await page.getByRole('button', {name: 'Cancel'}).last().click();
  assert.equal(await row('Short lived').count(), 1);

  await row('Short lived').getByRole('button', {name: 'Delete'}).click();
  await dialog.getByRole('button', {name: 'Delete'}).click();
  await expectNotice('was deleted');
  await page.waitForFunction(() => !document.querySelector('#certificates').innerText.includes('Short lived'));
  assert.match(await row('Office portal').locator('.services').innerText(), /Web administration/);
  assert.equal(await presentedCommonName(), 'portal');
  await shot('deleted');
});

test('a failing action is shown as a sentence', async () => {
  // The certificate disappears behind the page's back: the module refuses
  // to make it the default.
  const id = await row('arvelon').getAttribute('data-id');
  fs.rmSync(archiveDir(id), {recursive: true, force: true});
  await row('arvelon').getByRole('button', {name: 'Make default'}).click();
  await expectNotice('The certificate manager could not complete the action.', true);
  await shot('error');
});

// A key, its certificate and the intermediate that issued it, made by openssl.
function makeChain(dir) {
  const run = (...args) => execFileSync('/usr/bin/openssl', args, {cwd: dir, stdio: 'pipe'});
  run('req', '-x509', '-newkey', 'rsa:2048', '-nodes', '-keyout', 'root.key', '-out', 'root.pem',
      '-days', '30', '-subj', '/CN=Test Root');
  fs.writeFileSync(path.join(dir, 'ca.ext'), 'basicConstraints=critical,CA:TRUE\nkeyUsage=keyCertSign,cRLSign\n');
  run('req', '-newkey', 'rsa:2048', '-nodes', '-keyout', 'inter.key', '-out', 'inter.csr', '-subj', '/CN=Test Intermediate');
  run('x509', '-req', '-in', 'inter.csr', '-CA', 'root.pem', '-CAkey', 'root.key', '-CAcreateserial',
      '-days', '30', '-extfile', 'ca.ext', '-out', 'inter.pem');
  fs.writeFileSync(path.join(dir, 'leaf.ext'), 'subjectAltName=DNS:shop.example\n');
  run('req', '-newkey', 'rsa:2048', '-nodes', '-keyout', 'leaf.key', '-out', 'leaf.csr', '-subj', '/CN=shop.example');
  run('x509', '-req', '-in', 'leaf.csr', '-CA', 'inter.pem', '-CAkey', 'inter.key', '-CAcreateserial',
      '-days', '20', '-extfile', 'leaf.ext', '-out', 'leaf.pem');
}

test('an imported certificate with its intermediate is listed and exports as a zip', async () => {
  const dir = fs.mkdtempSync(path.join(tmp, 'chain-'));
  makeChain(dir);
  await page.getByRole('button', {name: 'Import…'}).click();
  const dialog = page.locator('#import-dialog');
  await dialog.getByLabel('Description').fill('Shop');
  await dialog.getByLabel('Private key (PEM)').setInputFiles(path.join(dir, 'leaf.key'));
  await dialog.getByLabel('Certificate (PEM)').setInputFiles(path.join(dir, 'leaf.pem'));
  await dialog.getByLabel('Intermediate certificates (PEM, optional)').setInputFiles(path.join(dir, 'inter.pem'));
  await dialog.getByRole('button', {name: 'Import'}).click();
  await expectNotice('was imported');
  const shop = row('Shop');
  assert.match(await shop.locator('.issuer').innerText(), /Test Intermediate/);
  // Valid for 20 days: highlighted as running out.
  assert.equal(await shop.locator('.validity').getAttribute('class'), 'validity expiring');
  assert.match(await shop.locator('.days').innerText(), /^(19|20) days left$/);

  const [file] = await Promise.all([page.waitForEvent('download'),
                                    shop.getByRole('button', {name: 'Export'}).click()]);
  const zip = path.join(dir, 'export.zip');
  await file.saveAs(zip);
  const listing = execFileSync('/usr/bin/7z', ['l', '-slt', zip], {encoding: 'utf8'});
  const names = [...listing.matchAll(/^Path = (.+)$/gm)].map((m) => path.basename(m[1])).slice(1);
  for (const name of ['privkey.pem', 'cert.pem', 'chain.pem']) assert.ok(names.includes(name), `${name} in ${names}`);
  execFileSync('/usr/bin/7z', ['x', `-o${dir}/out`, zip], {stdio: 'pipe'});
  const certFile = names.includes('cert.pem') && execFileSync('/usr/bin/find', [`${dir}/out`, '-name', 'cert.pem'], {encoding: 'utf8'}).trim();
  assert.equal(fs.readFileSync(certFile, 'utf8').trim(), fs.readFileSync(path.join(dir, 'leaf.pem'), 'utf8').trim());
  await shot('imported');
});

test('an import whose key does not match says so in a sentence', async () => {
  const dir = fs.mkdtempSync(path.join(tmp, 'bad-'));
  makeChain(dir);
  await page.getByRole('button', {name: 'Import…'}).click();
  const dialog = page.locator('#import-dialog');
  await dialog.getByLabel('Description').fill('Mismatch');
  await dialog.getByLabel('Private key (PEM)').setInputFiles(path.join(dir, 'inter.key'));
  await dialog.getByLabel('Certificate (PEM)').setInputFiles(path.join(dir, 'leaf.pem'));
  await dialog.getByRole('button', {name: 'Import'}).click();
  await expectNotice('The certificate and the private key do not belong together.', true);
  assert.equal(await row('Mismatch').count(), 0);
});

// The names in a zip that the page handed out, after `click` started the download.
async function downloadedNames(click, dir, name) {
  const [file] = await Promise.all([page.waitForEvent('download'), click()]);
  const zip = path.join(dir, name);
  await file.saveAs(zip);
  const listing = execFileSync('/usr/bin/7z', ['l', '-slt', zip], {encoding: 'utf8'});
  return [...listing.matchAll(/^Path = (.+)$/gm)].map((m) => path.basename(m[1])).slice(1);
}

test('a signing request comes as key and request, and an uploaded request is signed', async () => {
  const dir = fs.mkdtempSync(path.join(tmp, 'csr-'));
  await page.getByRole('button', {name: 'Signing requests…'}).click();
  const dialog = page.locator('#csr-dialog');
  await page.locator('#r-common_name').fill('mail.example');
  await dialog.getByRole('button', {name: 'Create request'}).click();
  // The browser holds the form back while a subject field is empty.
  assert.equal(await page.locator('#r-organization:invalid').count(), 1);
  for (const [field, value] of [['organization', 'Example'], ['department', 'Mail'], ['city', 'Delft'],
                                ['state', 'ZH'], ['country', 'NL'], ['email', 'postmaster@mail.example']]) {
    await page.locator(`#r-${field}`).fill(value);
  }
  const made = await downloadedNames(() => dialog.getByRole('button', {name: 'Create request'}).click(), dir, 'csr.zip');
  assert.deepEqual(made.sort(), ['server.csr', 'server.key']);
  await expectNotice('The key and request was downloaded');

  execFileSync('/usr/bin/openssl', ['req', '-newkey', 'rsa:2048', '-nodes', '-keyout', 'ext.key', '-out', 'ext.csr',
                                    '-subj', '/CN=printer.example'], {cwd: dir, stdio: 'pipe'});
  await page.getByRole('button', {name: 'Signing requests…'}).click();
  await page.locator('#s-csr').setInputFiles(path.join(dir, 'ext.csr'));
  await page.locator('#s-id').selectOption({label: 'Office portal (portal)'});
  await page.locator('#s-alias').fill('printer.example');
  const signed = await downloadedNames(() => dialog.getByRole('button', {name: 'Sign and download'}).click(),
                                       dir, 'signed.zip');
  assert.deepEqual(signed, ['server.crt']);
  execFileSync('/usr/bin/7z', ['x', `-o${dir}/signed`, path.join(dir, 'signed.zip')], {stdio: 'pipe'});
  const crt = execFileSync('/usr/bin/find', [`${dir}/signed`, '-name', 'server.crt'], {encoding: 'utf8'}).trim();
  const text = execFileSync('/usr/bin/openssl', ['x509', '-in', crt, '-noout', '-subject', '-issuer'], {encoding: 'utf8'});
  assert.match(text, /subject=.*printer\.example/);
  assert.match(text, /issuer=.*portal CA/);
});

test('the description is edited in place', async () => {
  await row('Shop').getByRole('button', {name: 'Edit'}).click();
  const dialog = page.locator('#edit-dialog');
  await dialog.getByLabel('Description').fill('Shop front');
  await dialog.getByRole('button', {name: 'Save'}).click();
  await expectNotice('The description was saved.');
  assert.equal(await row('Shop front').count(), 1);
});

test('reset says what it removes and leaves one new default certificate', async () => {
  await page.getByRole('button', {name: 'Reset…'}).click();
  const dialog = page.locator('#confirm-dialog');
  const removed = await dialog.locator('.moving').innerText();
  assert.match(removed, /Office portal/);
  assert.match(removed, /Shop front/);
  await dialog.getByRole('button', {name: 'Reset'}).click();
  await expectNotice('The certificates were reset.');
  await page.waitForFunction(() => document.querySelectorAll('#certificates tbody tr').length === 1);
  assert.match(await row('arvelon').locator('.desc').innerText(), /default/);
  assert.match(await row('arvelon').locator('.services').innerText(), /Web administration/);
  assert.equal(await presentedCommonName(), 'arvelon');
  await shot('reset');
});

test('the server reported no sanitizer errors while the page drove it', () => {
  // Only says something in a -DZEPH_SANITIZE=ON build (errors found while
  // running; leaks are reported at exit, after this).
  assert.doesNotMatch(serverOutput, /AddressSanitizer|runtime error:/);
});
