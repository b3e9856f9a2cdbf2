// The browser's state and its view: where the user is, the items listed there, the selection,
// and the keyboard and mouse that act on them.
import { api, ROOT, ROOT_IDENTIFIER, isRoot } from './api.js';
import { $, el, show } from './dom.js';
import { compareItems, formatDate, formatSize, isFolder, kindOf, tagHue } from './format.js';
import { VirtualList } from './virtual-list.js';
import { Places } from './places.js';
import { Actions } from './actions.js';
import { Live } from './live.js';
import { Search } from './search.js';
import { ContextMenu } from './context-menu.js';

const PAGE_MARGIN = 100;  // fetch the next page when this close to the end of what is loaded

export function sameContainer(a, b) {
  return a === b || (isRoot(a) && isRoot(b));
}

export class Browser {
  constructor() {
    this.location = { kind: 'folder', id: ROOT };
    this.items = [];
    this.nextPage = null;
    this.loading = false;
    this.generation = 0;
    this.expected = 0;
    this.folderItem = null;
    this.sort = { key: 'name', direction: 'asc' };
    this.selection = new Set();
    this.anchor = -1;
    this.focus = -1;
    this.known = new Map();  // identifier -> item, for breadcrumbs and names
    this.mode = localStorage.getItem('tamber.view') === 'grid' ? 'grid' : 'list';
    this.list = new VirtualList($('view'), $('spacer'), {
      createRow: () => this.createRow(),
      updateRow: (node, item, index) => this.updateRow(node, item, index),
      onRangeShown: (first, last) => this.loadMoreIfNeeded(last),
    });
    this.places = new Places(this);
    this.actions = new Actions(this);
    this.live = new Live(this);
    this.search = new Search(this);
    this.menu = new ContextMenu(this);
    this.bind();
    this.applyMode();
  }

  async start() {
    await Promise.all([this.places.load(), this.openFolder(ROOT)]);
    this.live.start();
  }

  // ----- where the user is

  get folderId() {
    return this.location.kind === 'folder' ? this.location.id : null;
  }

  inRoot() {
    return this.location.kind === 'folder' && isRoot(this.location.id);
  }

  async openFolder(id) {
    this.location = { kind: 'folder', id };
    await this.reload({ keepScroll: false });
  }

  async openPlace(kind, value) {
    this.location = { kind, value };
    await this.reload({ keepScroll: false });
  }

  async openParent() {
    if (this.location.kind !== 'folder' || isRoot(this.location.id)) return;
    const item = this.folderItem || await api.item(this.location.id);
    const from = this.location.id;
    await this.openFolder(item.parentIdentifier);
    const index = this.items.findIndex((i) => i.identifier === from);
    if (index >= 0) this.setFocus(index, { select: true });
  }

  // Lists the location afresh; `keepScroll` keeps the selection and scroll position (a reset).
  async reload({ keepScroll = true } = {}) {
    const generation = ++this.generation;
    const scrollTop = $('view').scrollTop;
    if (!keepScroll) {
      this.selection.clear();
      this.anchor = -1;
      this.focus = -1;
      $('view').scrollTop = 0;
    }
    this.nextPage = null;
    this.folderItem = null;
    this.loading = true;
    // Changes that come while the listing is on its way are applied over it when it arrives:
    // the listing may predate them.
    this.pendingChanges = [];
    this.notice(null);
    this.updateChrome();
    let items = [];
    try {
      if (this.location.kind === 'folder') {
        const id = this.location.id;
        const [page, folder] = await Promise.all([api.children(id),
          isRoot(id) ? null : api.item(id)]);
        if (generation !== this.generation) return;
        this.folderItem = folder;
        if (folder) this.remember(folder);
        items = page.items;
        this.nextPage = page.nextPage;
        this.expected = folder && folder.childItemCount ? folder.childItemCount : 0;
      } else {
        const result = await api.search(this.searchParams());
        if (generation !== this.generation) return;
        items = result.items.filter((item) => this.belongs(item));
        this.expected = 0;
      }
    } catch (e) {
      if (generation !== this.generation) return;
      this.loading = false;
      this.pendingChanges = null;
      this.items = [];
      this.render();
      if (e.status === 404 && this.location.kind === 'folder') this.folderGone();
      else this.notice(e.message);
      return;
    }
    this.loading = false;
    this.items = items;
    for (const item of items) this.remember(item);
    const pending = this.pendingChanges;
    this.pendingChanges = null;
    for (const batch of pending) this.live.apply(batch);
    this.sortItems();
    this.updateChrome();
    this.render();
    if (keepScroll) $('view').scrollTop = scrollTop;
    await this.places.breadcrumbs();
  }

