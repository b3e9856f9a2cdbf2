// Search as the user types, with the tag, kind and favourites filters.
import { test, after } from 'node:test';
import assert from 'node:assert/strict';
import { Tamber, openPage, closeBrowser, names, screenshot, waitFor } from './harness.mjs';

after(closeBrowser);

test('search by name, then narrow by kind, tag and favourites', async () => {
  const tamber = new Tamber();
  tamber.write('Work/budget 2026.txt', 'b');
  tamber.write('Work/budget.pdf', '%PDF-1.4');
  tamber.write('Work/budget photos/p.txt', 'p');
  tamber.write('Work/other.txt', 'o');
  await tamber.start();
  try {
    const txt = await tamber.itemAt(`${tamber.storage}/Work/budget 2026.txt`);
    await tamber.api('PATCH', `/items/${encodeURIComponent(txt.identifier)}`, { tags: ['Money'], favoriteRank: 1 });
    await waitFor(async () => (await tamber.api('GET', '/search?tag=Money')).json.items.length === 1, 'indexed tag');
    const page = await openPage(tamber);
    await page.keyboard.press('/');
    assert.equal(await page.evaluate(() => document.activeElement.id), 'search');
    await page.keyboard.type('budget');
    await waitFor(async () => (await names(page)).sort().join() === 'budget 2026.txt,budget photos,budget.pdf',
      'three results');
    assert.equal(await page.locator('#view .row .where').first().textContent(), 'Work', 'results say their folder');
    await screenshot(page, 'search-1280-light');
    await page.selectOption('#filter-kind', 'pdf');
    await waitFor(async () => (await names(page)).join() === 'budget.pdf', 'PDFs only');
    await page.selectOption('#filter-kind', 'folder');
    await waitFor(async () => (await names(page)).join() === 'budget photos', 'folders only');
    await page.selectOption('#filter-kind', '');
    await page.selectOption('#filter-tag', 'Money');
    await waitFor(async () => (await names(page)).join() === 'budget 2026.txt', 'tagged only');
    await page.selectOption('#filter-tag', '');
    await page.check('#filter-favourite');
    await waitFor(async () => (await names(page)).join() === 'budget 2026.txt', 'favourites only');
    await page.uncheck('#filter-favourite');
    await page.focus('#search');
    await page.keyboard.press('Escape');
    await waitFor(async () => (await names(page)).includes('Work'), 'back where the search started');
    assert.deepEqual(page.errors, []);
  } finally {
    await tamber.cleanup();
  }
});
