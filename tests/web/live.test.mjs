// The page follows changes made by other programs, says when the server is gone, and shows a
// clear message for a folder deleted while it is open.
import { test, after } from 'node:test';
import assert from 'node:assert/strict';
import fs from 'node:fs';
import { Tamber, openPage, closeBrowser, names, row, waitFor } from './harness.mjs';

after(closeBrowser);

test('outside create, rename and delete appear in place, keeping selection and scroll', async () => {
  const tamber = new Tamber();
  for (let n = 0; n < 60; n += 1) tamber.write(`Work/file ${String(n).padStart(2, '0')}.txt`, String(n));
  await tamber.start();
  try {
    const page = await openPage(tamber);
    await row(page, 'Work').dblclick();
    await row(page, 'file 00.txt').waitFor();
    await page.locator('#view').evaluate((v) => { v.scrollTop = 600; });
    await row(page, 'file 30.txt').click();
    const scrolled = await page.locator('#view').evaluate((v) => v.scrollTop);

    const latencies = [];
    for (let n = 0; n < 5; n += 1) {
      const name = `zz outside ${n}.txt`;
      const started = Date.now();
      fs.writeFileSync(`${tamber.storage}/Work/${name}`, 'x');
      await page.locator('#view').evaluate((v) => { v.scrollTop = v.scrollHeight; });
      await row(page, name).waitFor();
      latencies.push(Date.now() - started);
      await page.locator('#view').evaluate((v, top) => { v.scrollTop = top; }, scrolled);
    }
    latencies.sort((a, b) => a - b);
    console.log(`measure: outside write to row visible, median ${latencies[2]} ms (of ${latencies.join(', ')})`);

    fs.renameSync(`${tamber.storage}/Work/file 31.txt`, `${tamber.storage}/Work/file 31 renamed.txt`);
    await row(page, 'file 31 renamed.txt').waitFor();
    fs.rmSync(`${tamber.storage}/Work/file 32.txt`);
    await waitFor(async () => !(await names(page)).includes('file 32.txt'), 'deleted row gone');
    assert.equal(await page.locator('#view .row[aria-selected=true] .name').textContent(), 'file 30.txt',
      'the selection stays');
    assert.equal(await page.locator('#view').evaluate((v) => v.scrollTop), scrolled, 'the scroll stays');
    assert.deepEqual(page.errors, []);
  } finally {
    await tamber.cleanup();
  }
});

test('a folder deleted while open offers its parent', async () => {
  const tamber = new Tamber();
  tamber.write('Work/Doomed/a.txt', 'a');
  await tamber.start();
  try {
    const page = await openPage(tamber);
    await row(page, 'Work').dblclick();
    await row(page, 'Doomed').dblclick();
    await row(page, 'a.txt').waitFor();
    fs.rmSync(`${tamber.storage}/Work/Doomed`, { recursive: true });
    const notice = page.locator('#notice');
    await notice.locator('button', { hasText: 'parent' }).waitFor();
    assert.match(await notice.textContent(), /no longer exists/);
    await notice.locator('button').click();
    await page.locator('#crumbs .crumb[aria-current]', { hasText: 'Work' }).waitFor();
  } finally {
    await tamber.cleanup();
  }
});

test('a banner while the server is gone; a restarted server is told apart', async () => {
  const tamber = new Tamber();
  tamber.write('Work/a.txt', 'a');
  await tamber.start();
  try {
    const page = await openPage(tamber);
    await tamber.stop();
    const banner = page.locator('#banner');
    await waitFor(async () => /cannot be reached/.test(await banner.textContent()) && await banner.isVisible(),
      'the offline banner');
    // The new run has a new token: the page says to open its address, and lists nothing new.
    await tamber.start(tamber.port);
    await waitFor(async () => /no longer accepts/.test(await banner.textContent()), 'the session refused');
    // Opened with the new address, the page works again.
    await page.goto(tamber.url);
    await row(page, 'Work').waitFor();
    assert.equal(await banner.isVisible(), false);
  } finally {
    await tamber.cleanup();
  }
});
