// Listing, opening, sorting and the views, with the mouse and with the keyboard alone.
import { test, after } from 'node:test';
import assert from 'node:assert/strict';
import { withServer, openPage, closeBrowser, names, row, screenshot, waitFor } from './harness.mjs';

after(closeBrowser);

test('folders come first, columns sort, breadcrumbs lead back', async () => {
  await withServer((t) => {
    t.write('Work/b.txt', 'bb');
    t.write('Work/a.txt', 'a much longer file');
    t.write('Work/c.txt', 'c');
    t.write('Work/zeta/inner.txt', 'x');
  }, async (tamber) => {
    const page = await openPage(tamber);
    await row(page, 'Work').dblclick();
    await page.locator('#view .row .name:text-is("a.txt")').waitFor();
    assert.deepEqual(await names(page), ['zeta', 'a.txt', 'b.txt', 'c.txt']);
    await page.click('#columns [data-sort=size]');
    assert.deepEqual(await names(page), ['zeta', 'c.txt', 'b.txt', 'a.txt'], 'by size, folders first');
    await page.click('#columns [data-sort=size]');
    assert.deepEqual(await names(page), ['zeta', 'a.txt', 'b.txt', 'c.txt'], 'by size, descending');
    await page.click('#columns [data-sort=name]');
    assert.deepEqual(await names(page), ['zeta', 'a.txt', 'b.txt', 'c.txt']);
    await page.click('#columns [data-sort=name]');
    assert.deepEqual(await names(page), ['zeta', 'c.txt', 'b.txt', 'a.txt'], 'by name, descending');

    await row(page, 'zeta').dblclick();
    await page.locator('#view .row .name:text-is("inner.txt")').waitFor();
    assert.deepEqual(await page.locator('#crumbs .crumb').allTextContents(), ['Documents', 'Work', 'zeta']);
    await page.locator('#crumbs .crumb', { hasText: 'Work' }).click();
    await page.locator('#view .row .name:text-is("zeta")').waitFor();
    await page.click('#view-toggle');
    await page.locator('#view.grid .row').first().waitFor();
    await screenshot(page, 'folder-grid-1280-light');
    await page.click('#view-toggle');
    assert.deepEqual(page.errors, []);
  });
});

test('keyboard alone: move, open, go up, select all, rename', async () => {
  await withServer((t) => {
    t.write('Work/one.txt', '1');
    t.write('Work/two.txt', '2');
    t.write('Work/deep/three.txt', '3');
  }, async (tamber) => {
    const page = await openPage(tamber);
    await page.focus('#view');
    // Documents lists Notes and Work; Work is second.
    await page.keyboard.press('ArrowDown');
    await page.keyboard.press('ArrowDown');
    await page.keyboard.press('Enter');
    await page.locator('#view .row .name:text-is("deep")').waitFor();
    await page.keyboard.press('Home');
    await page.keyboard.press('Enter');
    await page.locator('#view .row .name:text-is("three.txt")').waitFor();
    await page.keyboard.press('Backspace');
    await page.locator('#view .row .name:text-is("one.txt")').waitFor();
    assert.equal(await page.locator('#view .row[aria-selected=true] .name').first().textContent(), 'deep',
      'going up selects the folder we came from');
    await page.keyboard.press('Alt+ArrowUp');
    await page.locator('#view .row .name:text-is("Notes")').waitFor();
    await page.keyboard.press('Enter');
    await page.locator('#view .row .name:text-is("one.txt")').waitFor();
    await page.keyboard.press('Control+a');
    assert.equal(await page.locator('#view .row[aria-selected=true]').count(), 3);
    await page.keyboard.press('End');
    await page.keyboard.press('F2');
    const editor = page.locator('.rename input');
    await editor.waitFor();
    await editor.fill('renamed by keys.txt');
    await page.keyboard.press('Enter');
    await page.locator('#view .row .name:text-is("renamed by keys.txt")').waitFor();
    await waitFor(async () => (await tamber.api('GET', `/lookup?path=${encodeURIComponent(`${tamber.storage}/Work/renamed by keys.txt`)}`)).status === 200,
      'the rename on disk');
    // The focus ring shows where the keys act.
    const outline = await page.$eval('#view .row.focused', (r) => getComputedStyle(r).boxShadow);
    assert.notEqual(outline, 'none');
    assert.deepEqual(page.errors, []);
  });
});

test('hostile names are shown as text and never run', async () => {
  const hostile = [
    '<img src=x onerror=window.__pwned=1>.txt',
    '"quoted" \'single\'.txt',
    'abc\u202Egnp.exe',
    'emoji 🎉📁.txt',
    `${'ü'.repeat(120)}.txt`,  // 240 bytes + ".txt": 244 bytes
    `${'x'.repeat(251)}.txt`,  // 255 bytes
  ];
  await withServer((t) => { for (const name of hostile) t.write(`Work/${name}`, name); }, async (tamber) => {
    const page = await openPage(tamber);
    await row(page, 'Work').dblclick();
    await page.locator('#view .row').nth(hostile.length - 1).waitFor();
    const shown = await names(page);
    assert.deepEqual([...shown].sort(), [...hostile].sort());
    assert.equal(await page.evaluate(() => window.__pwned), undefined);
    assert.equal(await page.locator('#view img[src=x]').count(), 0);
    const title = await row(page, hostile[0]).getAttribute('title');
    assert.ok(title.startsWith(hostile[0]) && title.includes(`${tamber.storage}/Work/`), 'tooltip: name and path');
    assert.deepEqual(page.errors, []);
  });
});

test('main views in both themes and both sizes', async () => {
  await withServer((t) => {
    t.write('Work/report.pdf', '%PDF-1.4');
    t.write('Work/notes.txt', 'notes');
    t.write('Work/Photos/a.txt', 'x');
  }, async (tamber) => {
    for (const colorScheme of ['light', 'dark']) {
      for (const viewport of [{ width: 1280, height: 800 }, { width: 390, height: 844 }]) {
        const page = await openPage(tamber, { colorScheme, viewport });
        const suffix = `${viewport.width}-${colorScheme}`;
        await screenshot(page, `root-${suffix}`);
        await row(page, 'Work').dblclick();
        await page.locator('#view .row .name:text-is("notes.txt")').waitFor();
        await screenshot(page, `folder-${suffix}`);
        // Nothing spills sideways on a phone.
        const overflow = await page.evaluate(() => document.documentElement.scrollWidth - innerWidth);
        assert.ok(overflow <= 0, `no horizontal scrolling at ${suffix}: ${overflow}px`);
        await page.context().close();
      }
    }
  });
});
