// The token: missing, expired, and kept out of the address bar.
import { test, after } from 'node:test';
import assert from 'node:assert/strict';
import { Tamber, openPage, closeBrowser, screenshot } from './harness.mjs';

after(closeBrowser);

test('a missing or wrong token shows a message and lists nothing', async () => {
  const tamber = new Tamber();
  tamber.write('Work/secret plan.txt', 'secret');
  await tamber.start();
  try {
    for (const [label, url] of [['missing', `${tamber.base}/`],
      ['expired', `${tamber.base}/#token=${'0'.repeat(64)}`]]) {
      const page = await openPage(tamber, { url, wait: false });
      const responses = [];
      page.on('response', (r) => responses.push(r));
      const banner = page.locator('#banner[data-kind=fatal]');
      await banner.waitFor();
      const text = await banner.textContent();
      assert.match(text, label === 'missing' ? /No access token/ : /expired/);
      assert.equal(await page.locator('#view .row').count(), 0);
      const html = await page.content();
      assert.ok(!html.includes('Work') && !html.includes('secret plan'), 'nothing of the storage leaks');
      assert.equal(new URL(page.url()).hash, '', 'no token left in the address');
      await screenshot(page, `no-token-${label}`);
      await page.context().close();
    }
  } finally {
    await tamber.cleanup();
  }
});

test('the token is traded for a session cookie the page cannot read', async () => {
  const tamber = new Tamber();
  await tamber.start();
  try {
    const page = await openPage(tamber);
    assert.equal(new URL(page.url()).hash, '');
    assert.equal(await page.evaluate(() => document.cookie), '', 'the cookie is HttpOnly');
    const cookies = await page.context().cookies();
    assert.ok(cookies.some((c) => c.name === 'tamber_session' && c.httpOnly));
    // A reload without the fragment still works through the cookie.
    await page.reload();
    await page.locator('#view .row').first().waitFor();
    const headers = (await page.request.get(`${tamber.base}/`)).headers();
    assert.match(headers['content-security-policy'], /default-src 'self'/);
    assert.deepEqual(page.errors, []);
  } finally {
    await tamber.cleanup();
  }
});
