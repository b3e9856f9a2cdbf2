// The search field and its filters: queries the server's index as the user types (debounced),
// and narrows the results by kind on the page.
import { $ } from './dom.js';
import { kindOf } from './format.js';

const DEBOUNCE_MS = 200;

export class Search {
  constructor(browser) {
    this.browser = browser;
    this.timer = 0;
    this.previous = null;
    const field = $('search');
    field.addEventListener('input', () => this.schedule());
    field.addEventListener('keydown', (event) => {
      if (event.key === 'Escape') {
        this.clear();
        this.leave();
      } else if (event.key === 'Enter' || event.key === 'ArrowDown') {
        event.preventDefault();
        this.run();
        $('view').focus();
      }
    });
    for (const id of ['filter-kind', 'filter-tag', 'filter-favourite']) {
      $(id).addEventListener('change', () => this.run());
    }
  }

  focus() {
    $('search').focus();
    $('search').select();
  }

  clear() {
    $('search').value = '';
    clearTimeout(this.timer);
  }

  leave() {
    if (this.browser.location.kind !== 'search') return;
    const back = this.previous || { kind: 'folder', id: 'root' };
    this.previous = null;
    if (back.kind === 'folder') this.browser.openFolder(back.id);
    else this.browser.openPlace(back.kind, back.value);
  }

  schedule() {
    clearTimeout(this.timer);
    this.timer = setTimeout(() => this.run(), DEBOUNCE_MS);
  }

  run() {
    const query = $('search').value.trim();
    const filtered = $('filter-kind').value || $('filter-tag').value || $('filter-favourite').checked;
    if (!query && !filtered) return this.leave();
    if (this.browser.location.kind !== 'search') this.previous = this.browser.location;
    this.browser.openPlace('search', query);
  }

  params() {
    const params = { q: $('search').value.trim(), limit: '500' };
    if ($('filter-tag').value) params.tag = $('filter-tag').value;
    if ($('filter-favourite').checked) params.favorite = 'true';
    return params;
  }

  // The kind filter is applied here, over the kinds the page shows.
  matches(item) {
    const kind = $('filter-kind').value;
    if (kind && kindOf(item).group !== kind) return false;
    const tag = $('filter-tag').value;
    if (tag && !(item.tags || []).includes(tag)) return false;
    if ($('filter-favourite').checked && (item.favoriteRank === null || item.favoriteRank === undefined)) return false;
    const query = $('search').value.trim().toLowerCase();
    return !query || (item.filename || '').toLowerCase().includes(query);
  }
}
