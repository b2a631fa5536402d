// Elements, made without any text ever becoming markup.

const SVG = 'http://www.w3.org/2000/svg';

// Properties whose name begins with "on" are listeners, those with "-" and "role" are attributes.
export function h(tag, properties = {}, ...children) {
  const element = document.createElement(tag);
  for (const [name, value] of Object.entries(properties)) {
    if (value === undefined || value === null) continue;
    if (name.startsWith('on')) element.addEventListener(name.slice(2), value);
    else if (name.includes('-') || name === 'role' || name === 'for') element.setAttribute(name, value);
    else if (name === 'class') element.className = value;
    else element[name] = value;
  }
  element.append(...children.flat().filter((child) => child !== null && child !== undefined));
  return element;
}

export function icon(name) {
  const svg = document.createElementNS(SVG, 'svg');
  svg.setAttribute('class', `icon icon-${name}`);
  svg.setAttribute('aria-hidden', 'true');
  const use = document.createElementNS(SVG, 'use');
  use.setAttribute('href', `#i-${name}`);
  svg.append(use);
  return svg;
}

export function button(label, onclick, properties = {}) {
  return h('button', { type: 'button', onclick, ...properties }, label);
}

// Calls no oftener than once an interval, and once more after the last call.
export function paced(interval, work) {
  let timer = null;
  let again = false;
  const run = async () => {
    timer = setTimeout(() => {
      timer = null;
      if (again) {
        again = false;
        run();
      }
    }, interval);
    work();
  };
  return () => {
    if (timer) again = true;
    else run();
  };
}

// Calls once for all calls of an interval, at its end.
export function later(interval, work) {
  let timer = null;
  return () => {
    timer ??= setTimeout(() => {
      timer = null;
      work();
    }, interval);
  };
}
