// The explorer page of `delvix-host serve`: everything goes through the host's HTTP API on the
// address the page came from, so it works on any port. Each tab names itself a client of its own,
// so its stop ends only its own search.
'use strict';

const CAP = 201; // an attribute search delivers at most this many hits
const clientId = 'explorer-' + Array.from(crypto.getRandomValues(new Uint8Array(6)), (b) => b.toString(16).padStart(2, '0')).join('');

const state = {
  cameras: [],        // the plug-in's directory: {name, location, group, protected, ...}
  left: [],           // site cameras not in the directory, with the reason
  vocabulary: {},     // attribute -> words; a code is a position, ages are stored as words
  hits: [],           // hits of the current search, in arrival order
  picked: new Set(),  // indexes into hits
  search: null,       // {controller, stopCommand} while a search or re-identification runs
  window: null,       // {start, end} of the last search, for re-identification
  rule: {points: []}, // normalised [x, y] points drawn on the frame
};

const $ = (id) => document.getElementById(id);

function element(tag, attributes = {}, children = []) {
  const node = document.createElement(tag);
  for (const [key, value] of Object.entries(attributes)) {
    if (key === 'text') node.textContent = value;
    else if (key === 'class') node.className = value;
    else if (key.startsWith('on')) node.addEventListener(key.slice(2), value);
    else node.setAttribute(key, value);
  }
  for (const child of children) if (child) node.append(child);
  return node;
}

function showMessage(text, kind = 'error') {
  const box = $('message');
  box.textContent = text;
  box.className = 'message ' + kind;
  box.hidden = !text;
}

// Whatever goes wrong in the page is said on the page, never a blank screen.
window.addEventListener('error', (event) => showMessage('The page met an error: ' + event.message));
window.addEventListener('unhandledrejection', (event) => showMessage(describeError(event.reason)));

function describeError(error) {
  if (error instanceof TypeError) {
    return 'The host does not answer at ' + location.origin + '. Is delvix-host serve running?';
  }
  return error && error.message ? error.message : String(error);
}

// ---- the host's API ------------------------------------------------------------------------

// Sends one command and hands each JSON reply line to onLine as it arrives; resolves with the
// final line (null when the answer ended without one).
async function stream(command, params, onLine, signal) {
  const response = await fetch('/request', {
    method: 'POST',
    headers: {'Content-Type': 'application/json'},
    body: JSON.stringify({command, params, client: clientId}),
    signal,
  });
  if (!response.ok) {
    throw new Error('The host refused ' + command + ': ' + ((await response.text()).trim() || response.status));
  }
  const reader = response.body.getReader();
  const decoder = new TextDecoder();
  let buffer = '';
  let final = null;
  const take = (line) => {
    if (!line.trim()) return;
    const reply = JSON.parse(line);
    if (reply.final) final = reply;
    onLine(reply);
  };
  for (;;) {
    const {value, done} = await reader.read();
    if (done) break;
    buffer += decoder.decode(value, {stream: true});
    let newline;
    while ((newline = buffer.indexOf('\n')) >= 0) {
      take(buffer.slice(0, newline));
      buffer = buffer.slice(newline + 1);
    }
  }
  take(buffer);
  return final;
}

async function call(command, params) {
  const final = await stream(command, params, () => {});
  if (!final) throw new Error(command + ' ended without an answer');
  return final;
}

function sendStop(command) {
  return fetch('/request', {
    method: 'POST',
    headers: {'Content-Type': 'application/json'},
    body: JSON.stringify({command, params: {}, client: clientId, wait: 0}),
  });
}

// ---- words for codes ---------------------------------------------------------------------------

function words(attribute, value) {
  const list = state.vocabulary[attribute] || [];
  if (Array.isArray(value)) return value.map((v) => words(attribute, v)).join('/');
  if (value === '' || value === null || value === undefined) return '';
  if (typeof value === 'string') return value;
  return Number.isInteger(value) && value >= 0 && value < list.length ? list[value] : 'code ' + value;
}

