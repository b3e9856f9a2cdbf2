// Every action on items: new folder, rename, drag-and-drop moves of one or many, trash and its
// undoing, tags, favourites, undo, uploads and downloads, and the root's refusals.
import { test, after } from 'node:test';
import assert from 'node:assert/strict';
import fs from 'node:fs';
import path from 'node:path';
import crypto from 'node:crypto';
import { withServer, openPage, closeBrowser, names, row, screenshot, waitFor } from './harness.mjs';

after(closeBrowser);

async function openWork(tamber) {
  const page = await openPage(tamber);
  await row(page, 'Work').dblclick();
  await page.locator('#crumbs .crumb[aria-current]', { hasText: 'Work' }).waitFor();
  await page.locator('#view .row').first().waitFor();
  return page;
}

const exists = (file) => fs.existsSync(file);

test('new folder, rename in place, a refused name keeps the old one, undo', async () => {
  await withServer((t) => { t.write('Work/taken.txt', 't'); t.write('Work/mine.txt', 'm'); }, async (tamber) => {
    const page = await openWork(tamber);
    await page.click('#new-folder');
    const editor = page.locator('.rename input');
    await editor.waitFor();
    await editor.fill('Projects');
    await editor.press('Enter');
    await row(page, 'Projects').waitFor();
    await waitFor(() => exists(`${tamber.storage}/Work/Projects`), 'the folder on disk');
    assert.ok(!exists(`${tamber.storage}/Work/untitled folder`));

    await row(page, 'mine.txt').click();
    await page.keyboard.press('F2');
    await editor.fill('taken.txt');
    await editor.press('Enter');
    const error = page.locator('.rename-error');
    await error.waitFor();
    assert.notEqual((await error.textContent()).trim(), '', 'the refusal is said beside the name');
    assert.ok(exists(`${tamber.storage}/Work/mine.txt`), 'the old name is kept');
    await editor.press('Escape');
    await row(page, 'mine.txt').waitFor();

    await row(page, 'mine.txt').click();
    await page.click('#rename');
    await editor.fill('ours.txt');
    await editor.press('Enter');
    await row(page, 'ours.txt').waitFor();
    assert.ok(exists(`${tamber.storage}/Work/ours.txt`));
    await page.focus('#view');
    await page.keyboard.press('Control+z');
    await row(page, 'mine.txt').waitFor();
    await waitFor(() => exists(`${tamber.storage}/Work/mine.txt`), 'the rename undone on disk');
    assert.deepEqual(page.errors, []);
  });
});

test('drag one or many selected items onto a folder, the sidebar and the breadcrumbs; undo a move', async () => {
  await withServer((t) => {
    for (const n of ['a', 'b', 'c', 'd']) t.write(`Work/${n}.txt`, n);
    t.write('Work/Inbox/keep.txt', 'k');
  }, async (tamber) => {
    const page = await openWork(tamber);
    await row(page, 'a.txt').click();
    await row(page, 'c.txt').click({ modifiers: ['Shift'] });
    await row(page, 'b.txt').click({ modifiers: ['Control'] });
    assert.deepEqual(await page.locator('#view .row[aria-selected=true] .name').allTextContents(), ['a.txt', 'c.txt']);
    await row(page, 'a.txt').dragTo(row(page, 'Inbox'));
    await waitFor(() => exists(`${tamber.storage}/Work/Inbox/a.txt`) && exists(`${tamber.storage}/Work/Inbox/c.txt`),
      'both moved');
    await waitFor(async () => (await names(page)).join() === 'Inbox,b.txt,d.txt', 'rows gone from the list');

    await page.focus('#view');
    await page.keyboard.press('Control+z');
    await waitFor(() => exists(`${tamber.storage}/Work/a.txt`) && exists(`${tamber.storage}/Work/c.txt`), 'move undone');
    await waitFor(async () => (await names(page)).join() === 'Inbox,a.txt,b.txt,c.txt,d.txt', 'rows back');

    // Onto an app library in the sidebar.
    await row(page, 'd.txt').dragTo(page.locator('#places .place', { hasText: 'Notes' }));
    await waitFor(() => exists(`${tamber.library}/d.txt`), 'moved into the library');

    // Onto a breadcrumb: from Inbox back up to Work.
    await row(page, 'Inbox').dblclick();
    await row(page, 'keep.txt').waitFor();
    await row(page, 'keep.txt').dragTo(page.locator('#crumbs .crumb', { hasText: 'Work' }));
    await waitFor(() => exists(`${tamber.storage}/Work/keep.txt`), 'moved up by the breadcrumb');

    // Onto the root: refused before any request.
    const requests = [];
    page.on('request', (r) => { if (r.method() === 'PATCH') requests.push(r.url()); });
    await page.locator('#crumbs .crumb', { hasText: 'Work' }).click();
    await row(page, 'b.txt').waitFor();
    await row(page, 'b.txt').dragTo(page.locator('#crumbs .crumb', { hasText: 'Documents' }));
    await row(page, 'b.txt').dragTo(page.locator('#places .place', { hasText: 'Documents' }));
    assert.deepEqual(requests, []);
    assert.ok(exists(`${tamber.storage}/Work/b.txt`));
    assert.deepEqual(page.errors, []);
  });
});

