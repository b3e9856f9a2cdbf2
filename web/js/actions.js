// What the user can do to items, from the toolbar, the context menu and the keyboard alike.
import { api, isRoot, ROOT, WRITE_REFUSED } from './api.js';
import { $, el } from './dom.js';
import { isFolder } from './format.js';
import { ask } from './dialog.js';
import { Uploads } from './uploads.js';

const ITEMS_TYPE = 'application/x-tamber-items';
export const ROOT_REFUSAL = 'Nothing can be created or moved directly into Documents: ' +
  'choose a folder in it or an app\'s library';

export class Actions {
  constructor(browser) {
    this.browser = browser;
    this.lastUndoable = null;
    this.uploads = new Uploads(browser);
    $('new-folder').dataset.title = 'New folder';
    $('upload').dataset.title = 'Upload files';
    $('new-folder').addEventListener('click', () => this.newFolder());
    $('upload').addEventListener('click', () => $('upload-input').click());
    $('upload-input').addEventListener('change', (event) => {
      this.uploads.send([...event.target.files], this.browser.folderId);
      event.target.value = '';
    });
    $('put-back').addEventListener('click', () => this.putBack());
    $('delete-forever').addEventListener('click', () => this.deleteForever());
    $('empty-trash').addEventListener('click', () => this.emptyTrash());
    const first = () => this.browser.selectedItems()[0];
    $('download').addEventListener('click', () => first() && this.open(first()));
    $('rename').addEventListener('click', () => first() && this.startRename(first()));
    $('tags').addEventListener('click', () => this.editTags());
    $('star').addEventListener('click', () => this.toggleFavourite());
    $('to-trash').addEventListener('click', () => this.trashSelected());
    this.bindDrag();
  }

  report(error) {
    this.browser.notice(error.message || String(error));
  }

  open(item) {
    if (isFolder(item)) this.browser.openFolder(item.identifier);
    else this.download(item);
  }

  download(item) {
    const link = el('a', { href: api.contentUrl(item.identifier), download: item.filename });
    document.body.append(link);
    link.click();
    link.remove();
  }

  async newFolder() {
    const parent = this.browser.folderId;
    if (!parent || isRoot(parent)) return this.report(new Error(ROOT_REFUSAL));
    try {
      const folder = await api.newFolder(parent, 'untitled folder');
      this.browser.live.apply({ changes: [{ updated: folder }] });
      const index = this.browser.items.findIndex((i) => i.identifier === folder.identifier);
      if (index >= 0) {
        this.browser.setFocus(index, { select: true });
        this.startRename(this.browser.items[index]);
      }
    } catch (e) {
      this.report(e);
    }
  }

  // Rename in place: an editor over the name; Enter saves, Escape keeps the old name. A refused
  // name is shown beside the editor, which stays open.
  startRename(item) {
    const index = this.browser.items.indexOf(item);
    if (index < 0) return;
    this.browser.list.reveal(index);
    const row = this.browser.list.nodeFor(index);
    if (!row) return;
    const name = row.querySelector('.name');
    const editor = el('span', { class: 'rename' });
    const input = el('input', { value: item.filename, 'aria-label': `New name for ${item.filename}` });
    const error = el('span', { class: 'rename-error', role: 'alert' });
    editor.append(input, error);
    row.append(editor);
    row.dataset.editing = item.identifier;
    input.focus();
    const dot = item.filename.lastIndexOf('.');
    input.setSelectionRange(0, dot > 0 && !isFolder(item) ? dot : item.filename.length);
    let busy = false;
    const finish = () => {
      editor.remove();
      if (row.dataset.editing === item.identifier) delete row.dataset.editing;
      $('view').focus();
    };
    input.addEventListener('keydown', async (event) => {
      event.stopPropagation();
      if (event.key === 'Escape') finish();
      if (event.key !== 'Enter' || busy) return;
      const wanted = input.value;
      if (wanted === item.filename || wanted === '') return finish();
      busy = true;
      try {
        const renamed = await api.patch(item.identifier, { filename: wanted });
        this.lastUndoable = { kind: 'rename', id: item.identifier, filename: item.filename };
        finish();
        this.browser.live.apply({ changes: [{ updated: renamed }] });
      } catch (e) {
        error.textContent = e.message;
        name.textContent = item.filename;
      } finally {
        busy = false;
      }
    });
    input.addEventListener('blur', () => { if (!error.textContent) setTimeout(finish, 0); });
    name.textContent = item.filename;
  }

