// The q7agent dashboard: reads the agent's JSON API every few seconds and updates the page in
// place. Chart.js (Debian's libjs-chart.js, loaded before this module) is the global `Chart`.
//
// Everything taken from the agent's rows reaches the page as text nodes (textContent), never as
// markup: application names, URLs and messages come from the traffic watched.

const REFRESH_MS = 5000;
const TOKEN_KEY = 'q7agent.apiToken';
// The sample tables whose rows grow with the traffic are read less often.
const SLOW_EVERY = 3;
const MAX_INTERVALS = 288;    // over-time points kept: a day of 5-minute intervals
const FULL_OVER_TIME_EVERY = 60;  // refreshes between full reads of the over-time rows
const TOP_BARS = 8;           // applications or transactions in the split chart
const MAX_ROOTS = 8;          // pages whose embedded objects a transaction's detail reads
const MAX_ROWS = 50;          // rows of a drill-down table; the rest are counted under it
const MAX_OBJECTS = 20;       // embedded objects listed for a transaction
const COLORS = {
  good: '#2f9e5b',
  slow: '#e3a21a',
  failed: '#d64545',
  server: '#3b6fd4',
  network: '#8d5bd0',
  client: '#1ea3a3',
  status: ['#8a94a6', '#2f9e5b', '#3b6fd4', '#e3a21a', '#d64545'],
};

// ---- The API

class Unauthorized extends Error {}

function storedToken() {
  try {
    return localStorage.getItem(TOKEN_KEY) || '';
  } catch {
    return '';  // storage refused (private mode): ask again after a reload
  }
}

function storeToken(token) {
  try {
    localStorage.setItem(TOKEN_KEY, token);
  } catch {
    // Kept for this page only.
  }
  sessionToken = token;
}

let sessionToken = storedToken();

async function api(path) {
  const headers = {Accept: 'application/json'};
  if (sessionToken) {
    headers.Authorization = `Bearer ${sessionToken}`;
  }
  const res = await fetch(path, {headers, cache: 'no-store'});
  if (res.status === 401) {
    throw new Unauthorized();
  }
  const body = await res.json().catch(() => ({}));
  if (!res.ok) {
    throw new Error(`${path}: HTTP ${res.status} ${body.error || ''}`.trim());
  }
  return body;
}

// ?where=COLUMN OP VALUE; spaces as %20, which the agent reads in every parameter.
function query(params) {
  const parts = [];
  for (const [key, value] of params) {
    parts.push(`${key}=${encodeURIComponent(value)}`);
  }
  return parts.length ? `?${parts.join('&')}` : '';
}

async function sample(table, ...where) {
  const body = await api(`/api/v1/tables/${table}${query(where.map((w) => ['where', w]))}`);
  return body.rows || [];
}

// Percentiles are extras: while the analyzer starts (503) the tables are shown without them.
async function latency(by, ...where) {
  const params = [['by', by], ...where.map((w) => ['where', w])];
  try {
    const body = await api(`/api/v1/latency${query(params)}`);
    return body.rows || [];
  } catch (error) {
    if (error instanceof Unauthorized) {
      throw error;
    }
    return [];
  }
}

// ---- Formatting

const integer = new Intl.NumberFormat(undefined, {maximumFractionDigits: 0});
const decimal2 = new Intl.NumberFormat(undefined, {minimumFractionDigits: 2, maximumFractionDigits: 2});
const timeOfDay = new Intl.DateTimeFormat(undefined, {hour: '2-digit', minute: '2-digit'});
const dayAndTime = new Intl.DateTimeFormat(undefined, {
  month: 'short', day: 'numeric', hour: '2-digit', minute: '2-digit', second: '2-digit',
});

function fmtInt(n) {
  return Number.isFinite(n) ? integer.format(n) : '–';
}

function fmtMs(ms) {
  if (!Number.isFinite(ms)) {
    return '–';
  }
  if (ms >= 100000) {
    return `${integer.format(ms / 1000)} s`;
  }
  return ms >= 10000 ? `${decimal2.format(ms / 1000)} s` : `${integer.format(ms)} ms`;
}

