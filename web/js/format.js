// How values of an item are shown.
export function isFolder(item) {
  return item.typeIdentifier === 'public.folder' || item.childItemCount !== null &&
    item.childItemCount !== undefined && item.documentSize === null;
}

const KINDS = [
  [/^public\.folder$/, 'Folder', 'folder'],
  [/pdf/, 'PDF document', 'pdf'],
  [/png|jpeg|jpg|gif|tiff|heic|webp|image|bmp|svg/, 'Image', 'image'],
  [/plain-text|text|markdown|source|json|xml|csv/, 'Text', 'text'],
  [/document|rtf|word|spreadsheet|presentation|opendocument|office/, 'Document', 'document'],
];

export function kindOf(item) {
  const type = item.typeIdentifier || '';
  for (const [pattern, label, group] of KINDS) if (pattern.test(type)) return { label, group };
  return { label: isFolder(item) ? 'Folder' : 'Document', group: isFolder(item) ? 'folder' : 'document' };
}

export function formatSize(item) {
  if (isFolder(item)) {
    const n = item.childItemCount;
    return n === null || n === undefined ? '' : `${n} item${n === 1 ? '' : 's'}`;
  }
  let size = item.documentSize;
  if (size === null || size === undefined) return '';
  const units = ['bytes', 'KB', 'MB', 'GB', 'TB'];
  let unit = 0;
  while (size >= 1000 && unit < units.length - 1) { size /= 1000; unit += 1; }
  if (unit === 0) return `${size} byte${size === 1 ? "" : "s"}`;
  return `${size.toFixed(size < 10 ? 1 : 0)} ${units[unit]}`;
}

const dateFormat = new Intl.DateTimeFormat(undefined, { dateStyle: 'medium', timeStyle: 'short' });
export function formatDate(text) {
  if (!text) return '';
  const date = new Date(text);
  return Number.isNaN(date.getTime()) ? '' : dateFormat.format(date);
}

// A stable colour for a tag that has none of its own: one of eight hues, by its label.
export function tagHue(label, colours) {
  if (colours && colours[label] !== undefined) return colours[label];
  let h = 0;
  for (const ch of label) h = (h * 31 + ch.codePointAt(0)) >>> 0;
  return (h % 7) + 1;
}

export function compareItems(key, direction) {
  const sign = direction === 'desc' ? -1 : 1;
  const collator = new Intl.Collator(undefined, { numeric: true, sensitivity: 'base' });
  const value = {
    name: (i) => i.filename || '',
    modified: (i) => i.contentModificationDate || '',
    size: (i) => (isFolder(i) ? (i.childItemCount || 0) : (i.documentSize || 0)),
    kind: (i) => kindOf(i).label,
  }[key] || ((i) => i.filename || '');
  return (a, b) => {
    const fa = isFolder(a), fb = isFolder(b);
    if (fa !== fb) return fa ? -1 : 1;  // folders first, whatever the order
    const va = value(a), vb = value(b);
    let c = typeof va === 'number' ? va - vb : collator.compare(va, vb);
    if (c === 0) c = collator.compare(a.filename || '', b.filename || '');
    return c * sign;
  };
}
