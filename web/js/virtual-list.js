// A virtualised list or grid: the DOM holds only the rows on screen plus a margin, positioned
// inside a spacer as tall as every row together, so a folder of 100,000 entries costs no more
// to show than one of 50.
const MARGIN_ROWS = 10;

export class VirtualList {
  constructor(scroller, spacer, { createRow, updateRow, onRangeShown }) {
    this.scroller = scroller;
    this.spacer = spacer;
    this.createRow = createRow;
    this.updateRow = updateRow;
    this.onRangeShown = onRangeShown;
    this.items = [];
    this.total = 0;
    this.mode = 'list';
    this.nodes = new Map();  // index -> row element
    this.frame = 0;
    scroller.addEventListener('scroll', () => this.schedule());
    new ResizeObserver(() => this.schedule()).observe(scroller);
  }

  setMode(mode) {
    this.mode = mode;
    this.clear();
    this.schedule();
  }

  // `total` may exceed items.length while later pages are still to come.
  setItems(items, total = items.length) {
    this.items = items;
    this.total = Math.max(total, items.length);
    this.schedule();
  }

  clear() {
    for (const node of this.nodes.values()) node.remove();
    this.nodes.clear();
  }

  refresh() {
    for (const node of this.nodes.values()) node.dataset.stale = '1';
    this.schedule();
  }

  metrics() {
    const style = getComputedStyle(this.scroller);
    if (this.mode === 'grid') {
      const cell = parseFloat(style.getPropertyValue('--cell-size')) || 120;
      const columns = Math.max(1, Math.floor(this.scroller.clientWidth / cell));
      return { rowHeight: cell, columns, cellWidth: this.scroller.clientWidth / columns };
    }
    const rowHeight = parseFloat(style.getPropertyValue('--row-height')) || 32;
    return { rowHeight, columns: 1, cellWidth: 0 };
  }

  schedule() {
    if (this.frame) return;
    this.frame = requestAnimationFrame(() => { this.frame = 0; this.render(); });
  }

  renderNow() {
    if (this.frame) cancelAnimationFrame(this.frame);
    this.frame = 0;
    this.render();
  }

  render() {
    const { rowHeight, columns, cellWidth } = this.metrics();
    const rows = Math.ceil(this.total / columns);
    this.spacer.style.height = `${rows * rowHeight}px`;
    const top = this.scroller.scrollTop;
    const height = this.scroller.clientHeight || 600;
    const firstRow = Math.max(0, Math.floor(top / rowHeight) - MARGIN_ROWS);
    const lastRow = Math.min(rows - 1, Math.ceil((top + height) / rowHeight) + MARGIN_ROWS);
    const first = firstRow * columns;
    const last = Math.min(this.total - 1, (lastRow + 1) * columns - 1);
    for (const [index, node] of this.nodes) {
      if (index < first || index > last || index >= this.items.length) {
        node.remove();
        this.nodes.delete(index);
      }
    }
    for (let index = first; index <= last && index < this.items.length; index += 1) {
      const item = this.items[index];
      let node = this.nodes.get(index);
      if (!node) {
        node = this.createRow();
        this.nodes.set(index, node);
        this.spacer.append(node);
      }
      if (node.item !== item || node.dataset.stale) {
        node.item = item;
        delete node.dataset.stale;
        this.updateRow(node, item, index);
      }
      node.dataset.index = String(index);
      const row = Math.floor(index / columns);
      const column = index % columns;
      node.style.transform = `translate(${column * cellWidth}px, ${row * rowHeight}px)`;
      if (this.mode === 'grid') node.style.width = `${cellWidth}px`;
      else node.style.width = '';
    }
    if (this.onRangeShown) this.onRangeShown(first, last);
  }

  nodeFor(index) {
    return this.nodes.get(index);
  }

  // Scrolls just enough to bring the index into view.
  reveal(index) {
    const { rowHeight, columns } = this.metrics();
    const y = Math.floor(index / columns) * rowHeight;
    const { scrollTop, clientHeight } = this.scroller;
    if (y < scrollTop) this.scroller.scrollTop = y;
    else if (y + rowHeight > scrollTop + clientHeight) this.scroller.scrollTop = y + rowHeight - clientHeight;
    this.renderNow();
  }

  columns() {
    return this.metrics().columns;
  }

  pageRows() {
    const { rowHeight } = this.metrics();
    return Math.max(1, Math.floor(this.scroller.clientHeight / rowHeight) - 1);
  }
}