// The agent's percentages are thousandths of a percent (97250 is 97.25 %).
function fmtPercent(thousandths) {
  if (!Number.isFinite(thousandths)) {
    return '–';
  }
  const tenths = Math.round(thousandths / 100);
  return `${tenths % 10 === 0 ? tenths / 10 : (tenths / 10).toFixed(1)}%`;
}

// The framework's timestamps, CYYMMDDHHMMSSmmm in the agent's local time (C: 1 for 20xx).
function parseStamp(text) {
  const m = /^([01])(\d\d)(\d\d)(\d\d)(\d\d)(\d\d)(\d\d)(\d{3})$/.exec(String(text));
  if (!m) {
    return null;
  }
  const [, century, yy, mo, dd, hh, mi, ss] = m;
  const date = new Date(1900 + 100 * Number(century) + Number(yy), Number(mo) - 1, Number(dd),
                        Number(hh), Number(mi), Number(ss));
  return Number.isNaN(date.getTime()) ? null : date;
}

function fmtStamp(text, format = dayAndTime) {
  const date = parseStamp(text);
  return date ? format.format(date) : String(text ?? '');
}

// ---- Aggregating rows

// Counters of one or more table rows (times are the rows' per-request averages, weighted back
// into sums).
function newTotals() {
  return {
    requests: 0, good: 0, slow: 0, failed: 0, time: 0, server: 0, network: 0, client: 0,
    max: 0, threshold: null, status: [0, 0, 0, 0, 0], roots: new Map(),
  };
}

function addRow(t, row) {
  const n = Number(row.totreq) || 0;
  t.requests += n;
  t.good += Number(row.succreq) || 0;
  t.slow += Number(row.slowreq) || 0;
  t.failed += Number(row.failreq) || 0;
  t.time += (Number(row.oatime) || 0) * n;
  t.server += (Number(row.servtime) || 0) * n;
  t.network += (Number(row.netwtime) || 0) * n;
  t.client += (Number(row.clienttime) || 0) * n;
  t.max = Math.max(t.max, Number(row.maxrtt) || 0);
  if (row.mrtthres !== undefined) {
    t.threshold = row.mrtthres;
  }
  for (let i = 0; i < 5; ++i) {
    t.status[i] += Number(row[`num${i + 1}xx`]) || 0;
  }
  if (row.rootuuid) {
    t.roots.set(row.rootuuid, (t.roots.get(row.rootuuid) || 0) + n);
  }
  return t;
}

const average = (t, sum) => (t.requests ? sum / t.requests : NaN);
const availability = (t) => (t.requests ? ((t.requests - t.failed) / t.requests) * 100000 : NaN);

function groupRows(rows, keyOf) {
  const groups = new Map();
  for (const row of rows) {
    const key = keyOf(row);
    if (!groups.has(key)) {
      groups.set(key, newTotals());
    }
    addRow(groups.get(key), row);
  }
  return groups;
}

function byRequests(groups) {
  return [...groups].sort((a, b) => b[1].requests - a[1].requests || (a[0] < b[0] ? -1 : 1));
}

function sumOf(groups) {
  const all = newTotals();
  for (const t of groups.values()) {
    all.requests += t.requests;
    all.good += t.good;
    all.slow += t.slow;
    all.failed += t.failed;
    all.time += t.time;
    all.server += t.server;
    all.network += t.network;
    all.client += t.client;
    t.status.forEach((v, i) => { all.status[i] += v; });
  }
  return all;
}

// A client's subnet: pattern names ("10.1.0.*") stay as they are, IPv4 addresses go to their
// /24 and IPv6 addresses to their /64.
function subnetOf(client) {
  const text = String(client);
  if (text.includes('*')) {
    return text;
  }
  const v4 = /^(\d+)\.(\d+)\.(\d+)\.\d+$/.exec(text);
  if (v4) {
    return `${v4[1]}.${v4[2]}.${v4[3]}.0/24`;
  }
  if (text.includes(':')) {
    const [head, tail = ''] = text.split('::');
    const left = head ? head.split(':') : [];
    const right = tail ? tail.split(':') : [];
    const groups = text.includes('::')
      ? [...left, ...Array(Math.max(0, 8 - left.length - right.length)).fill('0'), ...right]
      : left;
    if (groups.length === 8) {
      return `${groups.slice(0, 4).map((g) => g.replace(/^0+(?=.)/, '')).join(':')}::/64`;
    }
  }
  return text;
}

