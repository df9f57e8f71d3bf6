// A tiny helper for building DOM trees in code, without a framework.
//
//   h('button', { class: 'primary', onclick: save, disabled: busy }, 'Save')
//
// Props: "class", "style" (text), "dataset" (object), event handlers as
// on<event> functions, boolean attributes (true sets, false/null/undefined
// leaves out), everything else as an attribute text. Children: nodes, texts,
// numbers; null, undefined and false are skipped; arrays are flattened.
// Texts always become text nodes, so nothing a server sends is parsed as HTML.

export type Child = Node | string | number | null | undefined | false | Child[];

export type Props = Record<string, unknown>;

export function h<K extends keyof HTMLElementTagNameMap>(
  tag: K,
  props?: Props | null,
  ...children: Child[]
): HTMLElementTagNameMap[K] {
  const el = document.createElement(tag);
  if (props) applyProps(el, props);
  append(el, children);
  return el;
}

function applyProps(el: HTMLElement, props: Props): void {
  for (const [key, value] of Object.entries(props)) {
    if (value === undefined || value === null || value === false) continue;
    if (key === 'dataset') {
      for (const [dk, dv] of Object.entries(value as Record<string, string>)) {
        el.dataset[dk] = dv;
      }
    } else if (key.startsWith('on') && typeof value === 'function') {
      el.addEventListener(key.slice(2), value as EventListener);
    } else if (key === 'value' && 'value' in el) {
      (el as HTMLInputElement).value = String(value);
    } else if (key === 'checked' && el instanceof HTMLInputElement) {
      el.checked = Boolean(value);
    } else if (value === true) {
      el.setAttribute(key, '');
    } else {
      el.setAttribute(key, String(value));
    }
  }
}

export function append(parent: Node, children: Child[]): void {
  for (const child of children) {
    if (child === null || child === undefined || child === false) continue;
    if (Array.isArray(child)) {
      append(parent, child);
    } else if (child instanceof Node) {
      parent.appendChild(child);
    } else {
      parent.appendChild(document.createTextNode(String(child)));
    }
  }
}

// Replaces every child of el with the given children.
export function replaceChildren(el: Element, ...children: Child[]): void {
  while (el.firstChild) el.removeChild(el.firstChild);
  append(el, children);
}
