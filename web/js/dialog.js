// The one modal dialog: a question with an optional text field. Resolves with the text (or
// true) on OK and null on Cancel or Escape.
import { $ } from './dom.js';

export function ask({ title, text = '', input = null, ok = 'OK', danger = false }) {
  const dialog = $('dialog');
  $('dialog-title').textContent = title;
  $('dialog-text').textContent = text;
  const field = $('dialog-input');
  field.hidden = input === null;
  field.value = input ?? '';
  field.setAttribute('aria-label', title);
  $('dialog-ok').textContent = ok;
  $('dialog-ok').classList.toggle('danger', danger);
  return new Promise((resolve) => {
    dialog.addEventListener('close', () => {
      if (dialog.returnValue !== 'ok') resolve(null);
      else resolve(input === null ? true : field.value);
    }, { once: true });
    dialog.returnValue = '';
    dialog.showModal();
    if (input !== null) field.select(); else $('dialog-ok').focus();
  });
}