// ---- DOM helpers (text only)

function el(tag, props = {}, ...children) {
  const node = document.createElement(tag);
  for (const [key, value] of Object.entries(props)) {
    if (key === 'class') {
      node.className = value;
    } else if (key === 'text') {
      node.textContent = value;
    } else if (key === 'title') {
      node.title = value;
    } else if (key.startsWith('data-')) {
      node.setAttribute(key, value);
    } else {
      node[key] = value;
    }
  }
  for (const child of children) {
    if (child !== null && child !== undefined) {
      node.append(child);  // strings become text nodes
    }
  }
  return node;
}

const numCell = (text, extra = '') => el('td', {class: `num ${extra}`.trim(), text});

function outcomeBar(t) {
  const bar = el('span', {class: 'outcomes', title: `good ${t.good}, slow ${t.slow}, failed ${t.failed}`});
  for (const [kind, n] of [['good', t.good], ['slow', t.slow], ['failed', t.failed]]) {
    if (n > 0) {
      const part = el('span', {class: kind});
      part.style.flexGrow = String(n);
      bar.append(part);
    }
  }
  return bar;
}

function apdexCell(value) {
  if (!Number.isFinite(value)) {
    return numCell('–');
  }
  const grade = value >= 0.94 ? 'excellent' : value >= 0.85 ? 'good' : value >= 0.7 ? 'fair' : 'poor';
  return el('td', {class: `num apdex ${grade}`, text: decimal2.format(value)});
}

// Narrow phones leave the failed column out: the outcome bar and the availability tell it.
function failedCell(t) {
  return numCell(fmtInt(t.failed), t.failed > 0 ? 'bad opt2' : 'opt2');
}

// A clickable row: a link in its first cell, so that keyboards and "open in new tab" work,
// and the whole row follows it on a click.
function linkRow(href, label, dataset, cells, selected) {
  const link = el('a', {href, text: label});
  const row = el('tr', {class: selected ? 'clickable selected' : 'clickable', ...dataset},
                 el('td', {class: 'name'}, link), ...cells);
  row.addEventListener('click', (event) => {
    if (event.target !== link) {
      location.hash = href.slice(1);
    }
  });
  return row;
}

function fillBody(table, rows) {
  document.querySelector(`#${table} tbody`).replaceChildren(...rows);
}

// The first `limit` of `entries`, and a note under the table saying how many were left out.
function firstOf(table, entries, limit, noun) {
  const note = document.getElementById(`${table}-more`);
  note.hidden = entries.length <= limit;
  note.textContent = `${fmtInt(entries.length - limit)} more ${noun} with fewer requests not shown.`;
  return entries.slice(0, limit);
}

// ---- Selection: #app=NAME[&tx=TRANSACTION]

function selection() {
  const params = new URLSearchParams(location.hash.slice(1));
  return {app: params.get('app') || '', tx: params.get('tx') || ''};
}

function hashFor(app, tx) {
  const params = new URLSearchParams();
  if (app) {
    params.set('app', app);
  }
  if (tx) {
    params.set('tx', tx);
  }
  return `#${params.toString()}`;
}

// ---- Charts (created once, updated in place)

Chart.defaults.animation = false;
Chart.defaults.maintainAspectRatio = false;
Chart.defaults.font.family = getComputedStyle(document.body).fontFamily;
Chart.defaults.plugins.legend.labels.boxWidth = 12;

const shortLabel = (text, n = 24) => (text.length > n ? `${text.slice(0, n - 1)}…` : text);