  searchParams() {
    const { kind, value } = this.location;
    if (kind === 'recents') return { recent: 'true', limit: '500' };
    if (kind === 'favourites') return { favorite: 'true', limit: '500' };
    if (kind === 'trash') return { trashed: 'true', limit: '1000' };
    if (kind === 'tag') return { tag: value, limit: '1000' };
    return this.search.params();
  }

  // Whether an item, as it is now, is listed where the user is.
  belongs(item) {
    const { kind, value } = this.location;
    if (kind === 'folder') return sameContainer(item.parentIdentifier, this.location.id) && !item.trashed;
    if (kind === 'trash') return item.trashed;
    if (item.trashed) return false;
    if (kind === 'recents') return !!item.lastUsedDate;
    if (kind === 'favourites') return item.favoriteRank !== null && item.favoriteRank !== undefined;
    if (kind === 'tag') return (item.tags || []).includes(value);
    return this.search.matches(item);
  }

  async loadMoreIfNeeded(lastShown) {
    if (this.loading || !this.nextPage || lastShown < this.items.length - PAGE_MARGIN) return;
    const generation = this.generation;
    this.loading = true;
    try {
      const page = await api.children(this.location.id, this.nextPage);
      if (generation !== this.generation) return;
      this.nextPage = page.nextPage;
      const seen = new Set(this.items.map((i) => i.identifier));
      const fresh = page.items.filter((i) => !seen.has(i.identifier));
      for (const item of fresh) this.remember(item);
      const compare = this.comparator();
      const inOrder = fresh.every((item, n) =>
        compare(n === 0 ? this.items[this.items.length - 1] : fresh[n - 1], item) <= 0);
      this.items.push(...fresh);
      // Pages usually come in the listing's own order; only then is appending enough.
      if (!inOrder || (this.items.length > fresh.length && fresh.length &&
        compare(this.items[this.items.length - fresh.length - 1], fresh[0]) > 0)) this.sortItems();
    } catch (e) {
      if (generation === this.generation) this.notice(e.message);
    } finally {
      if (generation === this.generation) {
        this.loading = false;
        this.render();
      }
    }
  }

  remember(item) {
    this.known.set(item.identifier, item);
  }

  // ----- order

  comparator() {
    if (this.location.kind === 'recents' && this.sort.explicit !== true) {
      return (a, b) => (b.lastUsedDate || '').localeCompare(a.lastUsedDate || '');
    }
    if (this.location.kind === 'favourites' && this.sort.explicit !== true) {
      return (a, b) => (a.favoriteRank ?? 0) - (b.favoriteRank ?? 0);
    }
    return compareItems(this.sort.key, this.sort.direction);
  }

  sortItems() {
    const compare = this.comparator();
    const a = this.items[0];
    let sorted = true;
    for (let i = 1; i < this.items.length && sorted; i += 1) {
      if (compare(this.items[i - 1], this.items[i]) > 0) sorted = false;
    }
    if (!sorted) this.items.sort(compare);
    return a;
  }

  setSort(key) {
    if (this.sort.key === key && this.sort.explicit) {
      this.sort.direction = this.sort.direction === 'asc' ? 'desc' : 'asc';
    } else {
      this.sort = { key, direction: 'asc', explicit: true };
    }
    this.sortItems();
    this.updateChrome();
    this.render();
  }

  // ----- the view

  applyMode() {
    $('view').classList.toggle('grid', this.mode === 'grid');
    $('columns').hidden = this.mode === 'grid';
    const toggle = $('view-toggle');
    toggle.textContent = this.mode === 'grid' ? '☰' : '▦';
    toggle.setAttribute('aria-label', this.mode === 'grid' ? 'List view' : 'Grid view');
    this.list.setMode(this.mode);
  }

  toggleMode() {
    this.mode = this.mode === 'grid' ? 'list' : 'grid';
    localStorage.setItem('tamber.view', this.mode);
    this.applyMode();
  }

  createRow() {
    const row = el('div', { class: 'row', role: 'row', draggable: 'true' },
      el('span', { class: 'icon', 'aria-hidden': 'true' }),
      el('span', { class: 'name', role: 'gridcell' }),
      el('span', { class: 'modified', role: 'gridcell' }),
      el('span', { class: 'size', role: 'gridcell' }),
      el('span', { class: 'kind', role: 'gridcell' }),
      el('span', { class: 'tags', role: 'gridcell' }));
    return row;
  }