test('the root refuses new items: the actions are disabled and say why', async () => {
  await withServer(() => {}, async (tamber) => {
    const page = await openPage(tamber);
    for (const id of ['#new-folder', '#upload']) {
      assert.equal(await page.locator(id).isDisabled(), true);
      assert.match(await page.locator(id).getAttribute('title'), /directly/);
    }
    await page.locator('#view').click({ button: 'right', position: { x: 400, y: 300 } });
    const entry = page.locator('#context-menu [role=menuitem]', { hasText: 'New Folder' });
    assert.equal(await entry.getAttribute('aria-disabled'), 'true');
    assert.match(await entry.getAttribute('title'), /directly/);
  });
});

test('trash, put back, delete forever and empty the trash', async () => {
  await withServer((t) => { for (const n of ['one', 'two', 'three', 'four']) t.write(`Work/${n}.txt`, n); }, async (tamber) => {
    const page = await openWork(tamber);
    await row(page, 'one.txt').click();
    await row(page, 'two.txt').click({ modifiers: ['Control'] });
    await page.keyboard.press('Delete');
    await waitFor(async () => !(await names(page)).includes('one.txt') && !(await names(page)).includes('two.txt'), 'rows gone');
    await waitFor(() => !exists(`${tamber.storage}/Work/one.txt`), 'trashed on disk');
    await row(page, 'three.txt').click({ button: 'right' });
    await page.locator('#context-menu [role=menuitem]', { hasText: 'Move to Trash' }).click();
    await waitFor(() => !exists(`${tamber.storage}/Work/three.txt`), 'trashed from the menu');

    await page.locator('#places .place', { hasText: 'Trash' }).click();
    await waitFor(async () => (await names(page)).length === 3, 'three in the Trash')
    await screenshot(page, 'trash-1280-light');
    await row(page, 'one.txt').click();
    await page.click('#put-back');
    await waitFor(() => exists(`${tamber.storage}/Work/one.txt`), 'put back');
    await waitFor(async () => !(await names(page)).includes('one.txt'), 'gone from the Trash view');

    await row(page, 'two.txt').click();
    await page.click('#delete-forever');
    await page.click('#dialog-ok');
    await waitFor(async () => !(await names(page)).includes('two.txt'), 'deleted forever');

    await page.click('#empty-trash');
    await page.locator('#dialog[open] #dialog-title', { hasText: 'Empty' }).waitFor();
    await page.click('#dialog-cancel');
    assert.deepEqual(await names(page), ['three.txt'], 'cancel keeps the Trash');
    await page.click('#empty-trash');
    await page.locator('#dialog[open] #dialog-title', { hasText: 'Empty' }).waitFor();
    await page.click('#dialog-ok');
    await waitFor(async () => (await names(page)).length === 0, 'the Trash emptied');
    // The server's index follows the disk through the journal, a moment later.
    await waitFor(async () => (await tamber.api('GET', '/search?trashed=true')).json.items.filter((i) => i.trashed).length === 0,
      'the index holds no trashed item');
    assert.ok(exists(`${tamber.storage}/Work/four.txt`), 'what was not trashed is untouched');
  });
});

