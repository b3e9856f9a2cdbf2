// Big folders: the first rows of 10,000 entries, and 100,000 entries scrolled to the end with
// only the rows on screen in the DOM. Times are printed, never asserted.
import { test, after } from 'node:test';
import assert from 'node:assert/strict';
import fs from 'node:fs';
import path from 'node:path';
import { Tamber, openPage, closeBrowser, row, repo, waitFor } from './harness.mjs';

after(closeBrowser);

// TAMBER_WEB_BIG sets another size; 100,000 takes about 40 s in all.
const BIG = Number(process.env.TAMBER_WEB_BIG || 100000);

function fill(dir, count) {
  fs.mkdirSync(dir, { recursive: true });
  for (let n = 0; n < count; n += 1) fs.writeFileSync(path.join(dir, `f${String(n).padStart(6, '0')}.txt`), '');
}

test(`a folder of ${BIG} entries opens at once and scrolls to its end`, async () => {
  const tamber = new Tamber();
  fill(`${tamber.storage}/Work/Ten`, Math.min(10000, BIG));
  fill(`${tamber.storage}/Work/Big`, BIG);
  await tamber.start();
  try {
    const page = await openPage(tamber);
    await row(page, 'Work').dblclick();
    await row(page, 'Ten').waitFor();
    const started = Date.now();
    await row(page, 'Ten').dblclick();
    await row(page, 'f000000.txt').waitFor();
    console.log(`measure: navigation to first rows of a 10,000-entry folder painted: ${Date.now() - started} ms`);

    await page.locator('#crumbs .crumb', { hasText: 'Work' }).click();
    await row(page, 'Big').dblclick();
    await row(page, 'f000000.txt').waitFor();
    // Scroll by steps, timing the frames.
    const frames = await page.evaluate(async () => {
      const view = document.getElementById('view');
      const times = [];
      let last = performance.now();
      for (let step = 0; step < 120; step += 1) {
        view.scrollTop += 900;
        await new Promise((resolve) => requestAnimationFrame(resolve));
        const now = performance.now();
        times.push(now - last);
        last = now;
      }
      times.sort((a, b) => a - b);
      return { median: times[times.length >> 1], p95: times[Math.floor(times.length * 0.95)] };
    });
    console.log(`measure: frame time scrolling ${BIG} entries: median ${frames.median.toFixed(1)} ms, 95th ${frames.p95.toFixed(1)} ms`);

    const last = `f${String(BIG - 1).padStart(6, '0')}.txt`;
    const scrollStarted = Date.now();
    await waitFor(async () => {
      await page.locator('#view').evaluate((v) => { v.scrollTop = v.scrollHeight; });
      return (await row(page, last).count()) === 1;
    }, 'the last entry', 170000);
    console.log(`measure: scrolled to the end of ${BIG} entries in ${Date.now() - scrollStarted} ms`);
    const inDom = await page.locator('#view .row').count();
    assert.ok(inDom < 200, `only the rows on screen are in the DOM (${inDom})`);
    assert.equal(await page.evaluate(() => window.tamber.items.length), BIG + 0, 'every entry loaded once');
    assert.deepEqual(page.errors, []);
  } finally {
    await tamber.cleanup();
  }
});

test('the web files stay small', () => {
  let total = 0;
  const walk = (dir) => {
    for (const entry of fs.readdirSync(dir, { withFileTypes: true })) {
      const file = path.join(dir, entry.name);
      if (entry.isDirectory()) walk(file); else total += fs.statSync(file).size;
    }
  };
  walk(path.join(repo, 'web'));
  console.log(`measure: web files total ${total} bytes (${(total / 1024).toFixed(1)} KiB)`);
  assert.ok(total <= 150 * 1024);
});
