// Uploads, one request per file so that each has its own progress bar; the server gives a
// taken name the next free "name 2.ext" and leaves no partial file when one fails.
import { api, isRoot } from './api.js';
import { $, el } from './dom.js';

export class Uploads {
  constructor(browser) {
    this.browser = browser;
  }

  send(files, folder) {
    if (!folder || isRoot(folder)) return;
    for (const file of files) this.sendOne(file, folder);
  }

  sendOne(file, folder) {
    const bar = el('progress', { max: '100', value: '0', 'aria-label': `Uploading ${file.name}` });
    const label = el('span', { class: 'upload-name', text: file.name, title: file.name });
    const state = el('span', { class: 'upload-state', text: '' });
    const entry = el('div', { class: 'upload' }, label, bar, state);
    $('uploads').append(entry);
    const body = new FormData();
    body.append('file', file, file.name);
    const request = new XMLHttpRequest();
    request.open('POST', api.uploadUrl(folder));
    request.upload.addEventListener('progress', (event) => {
      if (event.lengthComputable) bar.value = Math.round((event.loaded / event.total) * 100);
    });
    request.addEventListener('load', () => {
      if (request.status >= 200 && request.status < 300) {
        bar.value = 100;
        state.textContent = 'done';
        entry.classList.add('done');
        try {
          const reply = JSON.parse(request.responseText);
          const items = reply.items || (reply.identifier ? [reply] : []);
          this.browser.live.apply({ changes: items.map((item) => ({ updated: item })) });
        } catch (e) { /* the change events bring it anyway */ }
        setTimeout(() => entry.remove(), 4000);
      } else {
        let message = `failed (${request.status})`;
        try { message = JSON.parse(request.responseText).error.message; } catch (e) { /* keep */ }
        state.textContent = message;
        entry.classList.add('failed');
      }
    });
    request.addEventListener('error', () => {
      state.textContent = 'the server cannot be reached';
      entry.classList.add('failed');
    });
    request.send(body);
  }
}