const charts = {
  outcomes: new Chart(document.getElementById('chart-outcomes'), {
    type: 'bar',
    data: {
      labels: [],
      datasets: [
        {label: 'Good', data: [], backgroundColor: COLORS.good},
        {label: 'Slow', data: [], backgroundColor: COLORS.slow},
        {label: 'Failed', data: [], backgroundColor: COLORS.failed},
      ],
    },
    options: {
      scales: {x: {stacked: true, ticks: {maxRotation: 0, autoSkipPadding: 12}}, y: {stacked: true, beginAtZero: true}},
      plugins: {tooltip: {mode: 'index', intersect: false}},
    },
  }),
  split: new Chart(document.getElementById('chart-split'), {
    type: 'bar',
    data: {
      labels: [],
      datasets: [
        {label: 'Server', data: [], backgroundColor: COLORS.server},
        {label: 'Network', data: [], backgroundColor: COLORS.network},
        {label: 'Client', data: [], backgroundColor: COLORS.client},
      ],
    },
    options: {
      indexAxis: 'y',
      scales: {
        x: {stacked: true, beginAtZero: true, title: {display: true, text: 'average ms'}},
        y: {stacked: true, ticks: {callback(value) { return shortLabel(this.getLabelForValue(value)); }}},
      },
      plugins: {
        tooltip: {
          mode: 'index',
          intersect: false,
          callbacks: {label: (item) => `${item.dataset.label}: ${fmtMs(item.raw)}`},
        },
      },
    },
  }),
  status: new Chart(document.getElementById('chart-status'), {
    type: 'doughnut',
    data: {
      labels: ['1xx', '2xx', '3xx', '4xx', '5xx'],
      datasets: [{data: [0, 0, 0, 0, 0], backgroundColor: COLORS.status}],
    },
    options: {plugins: {legend: {position: 'right'}}},
  }),
};

// Server, network and client parts that add up to the average response time: the agent's client
// time is everything off the server, network included, so the client part is what remains after
// the network.
function splitOf(t) {
  const server = average(t, t.server);
  const network = average(t, t.network);
  const client = Math.max(0, average(t, t.client) - network);
  return [server, network, client].map((v) => (Number.isFinite(v) ? Math.round(v) : 0));
}

function updateCharts(scope, overTime, splitGroups, statusTotals) {
  const times = [...overTime.keys()].sort();
  const dates = times.map((stamp) => parseStamp(stamp));
  const oneDay = dates.length < 2 || dates[0]?.toDateString() === dates.at(-1)?.toDateString();
  const labelFormat = oneDay ? timeOfDay
    : new Intl.DateTimeFormat(undefined, {month: 'numeric', day: 'numeric', hour: '2-digit', minute: '2-digit'});
  const o = charts.outcomes;
  o.data.labels = times.map((stamp) => fmtStamp(stamp, labelFormat));
  o.data.datasets[0].data = times.map((stamp) => overTime.get(stamp).good);
  o.data.datasets[1].data = times.map((stamp) => overTime.get(stamp).slow);
  o.data.datasets[2].data = times.map((stamp) => overTime.get(stamp).failed);
  o.update('none');

  const top = byRequests(splitGroups).slice(0, TOP_BARS);
  const s = charts.split;
  s.data.labels = top.map(([name]) => name);
  const parts = top.map(([, t]) => splitOf(t));
  s.data.datasets.forEach((dataset, i) => { dataset.data = parts.map((p) => p[i]); });
  s.update('none');

  charts.status.data.datasets[0].data = [...statusTotals.status];
  charts.status.update('none');

  for (const node of document.querySelectorAll('.scope')) {
    node.textContent = scope ? `· ${scope}` : '· all applications';
  }
}

// ---- Over-time rows, read in full once, then from the newest interval on

const overTimeRows = new Map();  // interval timestamp -> rows of Q7APPOT

async function readOverTime() {
  if (tick % FULL_OVER_TIME_EVERY === 0) {
    overTimeRows.clear();  // intervals past the summary period leave the table: drop them too
  }
  const stamps = [...overTimeRows.keys()].sort();
  const newest = stamps.at(-1);
  const rows = newest ? await sample('Q7APPOT', `timestamp GE ${newest}`) : await sample('Q7APPOT');
  const fresh = new Map();
  for (const row of rows) {
    if (!fresh.has(row.timestamp)) {
      fresh.set(row.timestamp, []);
    }
    fresh.get(row.timestamp).push(row);
  }
  for (const [stamp, list] of fresh) {
    overTimeRows.set(stamp, list);
  }
  const all = [...overTimeRows.keys()].sort();
  for (const stamp of all.slice(0, Math.max(0, all.length - MAX_INTERVALS))) {
    overTimeRows.delete(stamp);
  }
}