function describeHit(hit) {
  if (hit.objType === 'Human') {
    const parts = [words('Age', hit.objectAge), words('Gender', hit.objectGender)];
    const upper = words('UpperColor', hit.objectUpperColor);
    const lower = words('LowerColor', hit.objectLowerColor);
    const carries = words('Accessories', hit.objectAccessories);
    if (upper) parts.push(upper + ' top');
    if (lower) parts.push(lower + ' bottom');
    if (carries) parts.push('carries ' + carries);
    return parts.filter(Boolean).join(', ');
  }
  const vehicle = [words('Color', hit.objectVehicleColor), words('Type', hit.objectVehicleType)].filter(Boolean).join(' ');
  return [vehicle || 'vehicle', hit.plateNumber ? 'plate ' + hit.plateNumber : ''].filter(Boolean).join(', ');
}

function imageSource(base64) {
  const type = base64.startsWith('/9j/') ? 'jpeg' : 'png';
  return 'data:image/' + type + ';base64,' + base64;
}

function timeText(ms) {
  return new Date(Number(ms)).toLocaleString(undefined, {dateStyle: 'short', timeStyle: 'medium'});
}

function locationOf(name) {
  const camera = state.cameras.find((c) => c.name === name);
  return camera ? camera.location : '';
}

// ---- cameras ----------------------------------------------------------------------------------

async function loadCameras() {
  const response = await fetch('/host/cameras');
  if (!response.ok) throw new Error('The host did not list its cameras: ' + response.status);
  const report = await response.json();
  state.cameras = report.cameras;
  state.left = report.notInDirectory;
  state.vocabulary = report.vocabulary;
  return report;
}

function renderCameras() {
  const body = $('cameras').tBodies[0];
  body.replaceChildren();
  for (const camera of state.cameras) {
    const badges = [element('span', {class: 'badge online', text: 'online'})];
    if (camera.protected) badges.push(element('span', {class: 'badge protected', text: 'protected'}));
    body.append(element('tr', {'data-camera': camera.name}, [
      element('td', {text: camera.name}), element('td', {text: camera.location}),
      element('td', {text: String(camera.group)}), element('td', {}, badges)]));
  }
  for (const camera of state.left) {
    body.append(element('tr', {class: 'left'}, [
      element('td', {text: camera.name}), element('td', {text: camera.location || '–'}), element('td'),
      element('td', {text: 'not searchable: ' + camera.reason})]));
  }
  $('cameras-status').textContent = state.cameras.length + ' camera(s) in the plug-in\'s directory.';

  // The person's ticks survive a refresh of the list; a camera new to the list starts ticked.
  const picks = $('camera-picks');
  const ticked = new Map(Array.from(picks.querySelectorAll('input'), (box) => [box.value, box.checked]));
  picks.replaceChildren();
  const ruleCamera = $('rule-camera');
  const ruleChoice = ruleCamera.value;
  ruleCamera.replaceChildren();
  for (const camera of state.cameras) {
    const box = element('input', {type: 'checkbox', value: camera.name});
    box.checked = ticked.has(camera.name) ? ticked.get(camera.name) : true;
    picks.append(element('label', {}, [box, ' ' + camera.name + ' (' + camera.location + ')']));
    ruleCamera.append(element('option', {value: camera.name, text: camera.name}));
  }
  if (ruleChoice) ruleCamera.value = ruleChoice;
  drawRule();
}

function fillChoices() {
  const choices = {age: 'Age', gender: 'Gender', accessories: 'Accessories', upper: 'UpperColor',
                   lower: 'LowerColor', 'vehicle-type': 'Type', 'vehicle-colour': 'Color'};
  for (const [id, attribute] of Object.entries(choices)) {
    const select = $(id);
    select.replaceChildren(element('option', {value: '', text: 'any'}));
    (state.vocabulary[attribute] || []).forEach((word, code) => {
      select.append(element('option', {value: attribute === 'Age' ? word : String(code), text: word}));
    });
  }
}