test('tags: add, colour, the Tags place, remove; favourites', async () => {
  await withServer((t) => { t.write('Work/x.txt', 'x'); t.write('Work/y.txt', 'y'); t.write('Work/z.txt', 'z'); }, async (tamber) => {
    const page = await openWork(tamber);
    await row(page, 'x.txt').click();
    await row(page, 'y.txt').click({ modifiers: ['Control'] });
    await page.click('#tags');
    await page.fill('#dialog-input', 'Travel:4, Urgent');
    await page.click('#dialog-ok');
    await waitFor(async () => (await row(page, 'y.txt').locator('.tag').allTextContents()).join() === 'Travel,Urgent', 'tags shown');
    assert.match(await row(page, 'x.txt').locator('.tag', { hasText: 'Travel' }).getAttribute('class'), /hue-4/);
    const item = await tamber.itemAt(`${tamber.storage}/Work/x.txt`);
    assert.deepEqual(item.tags, ['Travel', 'Urgent']);

    const place = page.locator('#places .place', { hasText: 'Travel' });
    await place.waitFor();
    await place.click();
    await waitFor(async () => (await names(page)).sort().join() === 'x.txt,y.txt', 'the Tags place lists both');
    await screenshot(page, 'tag-place-1280-light');

    await row(page, 'x.txt').click();
    await page.click('#tags');
    await page.fill('#dialog-input', 'Urgent');
    await page.click('#dialog-ok');
    await waitFor(async () => (await names(page)).join() === 'y.txt', 'untagged item leaves the Tags place');

    await row(page, 'y.txt').click();
    await page.click('#star');
    await page.locator('#places .place', { hasText: 'Favourites' }).click();
    await waitFor(async () => (await names(page)).join() === 'y.txt', 'the favourite listed');
    assert.notEqual((await tamber.itemAt(`${tamber.storage}/Work/y.txt`)).favoriteRank, null);
    assert.deepEqual(page.errors, []);
  });
});

test('upload by button and by drop, progress, taken names bounce; download byte for byte', async () => {
  await withServer((t) => { t.write('Work/report.bin', crypto.randomBytes(300000)); }, async (tamber) => {
    const page = await openWork(tamber);
    const payload = crypto.randomBytes(1 << 20);
    await page.setInputFiles('#upload-input', { name: 'report.bin', mimeType: 'application/octet-stream', buffer: payload });
    await row(page, 'report 2.bin').waitFor();
    assert.ok(payload.equals(fs.readFileSync(`${tamber.storage}/Work/report 2.bin`)), 'uploaded bytes');
    assert.equal(await page.locator('.upload progress').first().getAttribute('value') ?? '100', '100');

    const dropped = await page.evaluateHandle(() => {
      const transfer = new DataTransfer();
      transfer.items.add(new File(['dropped from the desktop'], 'dropped.txt', { type: 'text/plain' }));
      return transfer;
    });
    await page.dispatchEvent('#view', 'drop', { dataTransfer: dropped });
    await row(page, 'dropped.txt').waitFor();
    assert.equal(fs.readFileSync(`${tamber.storage}/Work/dropped.txt`, 'utf8'), 'dropped from the desktop');

    const original = fs.readFileSync(`${tamber.storage}/Work/report.bin`);
    const downloading = page.waitForEvent('download');
    await row(page, 'report.bin').dblclick();
    const download = await downloading;
    assert.equal(download.suggestedFilename(), 'report.bin');
    assert.ok(original.equals(fs.readFileSync(await download.path())), 'downloaded bytes');
    assert.deepEqual(page.errors, []);
  });
});