function overTimeFor(app) {
  const series = new Map();
  for (const [stamp, rows] of overTimeRows) {
    series.set(stamp, groupRows(rows.filter((r) => !app || r.applicatin === app), () => 'all').get('all') || newTotals());
  }
  return series;
}

// ---- Rendering

function renderStatus(agent, health) {
  document.getElementById('node').textContent =
    [agent.origin_node, agent.version && `version ${agent.version}`].filter(Boolean).join(' · ');
  const counters = agent.counters || {};
  const chips = [
    ['status', health.status],
    ['analyzer', health.analyzer],
    ['collector', health.collector],
    ['records read', Number.isFinite(counters.records_read) ? fmtInt(counters.records_read) : null],
  ];
  document.getElementById('status').replaceChildren(...chips
    .filter(([, value]) => value !== undefined && value !== null)
    .map(([name, value]) => el('li', {class: `chip ${value === 'ok' || value === 'running' ? 'ok' : ''}`},
                               el('span', {class: 'muted', text: `${name} `}), String(value))));
}

function renderApplications(apps, latencyRows, app) {
  const percentiles = new Map(latencyRows.map((r) => [r.application, r]));
  const rows = byRequests(apps).map(([name, t]) => {
    const p = percentiles.get(name) || {};
    const row = linkRow(hashFor(name), name, {'data-app': name}, [
      el('td', {class: 'num c-requests', text: fmtInt(t.requests)}),
      numCell(fmtInt(t.good), 'opt'),
      numCell(fmtInt(t.slow), 'opt'),
      failedCell(t),
      numCell(fmtPercent(availability(t))),
      numCell(fmtMs(average(t, t.time)), 'opt2'),
      numCell(fmtMs(p.p50_ms), 'opt'),
      numCell(fmtMs(p.p95_ms)),
      numCell(fmtMs(p.p99_ms), 'opt'),
      apdexCell(p.apdex),
    ], name === app);
    // The outcome bar sits under the name, where it needs no column of its own.
    row.firstChild.append(outcomeBar(t));
    return row;
  });
  fillBody('apps', rows);
  document.querySelector('#overview .empty').hidden = rows.length > 0;
}

function renderTransactions(app, tx, groups, latencyRows) {
  document.getElementById('detail-name').textContent = app;
  const percentiles = new Map(latencyRows.map((r) => [r.transaction, r]));
  const rows = firstOf('transactions', byRequests(groups), MAX_ROWS, 'transactions').map(([name, t]) => {
    const p = percentiles.get(name) || {};
    return linkRow(hashFor(app, name), name, {'data-transaction': name}, [
      el('td', {class: 'num c-requests', text: fmtInt(t.requests)}),
      numCell(fmtInt(t.good), 'opt'),
      numCell(fmtInt(t.slow), 'opt'),
      failedCell(t),
      numCell(fmtPercent(availability(t))),
      numCell(fmtMs(average(t, t.time)), 'opt2'),
      numCell(fmtMs(average(t, t.server)), 'opt'),
      numCell(fmtMs(average(t, t.network)), 'opt'),
      numCell(fmtMs(average(t, t.client)), 'opt'),
      numCell(fmtMs(p.p95_ms)),
      apdexCell(p.apdex),
      numCell(t.threshold === null ? '–' : fmtMs(t.threshold), 'opt'),
    ], name === tx);
  });
  fillBody('transactions', rows);
  document.getElementById('transactions-empty').hidden = rows.length > 0;
}

function renderSubtransactions(tx, groups) {
  document.getElementById('subtransactions-of').textContent = tx ? `of ${tx}` : '(click a transaction)';
  const rows = firstOf('subtransactions', byRequests(groups), MAX_OBJECTS, 'objects').map(([name, t]) => el('tr', {'data-object': name},
    el('td', {class: 'name', text: name}),
    numCell(fmtInt(t.requests)),
    failedCell(t),
    numCell(fmtMs(average(t, t.time))),
    numCell(fmtMs(average(t, t.server)), 'opt'),
    numCell(fmtMs(average(t, t.network)), 'opt'),
    numCell(fmtMs(t.max), 'opt2')));
  fillBody('subtransactions', rows);
}

