// Starts a real `tamber serve` over a temporary storage folder (with its own HOME and XDG
// folders and one installed app with a library) and drives headless Chromium against it.
import { spawn } from 'node:child_process';
import fs from 'node:fs';
import os from 'node:os';
import path from 'node:path';
import { fileURLToPath } from 'node:url';
import { chromium } from 'playwright-core';

const here = path.dirname(fileURLToPath(import.meta.url));
export const repo = path.resolve(here, '../..');
export const binary = process.env.TAMBER_BINARY || path.join(repo, 'build/tamber');
const chromiumPath = process.env.CHROMIUM || '/usr/bin/chromium';
export const screenshotDir = process.env.TAMBER_SCREENSHOTS || path.join(repo, 'build/web-screenshots');

export class Tamber {
  constructor() {
    this.root = fs.realpathSync(fs.mkdtempSync(path.join(os.tmpdir(), 'tamber-web-')));
    for (const dir of ['run', 'state', 'home', 'data/applications', 'container/Documents', 'Documents/Work']) {
      fs.mkdirSync(path.join(this.root, dir), { recursive: true });
    }
    this.storage = path.join(this.root, 'Documents');
    this.library = path.join(this.root, 'container/Documents');
    fs.writeFileSync(path.join(this.root, 'data/applications/com.example.Notes.desktop'),
      '[Desktop Entry]\nType=Application\nName=Notes\nExec=true\n' +
      `X-Tamber-Data-Container=${this.root}/container\nX-Tamber-Supports-Document-Browser=true\n`);
    this.port = 0;
  }

  env() {
    const env = { ...process.env };
    delete env.DISPLAY;
    delete env.WAYLAND_DISPLAY;
    return Object.assign(env, {
      XDG_RUNTIME_DIR: path.join(this.root, 'run'), XDG_STATE_HOME: path.join(this.root, 'state'),
      XDG_DATA_HOME: path.join(this.root, 'data'), XDG_CACHE_HOME: path.join(this.root, 'cache'),
      HOME: path.join(this.root, 'home'),
    });
  }

  // Starts the server (on `port`, or a free one) and resolves with the URL it prints.
  async start(port = this.port) {
    const args = ['--storage', this.storage, 'serve', '--port', String(port), '--no-open'];
    if (process.env.TAMBER_WEB_ROOT) args.push('--web-root', process.env.TAMBER_WEB_ROOT);
    this.child = spawn(binary, args, { env: this.env(), stdio: ['ignore', 'pipe', 'pipe'] });
    this.stderr = '';
    this.child.stderr.on('data', (chunk) => { this.stderr += chunk; });
    const url = await new Promise((resolve, reject) => {
      let out = '';
      const timer = setTimeout(() => reject(new Error(`no URL from tamber serve: ${this.stderr}`)), 60000);
      this.child.stdout.on('data', (chunk) => {
        out += chunk;
        const line = out.split('\n')[0];
        if (out.includes('\n')) { clearTimeout(timer); resolve(line.trim()); }
      });
      this.child.on('exit', (code) => { clearTimeout(timer); reject(new Error(`tamber serve exited ${code}: ${this.stderr}`)); });
    });
    this.url = url;
    this.base = url.slice(0, url.indexOf('/#'));
    this.token = url.slice(url.indexOf('#token=') + 7);
    this.port = Number(new URL(this.base).port);
    // The tests act only once a change of their own has been seen to come and go, so that what
    // they check is the page and not the server's start.
    await waitFor(async () => (await this.api('GET', '/status')).json.state === 'ready', 'the first catch-up', 180000);
    const probe = path.join(this.library, 'tamber-web-probe.txt');
    for (let attempt = 0; ; attempt += 1) {
      if (attempt === 40) throw new Error('the server never saw a change');
      fs.writeFileSync(probe, 'probe');
      try {
        await this.waitIndexed('tamber-web-probe.txt', 1500);
        break;
      } catch (e) {
        fs.rmSync(probe, { force: true });
        await new Promise((resolve) => setTimeout(resolve, 200));
      }
    }
    fs.rmSync(probe);
    await waitFor(async () => !(await this.searchNames('tamber-web-probe.txt')).length, 'the probe gone');
    return url;
  }