  async move(ids, target) {
    if (target === 'trash') return this.trash(ids);
    if (isRoot(target)) return this.report(new Error(ROOT_REFUSAL));
    const moved = [];
    for (const id of ids) {
      if (id === target) continue;
      const item = this.browser.known.get(id);
      try {
        const result = await api.patch(id, { parentIdentifier: target });
        moved.push({ id, from: item ? item.parentIdentifier : null });
        this.browser.live.apply({ changes: [{ updated: result }] });
      } catch (e) {
        this.report(e);
        break;
      }
    }
    if (moved.length) this.lastUndoable = { kind: 'move', moved };
  }

  async trash(ids) {
    for (const id of ids) {
      try {
        const result = await api.patch(id, { trashed: true });
        this.browser.live.apply({ changes: [{ updated: result }] });
      } catch (e) {
        return this.report(e);
      }
    }
    this.browser.places.refreshSoon();
  }

  trashSelected() {
    const ids = [...this.browser.selection];
    if (this.browser.location.kind === 'trash') return this.deleteForever();
    if (ids.length) this.trash(ids);
  }

  async putBack() {
    for (const id of [...this.browser.selection]) {
      try {
        const result = await api.patch(id, { trashed: false });
        this.browser.live.apply({ changes: [{ updated: result }] });
      } catch (e) {
        return this.report(e);
      }
    }
  }

  async deleteForever(ids = [...this.browser.selection]) {
    if (!ids.length) return;
    const sure = await ask({ title: `Delete ${ids.length === 1 ? 'this item' : `${ids.length} items`} forever?`,
      text: 'This cannot be undone.', ok: 'Delete Forever', danger: true });
    if (!sure) return;
    await this.removeAll(ids);
  }

  async removeAll(ids) {
    for (const id of ids) {
      try {
        await api.remove(id);
        this.browser.live.apply({ changes: [{ deleted: id }] });
      } catch (e) {
        if (e.status !== 404) return this.report(e);
      }
    }
  }

  async emptyTrash() {
    const trashed = await api.search({ trashed: 'true', limit: '1000' });
    const ids = trashed.items.filter((i) => i.trashed).map((i) => i.identifier);
    if (!ids.length) return;
    const sure = await ask({ title: 'Empty the Trash?',
      text: `${ids.length} item${ids.length === 1 ? '' : 's'} will be deleted forever.`,
      ok: 'Empty Trash', danger: true });
    if (!sure) return;
    await this.removeAll(ids);
  }

  async editTags(items = this.browser.selectedItems()) {
    if (!items.length) return;
    const current = [...new Set(items.flatMap((i) => i.tags || []))];
    const answer = await ask({ title: 'Tags', text: 'Comma-separated; add “:N” (1–7) to a tag to choose its colour.',
      input: current.join(', ') });
    if (answer === null) return;
    const labels = [];
    for (const part of answer.split(',')) {
      const match = part.trim().match(/^(.*?)(?::([1-7]))?$/);
      const label = match[1].trim();
      if (!label) continue;
      if (match[2]) this.browser.places.setTagColour(label, Number(match[2]));
      if (!labels.includes(label)) labels.push(label);
    }
    for (const item of items) {
      try {
        const result = await api.patch(item.identifier, { tags: labels });
        this.browser.live.apply({ changes: [{ updated: result }] });
      } catch (e) {
        return this.report(e);
      }
    }
    this.browser.places.refreshSoon();
  }