function renderClients(rows) {
  const members = new Map();
  const groups = groupRows(rows, (r) => subnetOf(r.client));
  for (const row of rows) {
    const key = subnetOf(row.client);
    if (!members.has(key)) {
      members.set(key, new Set());
    }
    members.get(key).add(row.client);
  }
  fillBody('clients', byRequests(groups).slice(0, 15).map(([name, t]) => el('tr', {},
    el('td', {class: 'name', text: name}),
    numCell(fmtInt(members.get(name).size), 'opt'),
    numCell(fmtInt(t.requests)),
    failedCell(t),
    numCell(fmtPercent(availability(t))),
    numCell(fmtMs(average(t, t.time))),
    numCell(fmtMs(average(t, t.network)), 'opt'))));
}

function renderServers(rows) {
  fillBody('servers', byRequests(groupRows(rows, (r) => r.server)).slice(0, 15).map(([name, t]) => el('tr', {},
    el('td', {class: 'name', text: name}),
    numCell(fmtInt(t.requests)),
    failedCell(t),
    numCell(fmtPercent(availability(t))),
    numCell(fmtMs(average(t, t.time))),
    numCell(fmtMs(average(t, t.server)), 'opt'))));
}

function renderSituations(situations) {
  fillBody('situations', situations.map((s) => el('tr', {},
    el('td', {class: 'name', text: s.name}),
    el('td', {text: s.table}),
    el('td', {class: 'conditions'}, ...(s.conditions || []).map((c) => el('span', {
      class: 'condition',
      text: `${c.column}${c.op === 'EQ' ? '=' : ` ${c.op} `}${c.value}`,
    }))))));
}

// An alert's key as "column=value" words.
const keyText = (key) => Object.entries(key || {}).map(([column, value]) => `${column}=${value}`).join(' ');
const isAlertChange = (e) => e.kind === 'raised' || e.kind === 'cleared';
const epochTime = (seconds) => (seconds ? new Date(seconds * 1000).toLocaleString() : '');

function renderAlerts(open) {
  fillBody('alerts', open.map((a) => el('tr', {class: `alert ${a.severity}`},
    el('td', {class: 'severity', text: a.severity}),
    el('td', {class: 'name', text: a.situation}),
    el('td', {class: 'key', text: keyText(a.key)}),
    el('td', {text: epochTime(a.raised_at_epoch)}))));
  if (open.length === 0) {
    fillBody('alerts', [el('tr', {}, el('td', {class: 'muted', colSpan: 4, text: 'No open alerts.'}))]);
  }
}

const SEVERITY = {I: 'info', W: 'warning', E: 'error'};

function renderEvents(events) {
  const items = [...events].reverse().slice(0, 20).map((e) => {
    if (isAlertChange(e)) {
      return el('li', {class: `event ${e.kind === 'raised' ? 'error' : 'info'}`},
        el('time', {text: epochTime(e.at_epoch)}),
        el('span', {class: 'msgid', text: `alert ${e.kind}`}),
        el('span', {class: 'msgtext', text: `${e.situation} (${e.severity}): ${keyText(e.key)}`}));
    }
    const kind = SEVERITY[String(e.msgid || '').slice(-1)] || 'info';
    return el('li', {class: `event ${kind}`},
      el('time', {text: fmtStamp(e.msgdattime)}),
      el('span', {class: 'msgid', text: e.msgid || ''}),
      el('span', {class: 'msgtext', text: e.msgtext || ''}));
  });
  const list = document.getElementById('events');
  list.replaceChildren(...items);
  if (items.length === 0) {
    list.append(el('li', {class: 'muted', text: 'No events yet.'}));
  }
}

// ---- The refresh loop

let tick = 0;
let timer = null;
let busy = false;     // a refresh is running
let again = false;    // another was asked for meanwhile (a new selection)
let slowRows = {clients: [], servers: [], key: null};
let waitingForToken = false;
let shownApp = '';

function setBanner(text) {
  const banner = document.getElementById('banner');
  banner.textContent = text || '';
  banner.hidden = !text;
}

