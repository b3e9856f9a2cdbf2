// The sidebar of places and the breadcrumbs: where the user can go, and where items can be
// dropped.
import { api, ROOT, isRoot } from './api.js';
import { $, el } from './dom.js';
import { tagHue } from './format.js';

export class Places {
  constructor(browser) {
    this.browser = browser;
    this.libraries = [];
    this.tags = [];
    this.tagColours = JSON.parse(localStorage.getItem('tamber.tagColours') || '{}');
    this.refreshTimer = 0;
  }

  async load() {
    try {
      const apps = await api.apps();
      this.libraries = apps.libraries || [];
    } catch (e) {
      this.libraries = [];
    }
    this.draw();
    await this.loadTags();
    this.draw();
  }

  async loadTags() {
    try {
      const all = await api.search({ limit: '1000' });
      const tags = new Set();
      for (const item of all.items) for (const tag of item.tags || []) tags.add(tag);
      this.tags = [...tags].sort((a, b) => a.localeCompare(b));
    } catch (e) {
      this.tags = [];
    }
  }

  // A tag just set shows at once; the index, which may lag, confirms it later.
  noteTags(labels) {
    const fresh = labels.filter((label) => !this.tags.includes(label));
    if (!fresh.length) return;
    this.tags = [...this.tags, ...fresh].sort((a, b) => a.localeCompare(b));
    this.draw();
  }

  // Tags come and go with the items: look again a moment after changes settle.
  refreshSoon() {
    clearTimeout(this.refreshTimer);
    this.refreshTimer = setTimeout(async () => { await this.loadTags(); this.draw(); }, 300);
  }

  setTagColour(label, hue) {
    this.tagColours[label] = hue;
    localStorage.setItem('tamber.tagColours', JSON.stringify(this.tagColours));
    this.draw();
    this.browser.list.refresh();
  }

  place(label, kind, value, extra = {}) {
    const item = el('li', { role: 'treeitem', tabindex: '-1', class: `place place-${kind}`,
      dataset: { kind, value: value ?? '' }, title: extra.title || label, 'aria-selected': 'false' });
    if (extra.icon) item.append(extra.icon);
    else item.append(el('span', { class: `place-icon icon-${kind}`, 'aria-hidden': 'true' }));
    item.append(el('span', { class: 'label', text: label }));
    item.addEventListener('click', () => this.go(kind, value));
    item.addEventListener('keydown', (event) => {
      if (event.key === 'Enter' || event.key === ' ') {
        event.preventDefault();
        this.go(kind, value);
      } else if (event.key === 'ArrowDown' || event.key === 'ArrowUp') {
        event.preventDefault();
        const all = [...document.querySelectorAll('#places [role=treeitem]')];
        const next = all[all.indexOf(item) + (event.key === 'ArrowDown' ? 1 : -1)];
        if (next) next.focus();
      }
    });
    if (kind === 'folder') this.browser.actions.dropTarget(item, () => value);
    if (kind === 'trash') this.browser.actions.dropTarget(item, () => 'trash');
    return item;
  }

  go(kind, value) {
    document.body.classList.remove('show-sidebar');
    this.browser.search.clear();
    if (kind === 'folder') this.browser.openFolder(value);
    else this.browser.openPlace(kind, value);
  }

  draw() {
    const list = $('places');
    const entries = [this.place('Documents', 'folder', ROOT, {
      title: 'Documents: the document storage and every app\'s library' })];
    for (const library of this.libraries) {
      const icon = el('img', { class: 'place-icon', alt: '', src: api.thumbnailUrl(library.identifier, 32) });
      icon.addEventListener('error', () => icon.replaceWith(el('span', { class: 'place-icon icon-app' })));
      entries.push(this.place(library.name, 'folder', library.identifier,
        { icon, title: `${library.name}\n${library.root || ''}` }));
    }
    entries.push(this.place('Recents', 'recents'));
    entries.push(this.place('Favourites', 'favourites'));
    const tagGroup = el('li', { role: 'treeitem', 'aria-expanded': 'true', class: 'group' },
      el('span', { class: 'group-label', text: 'Tags' }));
    const tagList = el('ul', { role: 'group' });
    for (const tag of this.tags) {
      const dot = el('span', { class: `place-icon dot hue-${tagHue(tag, this.tagColours)}`, 'aria-hidden': 'true' });
      tagList.append(this.place(tag, 'tag', tag, { icon: dot }));
    }
    tagGroup.append(tagList);
    entries.push(tagGroup);
    entries.push(this.place('Trash', 'trash'));
    list.replaceChildren(...entries);
    const first = list.querySelector('[role=treeitem]');
    if (first) first.tabIndex = 0;
    this.highlight();
    const tagFilter = $('filter-tag');
    const chosen = tagFilter.value;
    tagFilter.replaceChildren(el('option', { value: '', text: 'Any' }),
      ...this.tags.map((t) => el('option', { value: t, text: t })));
    tagFilter.value = this.tags.includes(chosen) ? chosen : '';
  }

  highlight() {
    const { kind, id, value } = this.browser.location;
    for (const node of document.querySelectorAll('#places .place')) {
      const current = node.dataset.kind === kind &&
        (kind === 'folder' ? (node.dataset.value === id || (isRoot(id) && isRoot(node.dataset.value)))
          : kind !== 'tag' || node.dataset.value === value);
      node.setAttribute('aria-selected', current ? 'true' : 'false');
    }
  }

  // The path from the root to the open folder, each step a button and a drop target.
  async breadcrumbs() {
    const browser = this.browser;
    const crumbs = $('crumbs');
    const { kind, id, value } = browser.location;
    const steps = [];
    if (kind === 'folder') {
      let current = id;
      let guard = 0;
      while (!isRoot(current) && guard < 64) {
        let item = browser.known.get(current);
        if (!item) {
          try { item = await api.item(current); } catch (e) { break; }
          browser.remember(item);
        }
        steps.unshift({ id: current, name: item.filename, path: item.path });
        current = item.parentIdentifier;
        guard += 1;
      }
      steps.unshift({ id: ROOT, name: 'Documents' });
    } else {
      const names = { recents: 'Recents', favourites: 'Favourites', trash: 'Trash', search: 'Search' };
      steps.push({ name: kind === 'tag' ? `Tag: ${value}` : names[kind] });
    }
    const nodes = [];
    steps.forEach((step, n) => {
      if (n > 0) nodes.push(el('span', { class: 'separator', 'aria-hidden': 'true', text: '›' }));
      const last = n === steps.length - 1;
      const button = el('button', { class: 'crumb', text: step.name, title: step.path || step.name,
        'aria-current': last ? 'location' : undefined });
      if (step.id !== undefined) {
        button.addEventListener('click', () => browser.openFolder(step.id));
        browser.actions.dropTarget(button, () => step.id);
      }
      nodes.push(button);
    });
    crumbs.replaceChildren(...nodes);
  }
}
