import { test, after } from 'node:test';
import assert from 'node:assert/strict';
import { Tamber, openPage, closeBrowser, names, row } from './harness.mjs';

after(closeBrowser);

test('lists the root and opens a folder', async () => {
  const tamber = new Tamber();
  tamber.write('Work/plan.txt', 'plan');
  tamber.write('Work/budget.txt', 'budget');
  await tamber.start();
  try {
    const page = await openPage(tamber);
    assert.equal(new URL(page.url()).hash, '', 'the token left the address bar');
    assert.deepEqual((await names(page)).sort(), ['Notes', 'Work']);
    await row(page, 'Work').dblclick();
    await page.locator('#view .row .name:text-is("plan.txt")').waitFor();
    assert.deepEqual(await names(page), ['budget.txt', 'plan.txt']);
    assert.deepEqual(page.errors, []);
  } finally {
    await tamber.cleanup();
  }
});