// The directory fills as the plug-in learns it; ask until it holds cameras.
async function waitForCameras() {
  for (let attempt = 0; ; ++attempt) {
    try {
      await loadCameras();
      renderCameras();
      fillChoices();
      if (state.cameras.length > 0) return;
      $('cameras-status').textContent = 'The plug-in has not learned any camera yet; asking again…';
    } catch (error) {
      showMessage(describeError(error));
    }
    await new Promise((resolve) => setTimeout(resolve, Math.min(5000, 500 * (attempt + 1))));
  }
}

// ---- the search form --------------------------------------------------------------------------

function localInputValue(date) {
  const shifted = new Date(date.getTime() - date.getTimezoneOffset() * 60000);
  return shifted.toISOString().slice(0, 19);
}

// The request's conditions, or an Error whose message tells what to mend.
async function searchConditions() {
  const start = $('start').value ? new Date($('start').value).getTime() : NaN;
  const end = $('end').value ? new Date($('end').value).getTime() : NaN;
  if (Number.isNaN(start) || Number.isNaN(end)) return new Error('Give both ends of the time window.');
  if (end <= start) return new Error('The time window is empty: "To" must come after "From".');

  // Names typed by hand are checked against what the host knows now, not what it knew at load.
  await loadCameras();
  renderCameras();
  const locations = new Set();
  const kind = $('rule-kind').value;
  if (kind) {
    const camera = $('rule-camera').value;
    if (!locationOf(camera)) return new Error('Unknown camera for the rule: ' + (camera || '(none)'));
    locations.add(locationOf(camera));
  } else {
    for (const box of $('camera-picks').querySelectorAll('input:checked')) {
      if (!locationOf(box.value)) return new Error('Unknown camera: ' + box.value);
      locations.add(locationOf(box.value));
    }
    const typed = $('places').value.split(',').map((s) => s.trim()).filter(Boolean);
    for (const name of typed) {
      const byName = locationOf(name);
      const byLocation = state.cameras.find((c) => c.location.toLowerCase() === name.toLowerCase());
      if (!byName && !byLocation) return new Error('Unknown camera or location: ' + name);
      locations.add(byName || byLocation.location);
    }
  }
  if (locations.size === 0) return new Error('Pick at least one camera.');

  const params = {startTimestamp: start, endTimestamp: end, locIDList: Array.from(locations), descending: true};
  const what = document.querySelector('input[name=kind]:checked').value;
  const pick = (id, attribute, asList) => {
    const value = $(id).value;
    if (value === '') return {};
    const code = attribute === 'Age' ? value : Number(value);
    return {[attribute]: asList ? [code] : code};
  };
  if (what === 'person') {
    params.humanInfo = JSON.stringify(Object.assign({}, pick('age', 'Age'), pick('gender', 'Gender'),
      pick('accessories', 'Accessories', true), pick('upper', 'UpperColor', true), pick('lower', 'LowerColor', true)));
  } else if (what === 'vehicle') {
    params.vehicleInfo = JSON.stringify(Object.assign({}, pick('vehicle-type', 'Type'), pick('vehicle-colour', 'Color', true)));
    const plate = $('plate').value.trim();
    if (plate) params.plateNumber = plate;
  }
  if (kind) {
    const points = state.rule.points;
    const needed = kind === 'lineCrossing' ? 2 : 3;
    if (points.length < needed) {
      return new Error(kind === 'lineCrossing' ? 'Draw the line: click its two ends on the frame.'
                                               : 'Draw the zone: click at least three corners on the frame.');
    }
    const duration = Number($('duration').value);
    if (kind === 'loitering' && !(duration >= 1)) return new Error('The loitering time must be at least 1 second.');
    params.ruleInfo = {type: kind, trace: JSON.stringify(points.map(([x, y]) => [+x.toFixed(4), +y.toFixed(4)])),
                       direction: Number($('direction').value), duration: kind === 'loitering' ? duration : 0};
  }
  return {params, start, end};
}

