// The page of heft-html. The data's keys stand at the top of HXPageData.cpp. Names come from whoever runs a process: they only ever
// become text (textContent), never markup.
'use strict';
(() => {
const data = JSON.parse(document.getElementById('data').textContent);
const byId = id => document.getElementById(id);
const MEASURES = ['heft', 'swapped', 'clean', 'reclaimable']; // in the order of the sizes
const COLOURS = 9; // --c0 … --c8; --c9 is everything else's
const state = {measure: 0, tint: 'category', zoom: null, kind: 'processes', filter: '', sort: {}, shown: 0};

// Calls `handle` with the event and the datum. d3's own listeners changed from version to version.
function listen(selection, types, handle) {
  selection.each(function(datum) {
    for (const type of types.split(' ')) this.addEventListener(type, event => handle(event, datum));
  });
}

function grouped(items, keyOf) {
  const groups = new Map();
  for (const item of items) {
    const key = keyOf(item);
    if (!groups.has(key)) groups.set(key, []);
    groups.get(key).push(item);
  }
  return groups;
}

// ---- Text ----

function sizeText(bytes) {
  if (bytes < 1024) return String(bytes);
  let number = bytes, unit = -1;
  do { number /= 1024; unit++; } while (number >= 1023.5 && unit < 3);
  return (number < 99.95 ? number.toFixed(1) : number.toFixed(0)) + 'KMGT'[unit];
}
const changeText = bytes => bytes === 0 ? '0' : (bytes < 0 ? '−' : '+') + sizeText(Math.abs(bytes));
const plural = (number, noun) => number.toLocaleString('en') + ' ' + noun + (number === 1 ? '' : noun.endsWith('s') ? 'es' : 's');

const isKernel = entity => entity.p === 0;

function entityText(entity) {
  if (entity.p !== null) return `${entity.n || 'unnamed'} [${entity.p}]`;
  return entity.mixed ? plural(entity.k, 'other process') : `${entity.n} × ${entity.k}`;
}

function entityNumbers(ranges) {
  const numbers = [];
  for (let i = 0; i < ranges.length; i += 2)
    for (let number = ranges[i]; number <= ranges[i + 1]; number++) numbers.push(number);
  return numbers;
}

function setText(set, most) {
  const numbers = set.members;
  const words = numbers.slice(0, most).map(number => data.entities[number])
    .map(entity => (set.some && entity.k > 1 ? 'some of ' : '') + entityText(entity));
  if (numbers.length > most) words.push(`${numbers.length - most} more`);
  if (set.o) words.push('processes that are not in the report');
  return words.join(', ');
}

// ---- The tree of tiles ----
// A node: id, kind (root, command, process, set, others, category), name, children or sizes; parent.

const nodes = new Map();
const root = {id: 'all', kind: 'root', name: 'All memory', children: []};
const setsOf = data.entities.map(() => []); // numbers of sets, by entity

function addNode(parent, node) {
  node.parent = parent;
  nodes.set(node.id, node);
  parent.children.push(node);
  return node;
}

function addParts(node, parts) {
  for (const [category, ...sizes] of parts)
    addNode(node, {id: `${node.id}/${category}`, kind: 'category', category, sizes,
                   name: category < 0 ? 'other categories' : data.categories[category]});
}

// What processes of one name have in common; no name has a line end. The kernel's namesakes are not the kernel.
const commandOf = entity => entity.mixed ? '\n' : isKernel(entity) ? '\nkernel' : entity.n;

function plantTree() {
  nodes.set(root.id, root);
  for (const set of data.sets) {
    set.members = entityNumbers(set.m);
    const names = new Set(set.members.map(number => commandOf(data.entities[number])));
    // A set inside one command belongs to its tile.
    set.command = names.size === 1 && !set.o ? [...names][0] : null;
    set.number = data.sets.indexOf(set);
    for (const number of set.members) setsOf[number].push(set.number);
  }
  data.entities.forEach((entity, number) => { entity.number = number; });
  const places = new Map();
  for (const [key, values] of grouped(data.entities, commandOf)) {
    const place = values.length === 1 ? root
      : addNode(root, {id: 'command ' + key, kind: 'command', name: key || 'unnamed', children: []});
    places.set(key, place);
    for (const entity of values) {
      const name = place === root ? (entity.p === null ? entityText(entity) : entity.n || 'unnamed') : entityText(entity);
      addParts(addNode(place, {id: 'process ' + entity.number, kind: 'process', name, entity, children: []}), entity.parts);
    }
  }
  for (const set of data.sets) {
    const place = set.command === null ? root : places.get(set.command);
    const node = {id: 'set ' + set.number, kind: 'set', name: `shared by ${set.k}`, set, children: []};
    addParts(addNode(place, node), set.parts);
  }
  if (data.otherSets.k > 0)
    addParts(addNode(root, {id: 'others', kind: 'others', name: plural(data.otherSets.k, 'other shared set'), children: []}),
             data.otherSets.parts);
}

const pathOf = node => node ? [...pathOf(node.parent), node] : [];
const holderOf = node => node.kind === 'category' ? node.parent : node;

function weighed(node) {
  return d3.hierarchy(node).sum(each => each.sizes ? each.sizes[state.measure] : 0).sort((a, b) => b.value - a.value);
}

// ---- Colours ----

const colourOf = new Map(); // category: number
const changeOf = new Map(); // pid: the process's change

function chooseColours() {
  colourOf.clear();
  const leaves = weighed(root).leaves().filter(leaf => leaf.data.category >= 0);
  const sums = [...grouped(leaves, leaf => leaf.data.category)].map(([category, all]) => [category, d3.sum(all, leaf => leaf.value)]);
  sums.sort((a, b) => b[1] - a[1]).slice(0, COLOURS).filter(([, sum]) => sum > 0)
    .forEach(([category], number) => colourOf.set(category, number));
}

function changeOfNode(node) {
  if (node.kind === 'command') return d3.sum(node.children, changeOfNode);
  if (node.kind === 'category') {
    const change = node.parent.entity && changeOf.get(node.parent.entity.p);
    const part = change && change.c.find(([name]) => name === node.name);
    return part ? part[2] - part[1] : 0;
  }
  const change = node.entity && changeOf.get(node.entity.p);
  return change ? change.s[1] - change.s[0] : 0;
}

function backgroundOf(node) {
  if (state.tint === 'change') {
    const change = changeOfNode(node);
    return change > 0 ? 'var(--grew)' : change < 0 ? 'var(--shrank)' : 'var(--same)';
  }
  if (node.kind !== 'category') return null;
  return `var(--c${colourOf.has(node.category) ? colourOf.get(node.category) : COLOURS})`;
}

function drawLegend() {
  const entries = state.tint === 'change' ? [['grew', '--grew'], ['shrank', '--shrank'], ['no change, or shared', '--same']]
    : [...colourOf].map(([category, number]) => [data.categories[category], `--c${number}`]).concat([['other', `--c${COLOURS}`]]);
  const items = d3.select('#legend').selectAll('li').data([...entries, ['shared memory', null]]).join('li').text('');
  items.append('i').attr('class', ([, colour]) => colour ? null : 'set').style('background', ([, colour]) => colour && `var(${colour})`);
  items.append('span').text(([name]) => name);
}

// ---- The map ----

const map = byId('map');
let drawn = new Map(); // by id: the tiles on the map, with their place
let size = [0, 0];     // of the map as drawn
let current = null;    // the id of the tile that has or gets the focus

function layOut() {
  const header = 17;
  size = [map.clientWidth, map.clientHeight];
  const box = weighed(state.zoom);
  const layout = d3.treemap().size(size).round(true).paddingInner(1)
    .paddingOuter(tile => [1, 3, 2][tile.depth] || 0) // room for the focus around a tile's parts
    .paddingTop(tile => tile.depth === 0 ? 1 : tile.children && tile.depth < 3 ? header : 0);
  layout(box);
  // What is too small to be seen is not drawn.
  const tiles = [];
  const visit = tile => {
    if (tile.depth > 0) {
      if (!(tile.value > 0) || tile.x1 - tile.x0 < 3 || tile.y1 - tile.y0 < 3) return;
      tiles.push(tile);
    }
    if (tile.depth < 3) (tile.children || []).forEach(visit);
  };
  visit(box);
  return tiles.sort((a, b) => a.depth - b.depth);
}

function tileLabel(tile) {
  const node = tile.data;
  const words = [node.name + (node.kind === 'process' && node.entity.p !== null && !node.name.endsWith(']') ? ` [${node.entity.p}]` : ''),
                 sizeText(tile.value)];
  if (node.kind === 'set') words.push(setText(node.set, 8));
  return words.join(', ');
}

// A tile that is too small for its parts stands for the largest of them.
function largestPart(tile) {
  if (!tile.children || state.tint === 'change' || tile.children.some(child => drawn.has(child.data.id))) return tile;
  return largestPart(tile.children[0]);
}

function draw() {
  const tiles = layOut();
  drawn = new Map(tiles.map(tile => [tile.data.id, tile]));
  if (!drawn.has(current) || drawn.get(current).depth !== 1) current = tiles.length ? tiles[0].data.id : null;
  const joined = d3.select(map).selectAll('.tile').data(tiles, tile => tile.data.id).join(enter => {
    const made = enter.append('div');
    made.append('span').attr('class', 'name');
    made.append('span').attr('class', 'size');
    return made;
  }).order();
  joined.attr('class', ({data: node, depth}) => `tile ${node.kind}` + (node.children ? '' : ' leaf') + (depth > 1 ? ' nested' : ''))
    .style('left', tile => tile.x0 + 'px').style('top', tile => tile.y0 + 'px')
    .style('width', tile => tile.x1 - tile.x0 + 'px').style('height', tile => tile.y1 - tile.y0 + 'px')
    .style('background-color', tile => backgroundOf(largestPart(tile).data))
    .attr('data-id', tile => tile.data.id)
    .attr('role', tile => tile.depth === 1 ? 'button' : null)
    .attr('aria-hidden', tile => tile.depth === 1 ? null : 'true')
    .attr('aria-label', tile => tile.depth === 1 ? tileLabel(tile) : null)
    .attr('tabindex', tile => tile.depth !== 1 ? null : tile.data.id === current ? 0 : -1);
  const isWide = tile => tile.x1 - tile.x0 >= 28 && tile.y1 - tile.y0 >= 15;
  // A tile with tiles in it has one line for its name and its size.
  const hasParts = tile => Boolean(tile.children) && tile.depth < 3;
  joined.select('.name').text(tile => !isWide(tile) ? '' : hasParts(tile) ? `${tile.data.name} · ${sizeText(tile.value)}` : tile.data.name);
  joined.select('.size').text(tile => isWide(tile) && !hasParts(tile) && tile.y1 - tile.y0 >= 34 ? sizeText(tile.value) : '');
  d3.select(map).selectAll('.empty').data(tiles.length ? [] : [0]).join('p').attr('class', 'empty').text('Nothing of this size here.');
  map.classList.toggle('tinted', state.tint === 'change');
  drawPath();
  light(null);
}

function drawPath() {
  const path = pathOf(state.zoom);
  const items = d3.select('#path').selectAll('.step').data(path).join('span').attr('class', 'step').text('');
  const buttons = items.append('button').attr('type', 'button').text(node => node.name)
    .attr('aria-current', node => node === state.zoom ? 'true' : null);
  listen(buttons, 'click', (event, node) => zoomTo(node));
  items.filter((node, i) => i < path.length - 1).append('span').text(' › ');
  describe(null);
}

function describe(node) {
  const detail = byId('detail');
  detail.textContent = '';
  const line = (kind, text) => d3.select(detail).append('div').attr('class', kind).text(text);
  const told = node || state.zoom;
  const sizes = MEASURES.map((name, i) => [name, d3.sum(d3.hierarchy(told).leaves(), leaf => leaf.data.sizes ? leaf.data.sizes[i] : 0)]);
  const owner = holderOf(told);
  const title = told === owner ? told.name : `${told.name} of ${owner.name}`;
  line('what', title + ': ' + sizes.map(([name, size]) => `${name} ${sizeText(size)}`).join(', '));
  if (owner.set) line('who', (owner.set.some ? 'Held by ' : 'Held by exactly ') + setText(owner.set, 12));
  if (owner.entity) {
    const [heft, freed, shared] = owner.entity.f;
    const count = setsOf[owner.entity.number].length;
    line('who', `${entityText(owner.entity)} holds ${sizeText(heft)}: ${sizeText(freed)} alone${isKernel(owner.entity) ? '' : ', which stopping it frees,'} and ` +
      `${sizeText(shared)} with others` + (count ? ` in ${plural(count, 'set')}, which light up` : ''));
  }
  if (owner.kind === 'command') line('who', 'The tile is what stopping all of them frees.');
  if (owner.kind === 'others') line('who', 'Sets too small to be told one by one.');
}

// Lights up who shares a set, and what a process shares; with nothing to light, everything.
function light(node) {
  const owner = node && holderOf(node);
  const lit = new Set();
  if (owner && owner.set) for (const number of owner.set.members) lit.add('process ' + number);
  if (owner && owner.entity) for (const number of setsOf[owner.entity.number]) lit.add('set ' + number);
  const isLighting = lit.size > 0;
  if (owner) lit.add(owner.id);
  const holders = new Set(); // around what is lit
  for (const id of lit)
    for (const each of pathOf(nodes.get(id)).slice(0, -1)) holders.add(each.id);
  map.classList.toggle('lighting', isLighting);
  d3.select(map).selectAll('.tile')
    .classed('lit', ({data: {id, kind, parent}}) => isLighting && (lit.has(id) || holders.has(id) || (kind === 'category' && lit.has(parent.id))))
    .classed('holder', ({data: {id, kind, children}}) => {
      if (kind === 'category') return true;
      return holders.has(id) && children.some(child => lit.has(child.id) && drawn.has(child.id));
    });
}

function show(node) {
  light(node);
  describe(node);
}

// What shows when nothing is pointed at: the tile that has the focus.
function calm() {
  show(map.contains(document.activeElement) ? nodes.get(document.activeElement.dataset.id) || null : null);
}

function zoomTo(node, focused) {
  state.zoom = node;
  if (focused) current = focused.id;
  draw();
  if (focused) focusTile(current);
}

function focusTile(id) {
  const tile = drawn.get(id);
  if (!tile) return;
  current = id;
  d3.select(map).selectAll('.tile').attr('tabindex', each => each.depth !== 1 ? null : each.data.id === id ? 0 : -1)
    .filter(each => each.data.id === id).node().focus();
}

// Finds a tile: zooms to what holds it.
function find(node) {
  zoomTo(node.parent || root, node);
  show(node);
  map.scrollIntoView({block: 'nearest'});
}

// The nearest tile in a direction, by the distance of the middles, off the line counting double.
function neighbour(from, [right, down]) {
  const middle = tile => [(tile.x0 + tile.x1) / 2, (tile.y0 + tile.y1) / 2];
  const [x, y] = middle(from);
  let best = null, least = Infinity;
  for (const tile of drawn.values()) {
    if (tile.depth !== 1 || tile === from) continue;
    const [dx, dy] = [middle(tile)[0] - x, middle(tile)[1] - y];
    const along = dx * right + dy * down;
    const beyond = right ? (right > 0 ? tile.x0 >= from.x1 - 1 : tile.x1 <= from.x0 + 1) : (down > 0 ? tile.y0 >= from.y1 - 1 : tile.y1 <= from.y0 + 1);
    const distance = along + 2 * Math.abs(right ? dy : dx);
    if (beyond && distance < least) [best, least] = [tile, distance];
  }
  return best;
}

function zoomIn(node, withFocus) {
  if (!node.children || !node.children.length) return;
  state.zoom = node;
  current = null;
  draw();
  if (withFocus) focusTile(current);
}

function zoomOut() {
  if (state.zoom.parent) zoomTo(state.zoom.parent, state.zoom);
}

function keyOnMap(event) {
  const tile = drawn.get(current);
  const direction = {ArrowRight: [1, 0], ArrowLeft: [-1, 0], ArrowDown: [0, 1], ArrowUp: [0, -1]}[event.key];
  if (direction && tile) {
    const next = neighbour(tile, direction);
    if (next) focusTile(next.data.id);
  } else if ((event.key === 'Enter' || event.key === ' ') && tile) {
    zoomIn(tile.data, true);
  } else if (event.key === 'Escape' || event.key === 'Backspace') {
    zoomOut();
  } else {
    return;
  }
  event.preventDefault();
}

// The tile that is zoomed into when one of its parts is clicked.
const outermost = node => pathOf(node).find(each => each.parent === state.zoom);
const nodeAt = event => { const tile = event.target.closest('.tile'); return tile && nodes.get(tile.dataset.id); };

function listenToMap() {
  let touched = null; // a finger has no hover: its first tap only shows
  map.addEventListener('keydown', keyOnMap);
  map.addEventListener('pointerover', event => { if (event.pointerType !== 'touch' && nodeAt(event)) show(nodeAt(event)); });
  map.addEventListener('pointerleave', event => { if (event.pointerType !== 'touch') calm(); });
  map.addEventListener('focusin', event => show(nodeAt(event)));
  map.addEventListener('focusout', () => show(null));
  map.addEventListener('click', event => {
    const node = nodeAt(event);
    if (!node) return;
    const isTap = event.pointerType === 'touch';
    if (isTap && touched !== node.id) {
      touched = node.id;
      show(node);
      return;
    }
    // A shared tile or a process inside a command's tile is gone to at once.
    zoomIn(node.kind === 'category' ? outermost(node) : node, false);
  });
  document.addEventListener('keydown', event => { if (event.key === 'Escape' && event.target === document.body) zoomOut(); });
  new ResizeObserver(() => {
    const [width, height] = size;
    if (width !== map.clientWidth) drawSets();
    if (width !== map.clientWidth || height !== map.clientHeight) draw();
  }).observe(map);
}

// ---- Shared sets: an UpSet diagram ----

function setRows(columns) {
  // Members that the columns do not tell apart are one row.
  const rows = new Map();
  columns.forEach((set, column) => {
    for (const number of set.members) {
      if (!rows.has(number)) rows.set(number, []);
      rows.get(number).push(column);
    }
  });
  const merged = new Map();
  for (const [number, inside] of rows) {
    const entity = data.entities[number];
    const key = JSON.stringify([entity.mixed ? null : entity.n, inside]);
    if (!merged.has(key)) merged.set(key, {entities: [], inside: new Set(inside), size: d3.sum(inside, i => columns[i].size)});
    merged.get(key).entities.push(entity);
  }
  const sorted = [...merged.values()].sort((a, b) => b.size - a.size);
  for (const row of sorted) {
    const count = d3.sum(row.entities, entity => entity.k);
    const [first] = row.entities;
    row.name = row.entities.length === 1 ? entityText(first) : `${first.n || 'unnamed'} × ${count}`;
  }
  const most = 24;
  if (sorted.length > most) {
    const rest = sorted.splice(most - 1);
    sorted.push({name: plural(d3.sum(rest, row => d3.sum(row.entities, entity => entity.k)), 'other process'),
                 entities: rest.flatMap(row => row.entities), inside: new Set(rest.flatMap(row => [...row.inside])),
                 size: d3.max(rest, row => row.size)});
  }
  return sorted;
}

function drawSets() {
  const measured = data.sets.map(set => ({...set, size: d3.sum(set.parts, part => part[1 + state.measure])}))
    .filter(set => set.size > 0).sort((a, b) => b.size - a.size);
  byId('sets-section').hidden = measured.length === 0;
  const width = byId('sets').clientWidth;
  if (measured.length === 0 || width === 0) return;
  const labels = Math.min(220, width * .4), bars = 50, step = 22, line = 18, top = 110;
  const columns = measured.slice(0, Math.max(1, Math.min(30, Math.floor((width - labels - bars - 10) / step))));
  const rows = setRows(columns);
  const x = column => labels + bars + 8 + column * step;
  const height = d3.scaleLinear().domain([0, columns[0].size]).range([0, top - 52]);
  const length = d3.scaleLinear().domain([0, d3.max(rows, row => row.size)]).range([0, bars - 4]);
  d3.select('#sets').selectAll('svg').remove();
  const svg = d3.select('#sets').append('svg').attr('width', x(columns.length)).attr('height', top + rows.length * line + 4)
    .attr('role', 'group').attr('aria-label', 'The largest shared sets');
  const rowGroups = svg.selectAll('.row').data(rows).join('g').attr('class', 'row').attr('transform', (row, i) => `translate(0,${top + i * line})`);
  rowGroups.filter((row, i) => i % 2 === 0).append('rect').attr('class', 'band').attr('width', x(columns.length)).attr('height', line);
  const letters = Math.floor(labels / 6.6);
  rowGroups.append('text').attr('x', labels - 4).attr('y', line - 5).attr('text-anchor', 'end')
    .text(row => row.name.length > letters ? '…' + row.name.slice(1 - letters) : row.name).append('title').text(row => row.name);
  rowGroups.append('rect').attr('class', 'row-bar').attr('x', row => labels + bars - length(row.size)).attr('y', 4)
    .attr('width', row => length(row.size)).attr('height', line - 8);
  const columnGroups = svg.selectAll('.column').data(columns).join('g').attr('class', 'column')
    .attr('transform', (set, i) => `translate(${x(i)},0)`).attr('tabindex', (set, i) => i === 0 ? 0 : -1).attr('role', 'button')
    .attr('aria-label', set => `${sizeText(set.size)} shared by ${setText(set, 8)}`);
  columnGroups.append('rect').attr('class', 'hit').attr('width', step).attr('height', top + rows.length * line);
  columnGroups.append('rect').attr('class', 'bar').attr('x', 4).attr('width', step - 8)
    .attr('y', set => top - 6 - height(set.size)).attr('height', set => height(set.size));
  columnGroups.append('text').attr('class', 'axis').attr('transform', set => `translate(${step / 2 + 4},${top - 10 - height(set.size)}) rotate(-90)`)
    .text(set => sizeText(set.size));
  columnGroups.each(function(set, column) {
    const inside = rows.map((row, i) => row.inside.has(column) ? i : -1).filter(i => i >= 0);
    const group = d3.select(this);
    group.append('rect').attr('class', 'link').attr('x', step / 2 - 1).attr('width', 2)
      .attr('y', top + inside[0] * line + line / 2).attr('height', (inside[inside.length - 1] - inside[0]) * line);
    group.selectAll('circle').data(rows).join('circle').attr('class', row => row.inside.has(column) ? 'dot in' : 'dot')
      .attr('cx', step / 2).attr('cy', (row, i) => top + i * line + line / 2).attr('r', 5);
  });
  const node = set => nodes.get('set ' + set.number);
  listen(columnGroups, 'click', (event, set) => find(node(set)));
  listen(columnGroups, 'mouseenter focus', (event, set) => show(node(set)));
  listen(columnGroups, 'mouseleave blur', calm);
  listen(columnGroups, 'keydown', (event, set) => {
    const all = columnGroups.nodes(), i = columns.indexOf(set);
    const next = {ArrowRight: i + 1, ArrowLeft: i - 1, Home: 0, End: all.length - 1}[event.key];
    if (event.key === 'Enter' || event.key === ' ') find(node(set));
    else if (next !== undefined && all[next]) {
      columnGroups.attr('tabindex', -1);
      all[next].setAttribute('tabindex', 0);
      all[next].focus();
    } else return;
    event.preventDefault();
  });
}

// ---- Tables ----

const sizeColumn = (name, value) => ({name, value, text: row => sizeText(value(row)), isNumber: true});
const countColumn = (name, value) => ({name, value, text: row => value(row).toLocaleString('en'), isNumber: true});
const nameColumn = (name, value, target) => ({name, value, text: value, target});
const pidColumn = {name: 'pid', value: row => row.p === null || row.p < 0 ? -1 : row.p, text: row => row.p === null || row.p < 0 ? '' : String(row.p), isNumber: true};
const changeColumn = value => ({name: 'change', value, text: row => changeText(value(row)), isNumber: true});
const partSum = i => set => d3.sum(set.parts, part => part[1 + i]);

function tables() {
  const kinds = {
    processes: {
      title: 'Processes', rows: data.entities, first: 2, columns: [
        nameColumn('process', entity => entity.p === null ? entityText(entity) : entity.n || 'unnamed', entity => nodes.get('process ' + entity.number)),
        pidColumn, ...['heft', 'freed if stopped', 'shared', 'swapped', 'reclaimable'].map((name, i) => sizeColumn(name, entity => entity.f[i]))]},
    sets: {
      title: 'Shared sets', rows: data.sets, first: 1, columns: [
        nameColumn('held by', set => setText(set, 6), set => nodes.get('set ' + set.number)),
        ...MEASURES.map((name, i) => sizeColumn(name, partSum(i))), countColumn('processes', set => set.k)]},
    categories: {
      title: 'Categories', rows: data.summary, first: 1, columns: [
        nameColumn('category', row => row[0] === null ? 'other categories' : row[0]),
        ...[...MEASURES, 'wired'].map((name, i) => sizeColumn(name, row => row[1 + i])), countColumn('regions', row => row[6])]},
  };
  const freed = kinds.processes.columns[3], freedText = freed.text;
  freed.text = entity => isKernel(entity) ? '' : freedText(entity);
  if (!data.change) return kinds;
  const pidChange = entity => { const change = entity.p === null ? null : changeOf.get(entity.p); return change ? change.s[1] - change.s[0] : 0; };
  kinds.processes.columns.push(changeColumn(pidChange));
  const most = ({c}) => [...c].sort((a, b) => Math.abs(b[2] - b[1]) - Math.abs(a[2] - a[1]))[0];
  const fate = change => change.p < 0 ? ', gone' : change.q < 0 ? ', new' : change.p !== change.q ? `, was pid ${change.q}` : '';
  kinds.changed = {
    title: 'Changed processes', rows: data.change.processes, columns: [
      nameColumn('process', change => change.n + fate(change)), pidColumn,
      {...changeColumn(change => change.s[1] - change.s[0]), hasGauge: true},
      sizeColumn('before', change => change.s[0]), sizeColumn('after', change => change.s[1]),
      {name: 'most in', value: change => change.c.length ? most(change)[0] : '', text: change => {
        if (!change.c.length) return '';
        const [name, before, after] = most(change);
        return `${name} ${changeText(after - before)}`;
      }}]};
  kinds.changedCategories = {
    title: 'Changed categories', rows: data.change.categories, columns: [
      nameColumn('category', row => row[0]), {...changeColumn(row => row[2] - row[1]), hasGauge: true},
      sizeColumn('before', row => row[1]), sizeColumn('after', row => row[2])]};
  return kinds;
}

let kinds;
const STEP = 100; // rows at first

// By which column a table is sorted; at first by its heft, or as the comparison is.
const sorting = () => state.sort[state.kind] || {column: kinds[state.kind].first, isUp: false};

function orderedRows({rows, columns}) {
  const words = state.filter.toLowerCase();
  const kept = rows.filter(row => columns.some(column => (!column.isNumber || column === pidColumn) && column.text(row).toLowerCase().includes(words)));
  const {column, isUp} = sorting();
  return column === undefined ? kept : order(kept, columns[column], isUp);
}

function order(rows, column, isUp) {
  const compare = column.isNumber ? (a, b) => column.value(a) - column.value(b)
    : (a, b) => column.value(a).localeCompare(column.value(b), 'en', {numeric: true});
  return rows.map((row, i) => [row, i]).sort(([a, i], [b, j]) => (isUp ? compare(a, b) : compare(b, a)) || i - j).map(([row]) => row);
}

function drawHead(columns) {
  const sorted = sorting();
  const cells = d3.select('thead').selectAll('tr').data([0]).join('tr').selectAll('th').data(columns).join('th').text('').attr('scope', 'col')
    .attr('aria-sort', (column, i) => i !== sorted.column ? null : sorted.isUp ? 'ascending' : 'descending');
  const buttons = cells.append('button').attr('type', 'button').attr('data-column', (column, i) => i)
    .text((column, i) => column.name + (i !== sorted.column ? '' : sorted.isUp ? ' ▲' : ' ▼'));
  listen(buttons, 'click', (event, column) => {
    const i = columns.indexOf(column);
    state.sort[state.kind] = {column: i, isUp: i === sorted.column ? !sorted.isUp : !column.isNumber};
    drawTable();
    document.querySelector(`th [data-column="${i}"]`).focus();
  });
}

function fillCell(cell, column, row, largest) {
  const text = column.text(row);
  const target = column.target && column.target(row);
  if (!target) cell.text(text);
  else listen(cell.append('button').attr('type', 'button').text(text), 'click', () => find(target));
  if (!column.hasGauge) return;
  const change = column.value(row);
  cell.append('span').attr('class', change < 0 ? 'gauge shrank' : 'gauge').style('width', `${5 * Math.abs(change) / largest}em`);
}

function drawTable() {
  const kind = kinds[state.kind];
  drawHead(kind.columns);
  const rows = orderedRows(kind);
  const visible = rows.slice(0, state.shown);
  const gauge = kind.columns.find(column => column.hasGauge);
  const largest = gauge ? d3.max(kind.rows, row => Math.abs(gauge.value(row))) || 1 : 1;
  d3.select('tbody').selectAll('tr').data(visible).join('tr').each(function(row) {
    d3.select(this).selectAll('td').data(kind.columns).join('td').text('')
      .each(function(column) { fillCell(d3.select(this), column, row, largest); });
  });
  byId('count').textContent = rows.length === kind.rows.length ? plural(rows.length, 'row') : `${rows.length} of ${plural(kind.rows.length, 'row')}`;
  byId('more').hidden = rows.length <= visible.length;
  byId('more').textContent = `Show all ${rows.length.toLocaleString('en')}`;
  d3.select('#kinds').selectAll('button').attr('aria-pressed', ([key]) => String(key === state.kind));
}

function makeTables() {
  kinds = tables();
  state.kind = data.change ? 'changed' : 'processes';
  state.shown = STEP;
  const buttons = d3.select('#kinds').selectAll('button').data(Object.entries(kinds)).join('button').attr('type', 'button')
    .text(([, kind]) => kind.title);
  listen(buttons, 'click', (event, [key]) => { state.kind = key; state.shown = STEP; drawTable(); });
  byId('filter').addEventListener('input', event => { state.filter = event.target.value; drawTable(); });
  byId('more').addEventListener('click', () => { state.shown = Infinity; drawTable(); });
}

// ---- The head ----

function drawHeader() {
  document.title = `${data.title} – heft`;
  byId('title').textContent = data.title;
  const lead = d3.select('#lead');
  lead.append('strong').text(sizeText(data.total[0]));
  const words = [` charged to ${data.isWhole ? `${plural(data.processes - 1, 'process')} and the kernel` : plural(data.processes, 'process')}`];
  if (data.total[1]) words.push(`${sizeText(data.total[1])} of it swapped out`);
  if (data.change) {
    const [before, after] = data.change.total;
    words.push(`${changeText(after - before)} since ${data.earlier}`);
    if (data.change.uncompared) words.push(`${plural(data.change.uncompared, 'process')} not compared`);
    if (data.change.more) words.push(`${plural(data.change.more, 'process')} that changed least not listed`);
  }
  if (!data.isWhole) words.push('not a report of the whole machine: what others hold is not known');
  if (data.isOfObjects) words.push('sizes as memory objects see them, not as the kernel charges them');
  lead.append('span').text(words.join('; ') + '.');
  if (!data.unexamined && !data.errorCount) return;
  byId('errors').hidden = false;
  const more = data.errorCount - data.errors.length;
  const lines = [...data.errors, ...(more > 0 ? [`${more} more`] : []), ...(data.unexamined ? [`${plural(data.unexamined, 'process')} without figures`] : [])];
  d3.select('#errors ul').selectAll('li').data(lines).join('li').text(line => line);
}

function start() {
  plantTree();
  state.zoom = root;
  if (data.change) for (const change of data.change.processes) if (change.p >= 0) changeOf.set(change.p, change);
  drawHeader();
  d3.select('#measure').selectAll('option').data(MEASURES).join('option').attr('value', (name, i) => i).text(name => name);
  byId('measure').addEventListener('change', event => {
    state.measure = Number(event.target.value);
    chooseColours();
    drawLegend();
    draw();
    drawSets();
  });
  byId('tint-label').hidden = !data.change;
  byId('tint').addEventListener('change', event => { state.tint = event.target.value; drawLegend(); draw(); });
  chooseColours();
  drawLegend();
  draw();
  drawSets();
  makeTables();
  drawTable();
  listenToMap();
}
start();
})();
