// Follows the server's change events and applies them to what is listed, in place: rows
// appear, change or go without a reload, and the selection and scroll position stay.
import { api, isRoot } from './api.js';
import { $, show } from './dom.js';

export class Live {
  constructor(browser) {
    this.browser = browser;
    this.source = null;
    this.reloadTimer = 0;
    this.lastEventId = null;
  }

  start() {
    // EventSource reconnects by itself and sends Last-Event-ID, so the server replays what
    // was missed.
    this.source = new EventSource(api.eventsUrl(), { withCredentials: true });
    this.source.addEventListener('open', () => this.connected(true));
    this.source.addEventListener('error', () => this.connected(false));
    this.source.addEventListener('changes', (event) => {
      this.lastEventId = event.lastEventId;
      try {
        this.apply(JSON.parse(event.data));
      } catch (e) { /* a malformed event changes nothing */ }
    });
    this.source.addEventListener('reset', () => this.browser.reload());
  }

  connected(up) {
    const banner = $('banner');
    if (banner.dataset.kind === 'fatal') return;
    if (up) {
      const wasDown = banner.dataset.kind === 'offline' && !banner.hidden;
      show(banner, false);
      delete banner.dataset.kind;
      if (wasDown) this.browser.reload();
      return;
    }
    banner.textContent = 'The Tamber server cannot be reached. Trying again…';
    banner.dataset.kind = 'offline';
    show(banner, true);
    if (this.source && this.source.readyState === EventSource.CLOSED) {
      // Refused outright (e.g. a restarted server with another token): try again later.
      setTimeout(() => this.retry(), 2000);
    }
  }

  async retry() {
    try {
      await api.status();
      this.start();
    } catch (e) {
      if (e.status === 401) {
        const banner = $('banner');
        banner.textContent = 'The server no longer accepts this page\'s session. ' +
          'Open the address that `tamber serve` printed.';
        banner.dataset.kind = 'fatal';
        show(banner, true);
        return;
      }
      setTimeout(() => this.retry(), 2000);
    }
  }

  // `batch`: {"changes": [{"updated": item} | {"deleted": id}, ...]} in order, or the
  // "updated"/"deleted" lists alone.
  apply(batch) {
    const browser = this.browser;
    const changes = batch.changes || [
      ...(batch.updated || []).map((item) => ({ updated: item })),
      ...(batch.deleted || []).map((id) => ({ deleted: id }))];
    if (!changes.length) return;
    if (browser.pendingChanges) {
      browser.pendingChanges.push({ changes });
      return;
    }
    let touched = false;
    let tagsChanged = false;
    const index = new Map(browser.items.map((item, n) => [item.identifier, n]));
    const removed = new Set();
    for (const change of changes) {
      if (change.updated) {
        const item = change.updated;
        browser.remember(item);
        const at = index.get(item.identifier);
        if (item.tags && item.tags.length) browser.places.noteTags(item.tags);
        tagsChanged = true;
        if (browser.belongs(item)) {
          if (at !== undefined && !removed.has(item.identifier)) browser.items[at] = item;
          else {
            removed.delete(item.identifier);
            index.set(item.identifier, browser.items.length);
            browser.items.push(item);
          }
          touched = true;
        } else if (at !== undefined) {
          removed.add(item.identifier);
          touched = true;
        }
        if (browser.folderId === item.identifier && item.trashed) this.folderGone();
      } else if (change.deleted !== undefined) {
        const id = change.deleted;
        if (index.has(id)) { removed.add(id); touched = true; }
        if (browser.folderId === id) this.folderGone();
        tagsChanged = true;
      }
    }
    if (tagsChanged) browser.places.refreshSoon();
    if (browser.location.kind === 'search') {
      clearTimeout(this.reloadTimer);
      this.reloadTimer = setTimeout(() => browser.reload(), 300);
    }
    if (!touched) return;
    const focusedId = browser.items[browser.focus]?.identifier;
    const anchorId = browser.items[browser.anchor]?.identifier;
    if (removed.size) {
      browser.items = browser.items.filter((item) => !removed.has(item.identifier));
      for (const id of removed) browser.selection.delete(id);
    }
    browser.sortItems();
    browser.focus = browser.items.findIndex((item) => item.identifier === focusedId);
    browser.anchor = browser.items.findIndex((item) => item.identifier === anchorId);
    browser.render();
  }

  folderGone() {
    if (!isRoot(this.browser.folderId)) this.browser.folderGone();
  }
}