function setRunning(running) {
  $('search-button').disabled = running;
  $('stop-button').disabled = !running;
}

// Ends this tab's running search (its own client only) and waits for its answer to close.
async function stopRunning() {
  const running = state.search;
  if (!running) return;
  running.stopped = true;
  await sendStop(running.stopCommand).catch(() => {});
  await running.done.catch(() => {});
}

async function runSearch(event) {
  event.preventDefault();
  showMessage('');
  let conditions;
  try {
    conditions = await searchConditions();
  } catch (error) {
    showMessage(describeError(error));
    return;
  }
  if (conditions instanceof Error) {
    showMessage(conditions.message);
    return;
  }
  await stopRunning();
  state.hits = [];
  state.picked.clear();
  state.window = {start: conditions.start, end: conditions.end, locations: conditions.params.locIDList};
  updatePicked();
  $('hits').replaceChildren();
  $('count').textContent = 'Searching…';
  $('search-section').dataset.state = 'running';
  setRunning(true);
  const running = {stopCommand: 'stopSearch', stopped: false};
  running.done = stream('startSearch', conditions.params, (reply) => {
    if (!reply.final && reply.payload) addHit(reply.payload);
    $('count').textContent = state.hits.length + ' shown…';
  });
  state.search = running;
  try {
    await running.done;
    const n = state.hits.length;
    $('count').textContent = n >= CAP ? n + ' shown, refine to see more'
                           : running.stopped ? 'Stopped: ' + n + ' shown'
                           : n === 0 ? 'Nothing found in this window.' : n + ' shown';
  } catch (error) {
    $('count').textContent = state.hits.length + ' shown before the answer broke off';
    showMessage(describeError(error));
  } finally {
    if (state.search === running) state.search = null;
    setRunning(false);
    $('search-section').dataset.state = 'done';
    drawRule(); // the rule's frame may now have a picture of its camera
  }
}

// ---- hits ---------------------------------------------------------------------------------------

const SVG = 'http://www.w3.org/2000/svg';

function trajectoryOverlay(points) {
  const svg = document.createElementNS(SVG, 'svg');
  svg.setAttribute('viewBox', '0 0 1 1');
  svg.setAttribute('preserveAspectRatio', 'none');
  svg.setAttribute('class', 'trajectory');
  if (points && points.length) {
    const line = document.createElementNS(SVG, 'polyline');
    line.setAttribute('points', points.map((p) => p.x + ',' + p.y).join(' '));
    svg.append(line);
    const end = document.createElementNS(SVG, 'circle');
    const last = points[points.length - 1];
    end.setAttribute('cx', last.x);
    end.setAttribute('cy', last.y);
    end.setAttribute('r', '0.04');
    svg.append(end);
  }
  return svg;
}

function hitCard(hit, extra = []) {
  const picture = element('div', {class: 'picture'});
  if (hit.objImage) picture.append(element('img', {class: 'thumb', src: imageSource(hit.objImage), alt: 'object'}));
  picture.append(trajectoryOverlay(hit.trajectory));
  const crops = element('div', {class: 'crops'});
  if (hit.faceImage) crops.append(element('img', {class: 'face', src: imageSource(hit.faceImage), alt: 'face', title: 'face'}));
  if (hit.plateImage) crops.append(element('img', {class: 'plate', src: imageSource(hit.plateImage), alt: 'plate', title: 'plate ' + (hit.plateNumber || '')}));
  return element('article', {class: 'hit', 'data-object': hit.objectID + '@' + hit.locID}, [
    picture, crops,
    element('div', {class: 'when', text: timeText(hit.startTimestamp)}),
    element('div', {class: 'where', text: (hit.nodeID || '?') + ' · ' + hit.locID}),
    element('div', {class: 'what', text: describeHit(hit)}), ...extra]);
}