  async stop() {
    if (!this.child || this.child.exitCode !== null) return;
    const exited = new Promise((resolve) => this.child.once('exit', resolve));
    this.child.kill('SIGTERM');
    await exited;
  }

  async api(method, apiPath, body) {
    const response = await fetch(this.base + '/api/v1' + apiPath, {
      method, headers: { Authorization: `Bearer ${this.token}`, ...(body ? { 'Content-Type': 'application/json' } : {}) },
      body: body ? JSON.stringify(body) : undefined,
    });
    const text = await response.text();
    return { status: response.status, json: text ? JSON.parse(text) : null, text, headers: response.headers };
  }

  async itemAt(filePath) {
    const r = await this.api('GET', `/lookup?path=${encodeURIComponent(filePath)}`);
    return r.json;
  }

  // Waits until the server's replica has caught up with what is on disk: search finds `name`.
  async waitIndexed(name, limitMs) {
    await waitFor(async () => (await this.searchNames(name)).includes(name), `index to show ${name}`, limitMs);
  }

  async searchNames(query) {
    const r = await this.api('GET', `/search?q=${encodeURIComponent(query)}`);
    return r.status === 200 ? r.json.items.map((i) => i.filename) : [];
  }

  write(relative, content = '') {
    const file = path.join(this.storage, relative);
    fs.mkdirSync(path.dirname(file), { recursive: true });
    fs.writeFileSync(file, content);
    return file;
  }

  async cleanup() {
    await this.stop();
    fs.rmSync(this.root, { recursive: true, force: true });
  }
}

// A server prepared by `prepare` (files written before it starts) for the length of `body`.
export async function withServer(prepare, body) {
  const tamber = new Tamber();
  prepare(tamber);
  await tamber.start();
  try {
    await body(tamber);
  } finally {
    await tamber.cleanup();
  }
}

export async function waitFor(check, what, limitMs = 20000) {
  const start = Date.now();
  for (;;) {
    if (await check()) return;
    if (Date.now() - start > limitMs) throw new Error(`timed out waiting for ${what}`);
    await new Promise((resolve) => setTimeout(resolve, 50));
  }
}

let browserPromise = null;
export function browser() {
  if (!browserPromise) {
    browserPromise = chromium.launch({ executablePath: chromiumPath, headless: true,
      args: ['--no-sandbox', '--disable-gpu', '--disable-dev-shm-usage'] });
  }
  return browserPromise;
}

export async function closeBrowser() {
  if (browserPromise) (await browserPromise).close();
  browserPromise = null;
}

// A page opened on the server's URL, with the token exchanged and the root listed.
export async function openPage(tamber, options = {}) {
  const context = await (await browser()).newContext({
    viewport: options.viewport || { width: 1280, height: 800 },
    colorScheme: options.colorScheme || 'light', acceptDownloads: true,
  });
  const page = await context.newPage();
  page.errors = [];
  page.on('pageerror', (error) => page.errors.push(error));
  if (process.env.TAMBER_WEB_DEBUG) {
    page.on('console', (m) => console.log('console:', m.text()));
    page.on('response', async (r) => {
      if (r.request().method() !== 'GET') console.log(r.request().method(), r.url(), r.status(), await r.text().catch(() => ''));
    });
  }
  await page.goto(options.url || tamber.url);
  if (options.wait !== false) {
    await page.locator('#view .row').first().waitFor();
    await page.locator('#places .place-trash').waitFor({ state: 'attached' });
  }
  return page;
}

export function row(page, name) {
  return page.locator('#view .row', { has: page.locator('.name', { hasText: name }) }).filter({
    has: page.locator(`.name:text-is("${name.replace(/"/g, '\\"')}")`) });
}

export async function names(page) {
  return page.$$eval('#view .row', (rows) => rows
    .sort((a, b) => Number(a.dataset.index) - Number(b.dataset.index))
    .map((r) => r.querySelector('.name').firstChild?.textContent ?? ''));
}

export async function screenshot(page, name) {
  fs.mkdirSync(screenshotDir, { recursive: true });
  await page.screenshot({ path: path.join(screenshotDir, `${name}.png`) });
}
