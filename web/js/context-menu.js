// The context menu of the listed items: the same actions as the toolbar and the keys.
import { isRoot } from './api.js';
import { $, el } from './dom.js';
import { isFolder } from './format.js';

export class ContextMenu {
  constructor(browser) {
    this.browser = browser;
    const view = $('view');
    view.addEventListener('contextmenu', (event) => {
      const index = browser.indexOfRow(event.target);
      event.preventDefault();
      if (index >= 0 && !browser.selection.has(browser.items[index].identifier)) {
        browser.setFocus(index, { select: true });
      }
      this.open(event.clientX, event.clientY);
    });
    document.addEventListener('click', (event) => {
      if (!event.target.closest('#context-menu')) this.close();
    });
    $('context-menu').addEventListener('keydown', (event) => this.onKey(event));
  }

  entries() {
    const b = this.browser;
    const a = b.actions;
    const selected = b.selectedItems();
    const one = selected.length === 1 ? selected[0] : null;
    const inTrash = b.location.kind === 'trash';
    const rootRefusal = b.inRoot();
    const list = [];
    if (inTrash) {
      if (selected.length) {
        list.push(['Put Back', () => a.putBack()]);
        list.push(['Delete Forever', () => a.deleteForever()]);
      }
      list.push(['Empty Trash', () => a.emptyTrash()]);
      return list;
    }
    if (one) list.push([isFolder(one) ? 'Open' : 'Download', () => a.open(one)]);
    if (one) list.push(['Rename…', () => a.startRename(one)]);
    if (selected.length) {
      list.push(['Tags…', () => a.editTags()]);
      const starred = selected.every((i) => i.favoriteRank !== null && i.favoriteRank !== undefined);
      list.push([starred ? 'Remove from Favourites' : 'Add to Favourites', () => a.toggleFavourite()]);
      list.push(['Move to Trash', () => a.trashSelected()]);
    }
    if (b.location.kind === 'folder') {
      list.push(['New Folder', () => a.newFolder(), rootRefusal && 'Nothing can be created directly in Documents']);
    }
    if (a.lastUndoable) list.push(['Undo', () => a.undo()]);
    return list;
  }

  open(x, y) {
    const menu = $('context-menu');
    const items = this.entries().map(([label, run, refusal]) => {
      const entry = el('li', { role: 'menuitem', tabindex: '-1', text: label,
        'aria-disabled': refusal ? 'true' : undefined, title: refusal || undefined });
      entry.addEventListener('click', () => {
        if (refusal) return;
        this.close();
        run();
      });
      return entry;
    });
    menu.replaceChildren(...items);
    menu.hidden = false;
    const width = menu.offsetWidth, height = menu.offsetHeight;
    menu.style.left = `${Math.max(0, Math.min(x, innerWidth - width))}px`;
    menu.style.top = `${Math.max(0, Math.min(y, innerHeight - height))}px`;
    if (items[0]) items[0].focus();
  }

  openFor(row) {
    if (!row) return;
    const box = row.getBoundingClientRect();
    this.open(box.left + 40, box.bottom);
  }

  close() {
    const menu = $('context-menu');
    if (menu.hidden) return;
    menu.hidden = true;
    $('view').focus();
  }

  onKey(event) {
    const entries = [...$('context-menu').children];
    const at = entries.indexOf(document.activeElement);
    if (event.key === 'ArrowDown' || event.key === 'ArrowUp') {
      event.preventDefault();
      const next = entries[(at + (event.key === 'ArrowDown' ? 1 : -1) + entries.length) % entries.length];
      if (next) next.focus();
    } else if (event.key === 'Enter' || event.key === ' ') {
      event.preventDefault();
      if (entries[at]) entries[at].click();
    } else if (event.key === 'Escape') {
      event.preventDefault();
      this.close();
    }
  }
}

export { isRoot };