function addHit(hit) {
  const index = state.hits.push(hit) - 1;
  const pick = element('input', {type: 'checkbox', class: 'pick', onchange: (e) => {
    if (e.target.checked) state.picked.add(index); else state.picked.delete(index);
    updatePicked();
  }});
  const extra = [element('label', {class: 'pick-label'}, [pick, ' pick'])];
  if (hit.objType === 'Human' && Array.isArray(hit.feature) && hit.feature.length) {
    extra.push(element('button', {type: 'button', class: 'reid', text: 'Find this person elsewhere',
                                  onclick: () => runReId(hit)}));
  }
  $('hits').append(hitCard(hit, extra));
}

// ---- re-identification ----------------------------------------------------------------------------

async function runReId(hit) {
  showMessage('');
  await stopRunning();
  const section = $('reid-section');
  section.hidden = false;
  section.dataset.state = 'running';
  $('reid-status').textContent = 'Looking for object ' + hit.objectID + ' on every camera…';
  $('timeline').replaceChildren();
  $('reid-list').tBodies[0].replaceChildren();
  const params = {startTimestamp: state.window.start, endTimestamp: state.window.end,
                  locIDList: state.cameras.map((c) => c.location), feature: hit.feature};
  if (Array.isArray(hit.faceFeature) && hit.faceFeature.length) params.faceFeature = hit.faceFeature;
  const found = [];
  const running = {stopCommand: 'stopReIdSearch', stopped: false};
  running.done = stream('startReIdSearch', params, (reply) => {
    if (!reply.final && reply.payload) found.push(reply.payload);
    $('reid-status').textContent = found.length + ' sighting(s) so far…';
  });
  state.search = running;
  setRunning(true);
  try {
    await running.done;
  } catch (error) {
    showMessage(describeError(error));
  } finally {
    if (state.search === running) state.search = null;
    setRunning(false);
  }
  const best = (h) => Math.max(Number(h.score) || 0, Number(h.faceScore) || 0);
  found.sort((a, b) => best(b) - best(a) || (Number(b.score) || 0) - (Number(a.score) || 0));
  renderReId(found);
  $('reid-status').textContent = found.length + ' sighting(s) of object ' + hit.objectID + ', best first' +
                                 (running.stopped ? ' (stopped)' : '') + '.';
  section.dataset.state = 'done';
  section.scrollIntoView({block: 'start'});
}

function renderReId(found) {
  const body = $('reid-list').tBodies[0];
  found.forEach((hit, i) => {
    const thumb = hit.objImage ? element('img', {class: 'mini', src: imageSource(hit.objImage), alt: ''}) : null;
    body.append(element('tr', {'data-object': hit.objectID + '@' + hit.locID}, [
      element('td', {text: String(i + 1)}), element('td', {}, [thumb]),
      element('td', {text: (hit.nodeID || '?') + ' · ' + hit.locID}), element('td', {text: timeText(hit.startTimestamp)}),
      element('td', {class: 'score', text: (Number(hit.score) || 0).toFixed(3)}),
      element('td', {class: 'face-score', text: (Number(hit.faceScore) || 0).toFixed(3)})]));
  });
  // The timeline: one row per camera, the sightings placed by time and labelled with their score.
  if (!found.length) return;
  const times = found.map((h) => Number(h.startTimestamp));
  const from = Math.min(...times);
  const span = Math.max(1, Math.max(...times) - from);
  const timeline = $('timeline');
  const cameras = [...new Set(found.map((h) => h.nodeID || h.locID))].sort();
  for (const camera of cameras) {
    const track = element('div', {class: 'track'});
    for (const hit of found.filter((h) => (h.nodeID || h.locID) === camera)) {
      const mark = element('span', {class: 'mark', text: Math.max(Number(hit.score) || 0, Number(hit.faceScore) || 0).toFixed(2),
                                    title: timeText(hit.startTimestamp)});
      mark.style.left = (90 * (Number(hit.startTimestamp) - from) / span) + '%';
      track.append(mark);
    }
    timeline.append(element('div', {class: 'row'}, [element('span', {class: 'camera', text: camera}), track]));
  }
  timeline.append(element('div', {class: 'axis'}, [element('span', {text: timeText(from)}),
                                                     element('span', {text: timeText(from + span)})]));
}

