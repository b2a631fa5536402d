// Values of items as people read them.

const units = ['bytes', 'kB', 'MB', 'GB', 'TB'];
const number = new Intl.NumberFormat(undefined, { maximumFractionDigits: 1 });
const shortDate = new Intl.DateTimeFormat(undefined, { dateStyle: 'medium', timeStyle: 'short' });

export const collator = new Intl.Collator(undefined, { numeric: true, sensitivity: 'base' });

export function size(bytes) {
  if (bytes === undefined) return '';
  let value = bytes;
  let unit = 0;
  while (value >= 1000 && unit < units.length - 1) {
    value /= 1000;
    unit += 1;
  }
  return `${number.format(value)} ${bytes === 1 ? 'byte' : units[unit]}`;
}

export function date(text) {
  return text ? shortDate.format(new Date(text)) : '';
}

export function isFolder(item) {
  return item.typeIdentifier === 'inode/directory' || item.isAppLibrary === true || item.typeIdentifier === 'public.folder';
}

export function iconOf(item) {
  if (item.isAppLibrary) return 'app';
  if (isFolder(item)) return 'folder';
  const [family] = item.typeIdentifier.split('/');
  if (family === 'image') return 'image';
  if (family === 'audio') return 'sound';
  if (family === 'video') return 'film';
  return item.typeIdentifier.includes('/') ? 'document' : 'package';
}

export function kind(item) {
  if (item.isAppLibrary) return 'Application';
  if (isFolder(item)) return 'Folder';
  const names = {
    'text/plain': 'Text', 'application/pdf': 'PDF', 'inode/symlink': 'Link', 'inode/fifo': 'Pipe', 'inode/socket': 'Socket',
    'com.vemra.package': 'Package', 'application/octet-stream': 'Document',
  };
  if (names[item.typeIdentifier]) return names[item.typeIdentifier];
  const [family, rest] = item.typeIdentifier.split('/');
  if (!rest) return 'Package';
  const what = { image: 'picture', audio: 'sound', video: 'film', text: 'text' }[family] ?? 'document';
  return `${rest.replace(/^(x-|vnd\.)/, '').split('+')[0].split('.').pop().toUpperCase()} ${what}`;
}

// What a folder shows in place of a size.
export function sizeText(item) {
  if (isFolder(item)) {
    if (item.childItemCount === undefined) return '';
    const count = item.childItemCount;
    return count === 1 ? '1 item' : `${number.format(count)} items`;
  }
  return size(item.documentSize);
}

// "Report 2.txt" for "Report.txt".
export function alternativeName(name, isOfFolder, count) {
  const dot = isOfFolder ? -1 : name.lastIndexOf('.');
  return dot > 0 ? `${name.slice(0, dot)} ${count}${name.slice(dot)}` : `${name} ${count}`;
}

export function count(items) {
  return items === 1 ? '1 item' : `${number.format(items)} items`;
}