async function readSlowTables(app) {
  const where = app ? [`applicatin EQ ${app}`] : [];
  const [clients, servers] = await Promise.all([
    sample(app ? 'Q7CLNTAPP' : 'Q7CLNTSM', ...where),
    sample(app ? 'Q7SRVAPPSM' : 'Q7SRVSM', ...where),
  ]);
  slowRows = {clients, servers, key: app};
}

// The embedded objects of the pages a transaction counted, by object URL: sub-transaction rows
// are keyed by the page they belong to.
async function readSubtransactions(txTotals) {
  if (!txTotals) {
    return new Map();
  }
  const roots = [...txTotals.roots].sort((a, b) => b[1] - a[1]).slice(0, MAX_ROOTS).map(([root]) => root);
  const lists = await Promise.all(roots.map((root) => sample('Q7SUBTXSM', `rootuuid EQ ${root}`)));
  return groupRows(lists.flat(), (r) => r.transactn);
}

async function refresh() {
  const {app, tx} = selection();
  const slow = tick % SLOW_EVERY === 0 || slowRows.key !== app;
  const [agent, health, appRows, appLatency, situations, events, alerts] = await Promise.all([
    api('/api/v1/agent'),
    api('/healthz'),
    sample('Q7APPSM'),
    latency('application'),
    api('/api/v1/situations'),
    api('/api/v1/events?limit=50'),
    api('/api/v1/alerts?limit=0'),
    readOverTime(),
    slow ? readSlowTables(app) : null,
  ]);
  const apps = groupRows(appRows, (r) => r.applicatin);
  let splitGroups = apps;
  let statusTotals = sumOf(apps);
  if (app) {
    const [txRows, txLatency] = await Promise.all([
      sample('Q7TXSM', `applicatin EQ ${app}`),
      latency('transaction', `application EQ ${app}`),
    ]);
    const transactions = groupRows(txRows, (r) => r.transactn);
    renderTransactions(app, tx, transactions, txLatency);
    renderSubtransactions(tx, await readSubtransactions(transactions.get(tx)));
    splitGroups = transactions;
    statusTotals = apps.get(app) || sumOf(transactions);
  }
  document.getElementById('detail').hidden = !app;

  renderStatus(agent, health);
  renderApplications(apps, appLatency, app);
  updateCharts(app, overTimeFor(app), splitGroups, statusTotals);
  renderClients(slowRows.clients);
  renderServers(slowRows.servers);
  renderAlerts(alerts.open || []);
  renderSituations(situations.situations || []);
  renderEvents(events.events || []);
  if (app && app !== shownApp) {
    document.getElementById('detail').scrollIntoView({block: 'start'});
  }
  shownApp = app;
}

async function cycle() {
  clearTimeout(timer);
  if (busy) {
    again = true;
    return;
  }
  if (waitingForToken) {
    return;
  }
  busy = true;
  try {
    await refresh();
    ++tick;
    setBanner('');
    document.getElementById('updated').textContent = `updated ${new Date().toLocaleTimeString()}`;
    document.body.dataset.refreshes = String(tick);
  } catch (error) {
    if (error instanceof Unauthorized) {
      busy = false;
      askForToken();
      return;
    }
    setBanner(`Cannot read the agent's API (${error.message}); trying again every ${REFRESH_MS / 1000} s.`);
  }
  busy = false;
  if (again) {
    again = false;
    cycle();
  } else {
    timer = setTimeout(cycle, REFRESH_MS);
  }
}

// ---- The token

const dialog = document.getElementById('token-dialog');

function askForToken() {
  waitingForToken = true;
  document.getElementById('token-button').hidden = false;
  setBanner('The agent asks for its API token.');
  if (!dialog.open) {
    document.getElementById('token-input').value = '';
    dialog.showModal();
  }
}

dialog.addEventListener('close', () => {
  const token = document.getElementById('token-input').value.trim();
  if (dialog.returnValue === 'save' && token) {
    storeToken(token);
    waitingForToken = false;
    cycle();
  }
});

document.getElementById('token-button').addEventListener('click', askForToken);

// A new selection reads its rows at once; the over-time rows stay.
window.addEventListener('hashchange', cycle);

cycle();