// ---- the rule drawn on a frame --------------------------------------------------------------------

function ruleFrame() {
  // A frame of the chosen camera: its newest picture among the hits, else an empty grid.
  const camera = $('rule-camera').value;
  const hit = [...state.hits].reverse().find((h) => h.nodeID === camera && h.objImage);
  return hit ? imageSource(hit.objImage) : null;
}

function drawRule() {
  const canvas = $('rule-canvas');
  const context = canvas.getContext('2d');
  const {width, height} = canvas;
  const kind = $('rule-kind').value;
  $('direction-label').hidden = kind !== 'lineCrossing';
  $('duration-label').hidden = kind !== 'loitering';
  const only = ' A rule searches this camera only.';
  $('rule-help').textContent = kind === 'lineCrossing' ? 'Click the two ends of the line; the arrow shows "along".' + only
                             : kind === 'loitering' ? 'Click the corners of the zone (three or more).' + only
                             : 'No rule: every object in the window counts.';
  const paint = (image) => {
    context.fillStyle = '#20242a';
    context.fillRect(0, 0, width, height);
    if (image) context.drawImage(image, 0, 0, width, height);
    context.strokeStyle = 'rgba(255,255,255,0.15)';
    for (let i = 1; i < 4; ++i) {
      context.beginPath(); context.moveTo(i * width / 4, 0); context.lineTo(i * width / 4, height); context.stroke();
      context.beginPath(); context.moveTo(0, i * height / 4); context.lineTo(width, i * height / 4); context.stroke();
    }
    context.fillStyle = '#ddd';
    context.fillText($('rule-camera').value || 'no camera', 6, 14);
    const points = state.rule.points.map(([x, y]) => [x * width, y * height]);
    context.strokeStyle = '#ffcc00';
    context.fillStyle = 'rgba(255,204,0,0.25)';
    context.lineWidth = 2;
    if (points.length) {
      context.beginPath();
      context.moveTo(...points[0]);
      for (const p of points.slice(1)) context.lineTo(...p);
      if (kind === 'loitering' && points.length > 2) { context.closePath(); context.fill(); }
      context.stroke();
      for (const p of points) { context.beginPath(); context.arc(p[0], p[1], 3, 0, 2 * Math.PI); context.stroke(); }
    }
    if (kind === 'lineCrossing' && points.length === 2) {
      // "Along" crosses from the negative to the positive side of the line from its first end.
      const [a, b] = points;
      const mx = (a[0] + b[0]) / 2, my = (a[1] + b[1]) / 2;
      const length = Math.hypot(b[0] - a[0], b[1] - a[1]) || 1;
      const nx = -(b[1] - a[1]) / length * 24, ny = (b[0] - a[0]) / length * 24;
      context.beginPath(); context.moveTo(mx - nx, my - ny); context.lineTo(mx + nx, my + ny); context.stroke();
      context.beginPath(); context.arc(mx + nx, my + ny, 4, 0, 2 * Math.PI); context.fill(); context.stroke();
    }
    context.lineWidth = 1;
  };
  const source = ruleFrame();
  if (!source) return paint(null);
  const image = new Image();
  image.onload = () => paint(image);
  image.onerror = () => paint(null);
  image.src = source;
}

function addRulePoint(event) {
  const kind = $('rule-kind').value;
  if (!kind) return;
  const canvas = $('rule-canvas');
  const box = canvas.getBoundingClientRect();
  const point = [(event.clientX - box.left) / box.width, (event.clientY - box.top) / box.height];
  if (kind === 'lineCrossing' && state.rule.points.length >= 2) state.rule.points = [];
  state.rule.points.push(point.map((v) => Math.min(1, Math.max(0, v))));
  drawRule();
}