  async toggleFavourite(items = this.browser.selectedItems()) {
    if (!items.length) return;
    const star = items.some((i) => i.favoriteRank === null || i.favoriteRank === undefined);
    for (const item of items) {
      try {
        const result = await api.patch(item.identifier, { favoriteRank: star ? Math.floor(Date.now() / 1000) : null });
        this.browser.live.apply({ changes: [{ updated: result }] });
      } catch (e) {
        return this.report(e);
      }
    }
  }

  // Reverses the last move or rename, where the provider can.
  async undo() {
    const last = this.lastUndoable;
    if (!last) return;
    this.lastUndoable = null;
    try {
      if (last.kind === 'rename') {
        const result = await api.patch(last.id, { filename: last.filename });
        this.browser.live.apply({ changes: [{ updated: result }] });
      } else {
        for (const { id, from } of last.moved) {
          if (!from) continue;
          const result = await api.patch(id, { parentIdentifier: isRoot(from) ? ROOT : from });
          this.browser.live.apply({ changes: [{ updated: result }] });
        }
      }
      this.browser.notice(null);
    } catch (e) {
      this.report(e);
    }
  }

  // ----- drag and drop

  bindDrag() {
    const view = $('view');
    view.addEventListener('dragstart', (event) => {
      const index = this.browser.indexOfRow(event.target);
      if (index < 0) return;
      const item = this.browser.items[index];
      if (!this.browser.selection.has(item.identifier)) this.browser.setFocus(index, { select: true });
      event.dataTransfer.setData(ITEMS_TYPE, JSON.stringify([...this.browser.selection]));
      event.dataTransfer.effectAllowed = 'move';
    });
    // Rows that are folders take items; the view itself takes files from the desktop.
    view.addEventListener('dragover', (event) => {
      const target = this.rowFolder(event.target);
      if (target) return this.overTarget(event, target.identifier, event.target.closest('.row'));
      if (event.dataTransfer.types.includes('Files')) {
        const folder = this.browser.folderId;
        if (folder && !isRoot(folder)) event.preventDefault();
      }
    });
    view.addEventListener('dragleave', (event) => {
      const row = event.target.closest && event.target.closest('.row');
      if (row) row.classList.remove('drop-target');
    });
    view.addEventListener('drop', (event) => {
      const row = event.target.closest && event.target.closest('.row');
      if (row) row.classList.remove('drop-target');
      const target = this.rowFolder(event.target);
      if (target) return this.dropOn(event, target.identifier);
      if (event.dataTransfer.files.length && this.browser.folderId && !isRoot(this.browser.folderId)) {
        event.preventDefault();
        this.uploads.send([...event.dataTransfer.files], this.browser.folderId);
      }
    });
  }

  rowFolder(node) {
    const index = this.browser.indexOfRow(node);
    const item = index >= 0 ? this.browser.items[index] : null;
    return item && isFolder(item) && !this.browser.selection.has(item.identifier) ? item : null;
  }

  overTarget(event, target, node) {
    const dragged = event.dataTransfer.types.includes(ITEMS_TYPE);
    if (!dragged) return;
    if (isRoot(target)) {
      // Refused before any request: say why where the pointer is.
      node.title = ROOT_REFUSAL;
      event.dataTransfer.dropEffect = 'none';
      return;
    }
    event.preventDefault();
    event.dataTransfer.dropEffect = 'move';
    node.classList.add('drop-target');
  }

  dropOn(event, target) {
    const data = event.dataTransfer.getData(ITEMS_TYPE);
    if (!data) return;
    event.preventDefault();
    if (isRoot(target)) return this.report(new Error(ROOT_REFUSAL));
    this.move(JSON.parse(data), target);
  }

  // Makes a sidebar entry or a breadcrumb take dropped items.
  dropTarget(node, targetOf) {
    node.addEventListener('dragover', (event) => this.overTarget(event, targetOf(), node));
    node.addEventListener('dragleave', () => node.classList.remove('drop-target'));
    node.addEventListener('drop', (event) => {
      node.classList.remove('drop-target');
      this.dropOn(event, targetOf());
    });
  }
}

export { WRITE_REFUSED };