  updateRow(row, item, index) {
    const [icon, name, modified, size, kind, tags] = row.children;
    const kindInfo = kindOf(item);
    row.id = `row-${index}`;
    row.dataset.id = item.identifier;
    row.dataset.kind = kindInfo.group;
    row.classList.toggle('folder', isFolder(item));
    row.title = item.path ? `${item.filename}\n${item.path}` : item.filename;
    icon.replaceChildren();
    const size_ = this.mode === 'grid' ? 128 : 32;
    if (kindInfo.group === 'image' || item.identifier.startsWith('#')) {
      const img = el('img', { alt: '', loading: 'lazy', decoding: 'async',
        src: api.thumbnailUrl(item.identifier, size_) });
      img.addEventListener('error', () => img.remove());
      icon.append(img);
    }
    // An editor open on this item survives a change event for it; on another item it goes.
    const editor = row.querySelector('.rename');
    if (editor && row.dataset.editing !== item.identifier) editor.remove();
    name.textContent = item.filename;
    if (item.favoriteRank !== null && item.favoriteRank !== undefined) {
      name.append(el('span', { class: 'star', text: '★', title: 'Favourite' }));
    }
    if (this.location.kind !== 'folder' && item.path) {
      const folder = item.path.split('/').slice(-2, -1)[0] || '';
      name.append(el('span', { class: 'where', text: folder }));
    }
    modified.textContent = formatDate(item.contentModificationDate);
    size.textContent = formatSize(item);
    kind.textContent = kindInfo.label;
    tags.replaceChildren(...(item.tags || []).map((label) =>
      el('span', { class: `tag hue-${tagHue(label, this.places.tagColours)}`, text: label })));
    this.paintSelection(row, index);
  }

  paintSelection(row, index) {
    const selected = this.selection.has(row.dataset.id);
    row.setAttribute('aria-selected', selected ? 'true' : 'false');
    row.classList.toggle('focused', index === this.focus);
  }

  render() {
    const total = this.nextPage ? Math.max(this.expected, this.items.length + 1) : this.items.length;
    this.list.setItems(this.items, total);
    this.list.refresh();
    this.list.renderNow();
    show($('empty'), !this.loading && this.items.length === 0 && !$('notice').textContent);
    this.status();
  }

  repaintSelection() {
    for (const [index, node] of this.list.nodes) this.paintSelection(node, index);
    const focusNode = this.list.nodeFor(this.focus);
    if (focusNode) $('view').setAttribute('aria-activedescendant', focusNode.id);
    else $('view').removeAttribute('aria-activedescendant');
    this.status();
  }

  status() {
    const count = this.nextPage ? `${this.items.length} of ${this.expected || 'many'}` : `${this.items.length}`;
    const selected = this.selection.size ? `, ${this.selection.size} selected` : '';
    for (const id of ['download', 'rename', 'tags', 'star', 'to-trash']) {
      $(id).disabled = this.selection.size === 0 || this.location.kind === 'trash';
    }
    $('status').textContent = `${count} item${this.items.length === 1 ? '' : 's'}${selected}`;
  }

  updateChrome() {
    const { kind } = this.location;
    show($('trash-bar'), kind === 'trash');
    show($('filters'), kind === 'search');
    const root = this.inRoot();
    const writable = kind === 'folder' && !root;
    for (const id of ['new-folder', 'upload']) {
      const button = $(id);
      button.disabled = !writable;
      button.title = root ? 'Nothing can be created directly here: open a folder or an app\'s library'
        : writable ? button.dataset.title || button.textContent : 'Only in a folder';
    }
    $('back').disabled = !(kind === 'folder' && !root);
    for (const button of document.querySelectorAll('#columns [data-sort]')) {
      const active = this.sort.explicit && button.dataset.sort === this.sort.key;
      button.setAttribute('aria-sort', active ? (this.sort.direction === 'asc' ? 'ascending' : 'descending') : 'none');
    }
    this.places.highlight();
  }

  notice(message, action) {
    const box = $('notice');
    box.replaceChildren();
    if (message) {
      box.append(el('span', { text: message }));
      if (action) box.append(el('button', { text: action.label, onclick: action.run }));
    }
    show(box, !!message);
  }

  folderGone() {
    const parent = this.folderItem ? this.folderItem.parentIdentifier : ROOT;
    this.notice('This folder no longer exists: it was deleted or moved away.',
      { label: 'Open its parent', run: () => this.openFolder(parent || ROOT) });
  }

  // ----- selection and focus

  selectedItems() {
    return this.items.filter((i) => this.selection.has(i.identifier));
  }