// ---- cases ------------------------------------------------------------------------------------------

const CASE_CODES = {'-1': 'the case vault refused it (or a bookmark failed)', '-2': 'some items could not be updated',
                    '-3': 'that case does not exist any more'};

function checkCode(final, what) {
  if (final.code !== '0') throw new Error(what + ' failed: ' + (CASE_CODES[final.code] || 'code ' + final.code));
  return final.payload;
}

function updatePicked() {
  const n = state.picked.size;
  $('picked-count').textContent = n ? n + ' hit(s) picked.' : 'No hits picked.';
  $('make-case').disabled = n === 0;
}

async function makeCase() {
  showMessage('');
  const name = $('case-name').value.trim();
  if (!name) return showMessage('Give the case a name.');
  const needBookmark = $('case-bookmarks').checked;
  const items = [...state.picked].sort((a, b) => a - b).map((i) => state.hits[i]).map((hit) => ({
    nodeID: hit.nodeID, locID: hit.locID, startTimestamp: hit.startTimestamp, endTimestamp: hit.endTimestamp,
    caseItemType: 0, objImage: hit.objImage || '', faceImage: hit.faceImage || '', trajectory: hit.trajectory || [],
    comment: describeHit(hit), needBookmark}));
  const progress = $('case-progress');
  progress.hidden = false;
  progress.max = items.length;
  progress.value = 0;
  $('case-progress-text').textContent = '0 of ' + items.length + ' items ready';
  $('make-case').disabled = true;
  try {
    const final = await stream('addCaseWithRecordings', {caseName: name, reporter: 'explorer', caseItem: items}, (reply) => {
      if (!reply.final) {
        progress.value += 1;
        $('case-progress-text').textContent = progress.value + ' of ' + items.length + ' items ready';
      }
    });
    if (!final) throw new Error('The case answer ended without its final reply.');
    checkCode(final, 'Making the case');
    $('case-progress-text').textContent = 'Case "' + name + '" made with ' + items.length + ' item(s).';
    state.picked.clear();
    document.querySelectorAll('#hits .pick').forEach((box) => { box.checked = false; });
  } catch (error) {
    showMessage(describeError(error));
    $('case-progress-text').textContent = '';
  } finally {
    updatePicked();
    await loadCases();
  }
}

async function loadCases() {
  try {
    const cases = checkCode(await call('retrieveCaseModel', {}), 'Listing the cases') || [];
    const list = $('case-list');
    list.replaceChildren();
    if (!cases.length) list.append(element('p', {class: 'muted', text: 'No cases yet.'}));
    for (const record of cases) {
      const covers = element('div', {class: 'covers'},
        (record.coverImage || []).filter(Boolean).map((image) => element('img', {class: 'cover', src: imageSource(image), alt: 'cover'})));
      const remove = element('button', {type: 'button', class: 'delete', text: 'Delete', onclick: () => {
        // A second click confirms, so one stray click deletes nothing.
        if (remove.dataset.armed) deleteCase(record.caseId);
        else { remove.dataset.armed = '1'; remove.textContent = 'Really delete?'; }
      }});
      list.append(element('div', {class: 'case', 'data-case': String(record.caseId)}, [covers,
        element('div', {class: 'case-name', text: record.caseName}),
        element('div', {class: 'muted', text: 'No. ' + record.caseNumber + ' · ' + (record.startTimestamp || '') + ' – ' + (record.endTimestamp || '')}),
        element('button', {type: 'button', class: 'open', text: 'Open', onclick: () => openCase(record.caseId)}), remove]));
    }
  } catch (error) {
    showMessage(describeError(error));
  }
}

// The vault keeps a trajectory as JSON text.
function trajectoryOf(value) {
  if (typeof value !== 'string') return Array.isArray(value) ? value : [];
  try {
    const points = JSON.parse(value);
    return Array.isArray(points) ? points : [];
  } catch (error) {
    return [];
  }
}

