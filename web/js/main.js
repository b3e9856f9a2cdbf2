// Starts the page: trades the token in the address for the session cookie, takes the token out
// of the address bar, then shows the browser, or says why it cannot.
import { api, openSession } from './api.js';
import { $, show } from './dom.js';
import { Browser } from './browser.js';

function fail(message) {
  const banner = $('banner');
  banner.textContent = message;
  banner.dataset.kind = 'fatal';
  show(banner, true);
  show($('app'), false);
}

async function start() {
  const fragment = new URLSearchParams(location.hash.slice(1));
  const token = fragment.get('token');
  if (token !== null) {
    // The token must not stay in the address bar, the history or a bookmark.
    history.replaceState(null, '', location.pathname + location.search);
    let accepted = false;
    try {
      accepted = await openSession(token);
    } catch (e) {
      fail('The Tamber server cannot be reached.');
      return;
    }
    if (!accepted) {
      fail('This link has expired: its access token is not the running server\'s. ' +
        'Open the address that `tamber serve` printed.');
      return;
    }
  }
  try {
    await api.status();
  } catch (e) {
    if (e.status === 401) {
      fail('No access token. Open the address that `tamber serve` printed ' +
        '(it ends with #token=…).');
    } else {
      fail('The Tamber server cannot be reached.');
    }
    return;
  }
  show($('app'), true);
  const browser = new Browser();
  window.tamber = browser;  // for the browser tests and the console
  await browser.start();
}

start();

// A new address pasted into this tab (a restarted server's) only changes the fragment: start
// again with its token.
window.addEventListener('hashchange', () => {
  if (new URLSearchParams(location.hash.slice(1)).has('token')) location.reload();
});