  setFocus(index, { select = false, extend = false, toggle = false } = {}) {
    if (this.items.length === 0) return;
    index = Math.max(0, Math.min(this.items.length - 1, index));
    this.focus = index;
    const id = this.items[index].identifier;
    if (extend && this.anchor >= 0) {
      this.selection.clear();
      const [from, to] = this.anchor < index ? [this.anchor, index] : [index, this.anchor];
      for (let i = from; i <= to; i += 1) this.selection.add(this.items[i].identifier);
    } else if (toggle) {
      if (this.selection.has(id)) this.selection.delete(id); else this.selection.add(id);
      this.anchor = index;
    } else if (select) {
      this.selection.clear();
      this.selection.add(id);
      this.anchor = index;
    }
    this.list.reveal(index);
    this.repaintSelection();
  }

  selectAll() {
    for (const item of this.items) this.selection.add(item.identifier);
    this.repaintSelection();
  }

  indexOfRow(node) {
    const row = node && node.closest && node.closest('.row');
    return row ? Number(row.dataset.index) : -1;
  }

  bind() {
    const view = $('view');
    view.addEventListener('click', (event) => {
      const index = this.indexOfRow(event.target);
      if (index < 0) {
        if (event.target === view || event.target === $('spacer')) {
          this.selection.clear();
          this.repaintSelection();
        }
        return;
      }
      if (event.target.closest('.rename')) return;
      this.setFocus(index, { select: !event.shiftKey && !(event.ctrlKey || event.metaKey),
        extend: event.shiftKey, toggle: event.ctrlKey || event.metaKey });
    });
    view.addEventListener('dblclick', (event) => {
      const index = this.indexOfRow(event.target);
      if (index >= 0 && !event.target.closest('.rename')) this.actions.open(this.items[index]);
    });
    view.addEventListener('keydown', (event) => this.onKey(event));
    document.addEventListener('keydown', (event) => this.onGlobalKey(event));
    $('back').addEventListener('click', () => this.openParent());
    $('view-toggle').addEventListener('click', () => this.toggleMode());
    for (const button of document.querySelectorAll('#columns [data-sort]')) {
      button.addEventListener('click', () => this.setSort(button.dataset.sort));
    }
    $('menu-toggle').addEventListener('click', () => document.body.classList.toggle('show-sidebar'));
  }

  onKey(event) {
    if (event.target.closest('.rename')) return;
    const ctrl = event.ctrlKey || event.metaKey;
    const columns = this.mode === 'grid' ? this.list.columns() : 1;
    const moves = {
      ArrowDown: columns, ArrowUp: -columns, PageDown: this.list.pageRows() * columns,
      PageUp: -this.list.pageRows() * columns,
    };
    if (this.mode === 'grid') Object.assign(moves, { ArrowRight: 1, ArrowLeft: -1 });
    if (event.key in moves && !event.altKey) {
      event.preventDefault();
      const from = this.focus < 0 ? (moves[event.key] > 0 ? -1 : this.items.length) : this.focus;
      this.setFocus(from + moves[event.key], { select: !ctrl && !event.shiftKey, extend: event.shiftKey });
      return;
    }
    if (event.key === 'Home' || event.key === 'End') {
      event.preventDefault();
      this.setFocus(event.key === 'Home' ? 0 : this.items.length - 1,
        { select: !event.shiftKey, extend: event.shiftKey });
      return;
    }
    if (event.key === ' ' && this.focus >= 0) {
      event.preventDefault();
      this.setFocus(this.focus, { toggle: true });
      return;
    }
    if (ctrl && event.key.toLowerCase() === 'a') {
      event.preventDefault();
      this.selectAll();
      return;
    }
    const item = this.items[this.focus];
    const handled = {
      Enter: () => item && this.actions.open(item),
      F2: () => item && this.actions.startRename(item),
      Delete: () => this.actions.trashSelected(),
      ContextMenu: () => item && this.menu.openFor(this.list.nodeFor(this.focus)),
    }[event.key];
    if (handled) {
      event.preventDefault();
      handled();
    } else if (event.key === 'F10' && event.shiftKey && item) {
      event.preventDefault();
      this.menu.openFor(this.list.nodeFor(this.focus));
    }
  }

  onGlobalKey(event) {
    const ctrl = event.ctrlKey || event.metaKey;
    const typing = event.target.matches('input, textarea, select') || event.target.isContentEditable;
    if (ctrl && event.key.toLowerCase() === 'f' || (!typing && event.key === '/')) {
      event.preventDefault();
      this.search.focus();
      return;
    }
    if (typing || $('dialog').open) return;
    if (ctrl && event.key.toLowerCase() === 'z') {
      event.preventDefault();
      this.actions.undo();
    } else if (event.key === 'Backspace' || (event.altKey && event.key === 'ArrowUp')) {
      event.preventDefault();
      this.openParent();
    } else if (event.key === 'Escape') {
      this.menu.close();
    }
  }
}

export { ROOT, ROOT_IDENTIFIER };