async function openCase(caseId) {
  showMessage('');
  try {
    const model = checkCode(await call('retrieveCaseItemModel', caseId), 'Opening the case');
    const info = model.caseInfoMap || {};
    if (!info.caseId) throw new Error('Case ' + caseId + ' does not exist any more.');
    state.openCase = {info, items: model.caseItemList || []};
    $('case-detail').hidden = false;
    $('case-number').textContent = info.caseNumber + ' (' + info.caseName + ')';
    $('case-rename').value = info.caseName;
    const grid = $('case-items');
    grid.replaceChildren();
    for (const item of state.openCase.items) {
      const hit = {objImage: item.objImage, faceImage: item.faceImage, trajectory: trajectoryOf(item.trajectory), nodeID: item.nodeID,
                   locID: item.locID, startTimestamp: item.startTimestamp, objectID: item.id, objType: ''};
      const card = hitCard(hit, [element('button', {type: 'button', class: 'remove', text: 'Remove from case',
                                                    onclick: () => saveCase(info.caseName, item.id)})]);
      card.querySelector('.what').textContent = item.comment || '';
      grid.append(card);
    }
    if (!state.openCase.items.length) grid.append(element('p', {class: 'muted', text: 'This case has no items.'}));
  } catch (error) {
    showMessage(describeError(error));
  }
}

// Renames the open case and/or drops one item: the update keeps exactly the items it is given.
async function saveCase(name, dropItemId) {
  const open = state.openCase;
  if (!open) return;
  if (!name.trim()) return showMessage('A case needs a name.');
  try {
    const items = open.items.filter((item) => item.id !== dropItemId);
    checkCode(await call('updateCase', {caseId: open.info.caseId, caseName: name.trim(), description: open.info.description || '',
                                        caseItem: items}), 'Saving the case');
    await openCase(open.info.caseId);
  } catch (error) {
    showMessage(describeError(error));
  }
  await loadCases();
}

async function deleteCase(caseId) {
  showMessage('');
  try {
    checkCode(await call('deleteCase', caseId), 'Deleting the case');
    if (state.openCase && state.openCase.info.caseId === caseId) {
      state.openCase = null;
      $('case-detail').hidden = true;
    }
  } catch (error) {
    showMessage(describeError(error));
  }
  await loadCases();
}

// ---- start ---------------------------------------------------------------------------------------

function start() {
  $('client-name').textContent = 'this tab is client ' + clientId;
  const now = new Date();
  $('end').value = localInputValue(now);
  $('start').value = localInputValue(new Date(now.getTime() - 3600 * 1000));
  $('search-form').addEventListener('submit', runSearch);
  $('stop-button').addEventListener('click', () => stopRunning());
  document.querySelectorAll('input[name=kind]').forEach((radio) => radio.addEventListener('change', () => {
    const kind = document.querySelector('input[name=kind]:checked').value;
    $('person-attributes').hidden = kind !== 'person';
    $('vehicle-attributes').hidden = kind !== 'vehicle';
  }));
  $('rule-kind').addEventListener('change', () => { state.rule.points = []; drawRule(); });
  $('rule-camera').addEventListener('change', drawRule);
  $('direction').addEventListener('change', drawRule);
  $('rule-clear').addEventListener('click', () => { state.rule.points = []; drawRule(); });
  $('rule-canvas').addEventListener('click', addRulePoint);
  $('make-case').addEventListener('click', makeCase);
  $('case-rename-button').addEventListener('click', () => saveCase($('case-rename').value));
  $('case-close').addEventListener('click', () => { $('case-detail').hidden = true; state.openCase = null; });
  // A tab that goes away stops its own search instead of leaving it to run to its end.
  window.addEventListener('pagehide', () => {
    if (state.search) navigator.sendBeacon('/request', JSON.stringify({command: state.search.stopCommand, params: {}, client: clientId, wait: 0}));
  });
  drawRule();
  waitForCameras();
  loadCases();
}

start();
