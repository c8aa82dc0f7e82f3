// The merged timeline of a run, drawn from the columns the report's data
// scripts hand to C(); done() starts the page once the last one has run.
// Only what is on screen is drawn: the timeline and histogram are canvases,
// the entry list is a pool of rows refilled on scroll.
"use strict";
(function () {

const SRC = "KMSREB";
const SRC_NAME = ["kernel", "main", "system", "radio", "events", "bluetooth"];
const SRC_COLOR = ["#8250df", "#0969da", "#1a7f37", "#bc4c00", "#bf3989", "#0a7ea4"];
const PRIO_LETTER = "XAFEWNIDV";  // 0 emerg .. 8 verbose, one scale for kernel and Android
const PRIO_NAME = ["emerg", "alert", "fatal/crit", "error", "warning", "notice", "info", "debug", "verbose"];
// Histogram classes, worst first: error and worse, warning, notice/info, debug, verbose, none.
const CLS_COLOR = ["#d32f2f", "#f59e0b", "#2e9d57", "#4a8fd8", "#a0a8b0", "#c9b8e8"];
const CLS_NAME = ["error+", "warning", "info", "debug", "verbose", "no priority"];
const cls = p => p < 0 ? 5 : p <= 3 ? 0 : p === 4 ? 1 : p <= 6 ? 2 : p === 7 ? 3 : 4;
const $ = id => document.getElementById(id);

// ---- data ----------------------------------------------------------------
const DIGIT = new Int8Array(128).fill(-1);
"ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/".split("").forEach((c, i) => {
    DIGIT[c.charCodeAt(0)] = i;
});
let N = 0, cap = 0;
let TM, SK, PR, PID, TID, TAG, FIL, OFF, BOOT, TZ, MO, CH;  // columns, one value per entry
const chunks = [];   // message text of each chunk, entries separated by "\n"
const chunkFirst = [];
const tags = [], files = [], fileIndex = new Map();
const boots = [];    // {boot, name, first, last, n}
const dec = { us: [0, 0], file: [0, 0, 0, 0, 0, 0], off: [0, 0, 0, 0, 0, 0], boot: -1, tz: 0 };

function grow(need) {
    if (need <= cap) return;
    let c = Math.max(need, cap * 2, 4096);
    const g = (T, old) => { const a = new T(c); if (old) a.set(old.subarray(0, N)); return a; };
    TM = g(Float64Array, TM); SK = g(Uint8Array, SK); PR = g(Int8Array, PR); PID = g(Int32Array, PID);
    TID = g(Int32Array, TID); TAG = g(Int32Array, TAG); FIL = g(Int32Array, FIL); OFF = g(Float64Array, OFF);
    BOOT = g(Int16Array, BOOT); TZ = g(Int32Array, TZ); MO = g(Int32Array, MO); CH = g(Int32Array, CH);
    cap = c;
}

// One chunk of entries: N columns as base-64 VLQ numbers in COLS, the
// messages in MSGS, the tags, file names and boot names first used in it.
let firstDataMs = -1, decodeMs = 0;
function C(n, cols, msgs, newTags, newFiles, newBoots) {
    const t0 = performance.now();
    if (firstDataMs < 0) firstDataMs = t0;
    for (const t of newTags) tags.push(t);
    grow(N + n);
    let p = 0, fi = 0, bi = 0;
    const v = () => {
        let r = 0, m = 1, d;
        do { d = DIGIT[cols.charCodeAt(p++)]; r += (d & 31) * m; m *= 32; } while (d & 32);
        return r;
    };
    const zz = u => (u % 2 ? -(u + 1) / 2 : u / 2);
    const ch = chunks.length;
    chunks.push(msgs); chunkFirst.push(N);
    let mo = 0;
    for (let k = 0; k < n; k++) {
        const e = N + k;
        const h = v();
        const x = h & 1 ? v() : 0;
        const src = (h >> 1) & 7, rel = (x >> 3) & 1;
        const t = dec.us[rel] + zz(v());
        dec.us[rel] = t;
        const pid = v() - 1;
        TM[e] = t; SK[e] = src | rel << 3 | (x & 7) << 4; PR[e] = (h >> 4) - 1;
        PID[e] = pid; TID[e] = pid + zz(v()); TAG[e] = v();
        if (x & 16) {
            const f = newFiles[fi++];
            let id = fileIndex.get(f);
            if (id === undefined) { id = files.length; files.push(f); fileIndex.set(f, id); }
            dec.file[src] = id; dec.off[src] = 0;
        }
        FIL[e] = dec.file[src];
        OFF[e] = dec.off[src] = dec.off[src] + zz(v());
        if (x & 32) {
            const b = zz(v()), name = newBoots[bi++];
            dec.boot = boots.findIndex(o => o.boot === b && o.name === name);
            if (dec.boot < 0) { dec.boot = boots.length; boots.push({ boot: b, name, first: Infinity, last: -Infinity, n: 0 }); }
        }
        if (x & 64) dec.tz = zz(v());
        if (dec.boot < 0) { dec.boot = 0; boots.push({ boot: 0, name: "", first: Infinity, last: -Infinity, n: 0 }); }
        BOOT[e] = dec.boot; TZ[e] = dec.tz;
        const bo = boots[dec.boot];
        bo.n++;
        if (!rel) { if (t < bo.first) bo.first = t; if (t > bo.last) bo.last = t; }
        MO[e] = mo; CH[e] = ch;
        if (k < n - 1) mo = msgs.indexOf("\n", mo) + 1;
    }
    N += n;
    decodeMs += performance.now() - t0;
    document.currentScript && document.currentScript.remove();  // its text is decoded: let it go
}

function message(e) {
    const s = chunks[CH[e]];
    const end = e + 1 < N && CH[e + 1] === CH[e] ? MO[e + 1] - 1 : s.length;
    return s.substring(MO[e], end);
}
const src = e => SK[e] & 7, isRel = e => (SK[e] >> 3) & 1, kind = e => SK[e] >> 4;

// ---- filters ---------------------------------------------------------------
let sel = new Int32Array(0);   // shown entries, in the order of the run
let selW = sel, selR = sel;    // the shown ones with a wall-clock instant / with boot-relative time
const shownBySrc = new Int32Array(6);
const F = { q: "", re: false, src: SRC, p: 8, tags: [], pids: [], boot: "" };

// Entries whose message the search finds: one pass of a global regex over
// each chunk's text, every match mapped back to its entry by binary search.
function searchMarks(re) {
    const mark = new Uint8Array(N);
    const one = new RegExp(re.source, re.flags.replace("g", ""));
    chunks.forEach((s, c) => {
        const lo = chunkFirst[c], hi = c + 1 < chunks.length ? chunkFirst[c + 1] : N;
        const entryAt = pos => { let a = lo, b = hi - 1; while (a < b) { const m = (a + b + 1) >> 1; if (MO[m] <= pos) a = m; else b = m - 1; } return a; };
        re.lastIndex = 0;
        let m;
        while ((m = re.exec(s)) !== null) {
            const e = entryAt(m.index);
            // A pattern such as [^x] may run on into the next entry: test this one alone.
            if (m[0].indexOf("\n") < 0 || one.test(message(e))) mark[e] = 1;
            if (e + 1 >= hi) break;
            re.lastIndex = MO[e + 1];
        }
    });
    return mark;
}

function applyFilters() {
    let re = null;
    $("q").classList.remove("bad");
    if (F.q) {
        try {
            re = F.re ? new RegExp(F.q, "gm") : new RegExp(F.q.replace(/[.*+?^${}()|[\]\\]/g, "\\$&"), "gi");
        } catch (err) { $("q").classList.add("bad"); }
    }
    const mark = re ? searchMarks(re) : null;
    const srcOn = SRC.split("").map(c => F.src.indexOf(c) >= 0);
    const tagOk = F.tags.length ? new Uint8Array(tags.length) : null;
    if (tagOk) tags.forEach((t, i) => { if (F.tags.indexOf(t) >= 0) tagOk[i] = 1; });
    const pidSet = F.pids.length ? new Set(F.pids) : null;
    let bootOk = -1;
    if (F.boot !== "") bootOk = boots.findIndex(b => String(b.boot) === F.boot || (b.name && b.name === F.boot));
    const out = new Int32Array(N);
    let n = 0;
    shownBySrc.fill(0);
    for (let e = 0; e < N; e++) {
        if (!srcOn[SK[e] & 7]) continue;
        if (F.p < 8 && (PR[e] < 0 || PR[e] > F.p)) continue;  // "at least as severe"; no priority is no match
        if (mark && !mark[e]) continue;
        if (tagOk && !tagOk[TAG[e]]) continue;
        if (pidSet && !pidSet.has(PID[e])) continue;
        if (F.boot !== "" && BOOT[e] !== bootOk) continue;
        out[n++] = e;
        shownBySrc[SK[e] & 7]++;
    }
    sel = out.subarray(0, n);
    let w = 0, r = 0;
    const W = new Int32Array(n), R = new Int32Array(n);
    for (let i = 0; i < n; i++) { const e = sel[i]; if (isRel(e)) R[r++] = e; else W[w++] = e; }
    selW = W.subarray(0, w); selR = R.subarray(0, r);
}

// ---- formatting ------------------------------------------------------------
const pad = (n, w) => String(n).padStart(w, "0");
const fmtNum = n => n.toLocaleString("en-US");
function fmtZone(tz) {
    const a = Math.abs(tz);
    return "UTC" + (tz < 0 ? "\u2212" : "+") + pad(Math.floor(a / 3600), 2) + ":" + pad(Math.floor(a / 60) % 60, 2);
}
// A wall-clock instant (microseconds) in the phone's local time of zone offset TZ.
function fmtWall(us, tz, withYear, digits) {
    const ms = Math.floor(us / 1000), d = new Date(ms + tz * 1000);
    const frac = digits === 6 ? pad(((us % 1e6) + 1e6) % 1e6, 6) : pad(((ms % 1000) + 1000) % 1000, 3);
    return (withYear ? d.getUTCFullYear() + "-" : "") + pad(d.getUTCMonth() + 1, 2) + "-" + pad(d.getUTCDate(), 2) +
        " " + pad(d.getUTCHours(), 2) + ":" + pad(d.getUTCMinutes(), 2) + ":" + pad(d.getUTCSeconds(), 2) + "." + frac;
}
const fmtRel = us => "[" + (us / 1e6).toFixed(6).padStart(12) + "]";
const fmtTime = e => (isRel(e) ? fmtRel(TM[e]) : fmtWall(TM[e], TZ[e], false, 3));
const bootLabel = b => (b.boot === 0 ? "run" : "boot " + b.boot + (b.name ? " \u00b7 " + b.name : ""));

// ---- the entry list ----------------------------------------------------------
const ROW_H = 18, MAX_SCROLL_H = 1.6e7, MIN_ROWS = 40;
const list = $("list"), rowsBox = $("rows"), spacer = $("spacer");
let pool = [], topRow = 0, selected = -1;

function listRows() { return Math.max(1, Math.ceil(list.clientHeight / ROW_H)); }
// A million rows do not fit in one element's height: past MAX_SCROLL_H the
// scroll position maps onto the rows in proportion.
function scrollSpan() { return Math.max(0, Math.min(sel.length * ROW_H, MAX_SCROLL_H) - list.clientHeight); }
function rowSpan() { return Math.max(0, sel.length - Math.floor(list.clientHeight / ROW_H)); }
function topFromScroll() {
    const span = scrollSpan();
    if (sel.length * ROW_H <= MAX_SCROLL_H) return Math.floor(list.scrollTop / ROW_H);
    return span ? Math.round(list.scrollTop / span * rowSpan()) : 0;
}
function scrollToRow(i) {
    i = Math.max(0, Math.min(i, rowSpan()));
    list.scrollTop = sel.length * ROW_H <= MAX_SCROLL_H ? i * ROW_H : (rowSpan() ? i / rowSpan() * scrollSpan() : 0);
    drawList();
}
function selIndexOf(e) {  // the first shown row at or after entry E
    let a = 0, b = sel.length;
    while (a < b) { const m = (a + b) >> 1; if (sel[m] < e) a = m + 1; else b = m; }
    return a;
}

function drawList() {
    spacer.style.height = Math.min(sel.length * ROW_H, MAX_SCROLL_H) + "px";
    // Rows past the bottom cost little and keep the first page whole while the
    // window is still being sized (a headless load reads it early).
    const want = Math.max(listRows() + 1, MIN_ROWS);
    while (pool.length < want) {
        const r = document.createElement("div");
        r.className = "row";
        for (const c of ["c-t", "c-s", "c-p", "c-pid", "c-tid", "c-tag", "c-m"]) {
            const s = document.createElement("span"); s.className = c; r.appendChild(s);
        }
        r.onclick = () => { if (r.entry >= 0) select(r.entry); };
        rowsBox.appendChild(r); pool.push(r);
    }
    topRow = topFromScroll();
    const shift = sel.length * ROW_H <= MAX_SCROLL_H ? -(list.scrollTop % ROW_H) : 0;
    pool.forEach((r, k) => {
        const i = topRow + k;
        if (k >= want || i >= sel.length) {
            if (r.entry !== -1) { r.style.display = "none"; r.entry = -1; for (const c of r.children) c.textContent = ""; }
            return;
        }
        const e = sel[i], c = r.children, p = PR[e], m = message(e);
        r.entry = e;
        r.style.display = "";
        r.style.top = (k * ROW_H + shift) + "px";
        r.className = "row k" + kind(e) + (p >= 0 ? " p" + p : "") + (i & 1 ? " odd" : "") + (e === selected ? " sel" : "");
        c[0].textContent = fmtTime(e);
        c[1].textContent = SRC[src(e)];
        c[1].style.color = SRC_COLOR[src(e)];
        c[2].textContent = p >= 0 ? PRIO_LETTER[p] : "";
        c[3].textContent = PID[e] >= 0 ? PID[e] : "";
        c[4].textContent = TID[e] >= 0 ? TID[e] : "";
        c[5].textContent = tags[TAG[e]];
        c[6].textContent = m;
        r.title = m.length > 120 ? m.slice(0, 2000) : "";
    });
    $("empty") && $("empty").remove();
    if (!sel.length) {
        const d = document.createElement("div");
        d.id = "empty";
        d.textContent = N ? "No entry matches the filters." : "The run has no entries.";
        list.appendChild(d);
    }
    redraw();
}

function select(e) {
    selected = e;
    const d = $("detail");
    d.textContent = "";
    if (e < 0) { drawList(); return; }
    const b = boots[BOOT[e]], p = PR[e];
    const meta = document.createElement("div");
    meta.className = "meta";
    meta.textContent = [
        isRel(e) ? (TM[e] / 1e6).toFixed(6) + " s since boot (no wall-clock time for this boot)"
                 : fmtWall(TM[e], TZ[e], true, 6) + " " + fmtZone(TZ[e]),
        SRC_NAME[src(e)], p >= 0 ? PRIO_NAME[p] + " (" + p + ")" : "no priority",
        "pid " + (PID[e] >= 0 ? PID[e] : "-") + " tid " + (TID[e] >= 0 ? TID[e] : "-"),
        "tag " + JSON.stringify(tags[TAG[e]]), files[FIL[e]] + " @ " + OFF[e], bootLabel(b),
        ["", "marker", "boot note", "bytes", "malformed line"][kind(e)],
    ].filter(Boolean).join("  \u00b7  ");
    const pre = document.createElement("pre");
    pre.textContent = message(e);
    d.append(meta, pre);
    drawList();
}

// ---- timeline and histogram --------------------------------------------------
const tl = $("tlc"), hg = $("hgc");
const LANE_H = 16, BAND_H = 16, AXIS_H = 18, HIST_H = 64;
const view = { w: [0, 1], r: [0, 1] };   // visible range, wall (us since epoch) and boot-relative (us)
const full = { w: [0, 1], r: [0, 1] };
let axisTz = 0;

function rangeOf(idx, into) {
    if (!idx.length) { into[0] = 0; into[1] = 1e6; return; }
    let a = TM[idx[0]], b = TM[idx[idx.length - 1]];
    if (b - a < 1000) { a -= 500; b += 500; }
    const m = (b - a) * 0.01;
    into[0] = a - m; into[1] = b + m;
}
function layout() {
    const hasRel = selR.length > 0 || fullR;
    return { rel: hasRel, h: BAND_H + 6 * LANE_H + AXIS_H + (hasRel ? LANE_H + AXIS_H : 0) };
}
let fullR = false;  // the run has boot-relative entries: their lane stays while filtered empty

function sizeCanvas(c, h) {
    const dpr = window.devicePixelRatio || 1, w = c.clientWidth || 600;
    if (c.width !== Math.round(w * dpr) || c.height !== Math.round(h * dpr)) {
        c.width = Math.round(w * dpr); c.height = Math.round(h * dpr); c.style.height = h + "px";
    }
    const g = c.getContext("2d");
    g.setTransform(dpr, 0, 0, dpr, 0, 0);
    return { g, w };
}
function lowerBound(idx, t) {
    let a = 0, b = idx.length;
    while (a < b) { const m = (a + b) >> 1; if (TM[idx[m]] < t) a = m + 1; else b = m; }
    return a;
}
const STEPS = [1, 2, 5, 10, 20, 50, 100, 200, 500, 1e3, 2e3, 5e3, 1e4, 2e4, 5e4, 1e5, 2e5, 5e5,
    1e6, 2e6, 5e6, 1e7, 15e6, 3e7, 6e7, 12e7, 3e8, 6e8, 9e8, 18e8, 36e8, 72e8, 108e8, 216e8, 432e8, 864e8];
const niceStep = (span, px, minPx) => STEPS.find(s => s / span * px >= minPx) || STEPS[STEPS.length - 1];

// Per pixel column and lane: the entry count and the worst priority class.
function columns(idx, v, w, lanes) {
    const cnt = new Uint32Array(lanes * w), worst = new Uint8Array(lanes * w).fill(255);
    const k = w / (v[1] - v[0]);
    for (let i = lowerBound(idx, v[0]); i < idx.length; i++) {
        const e = idx[i], t = TM[e];
        if (t > v[1]) break;
        const x = Math.min(w - 1, ((t - v[0]) * k) | 0), j = (lanes > 1 ? SK[e] & 7 : 0) * w + x, c = cls(PR[e]);
        cnt[j]++;
        if (c < worst[j]) worst[j] = c;
    }
    return { cnt, worst };
}
function drawLanes(g, w, y0, lanes, col) {
    let max = 1;
    for (let j = 0; j < col.cnt.length; j++) if (col.cnt[j] > max) max = col.cnt[j];
    const lm = Math.log(max + 1);
    for (let l = 0; l < lanes; l++) {
        const y = y0 + l * LANE_H;
        g.fillStyle = l % 2 ? "#f6f8fa" : "#ffffff";
        g.fillRect(0, y, w, LANE_H);
        for (let x = 0; x < w; x++) {
            const n = col.cnt[l * w + x];
            if (!n) continue;
            g.globalAlpha = 0.35 + 0.65 * Math.log(n + 1) / lm;
            g.fillStyle = CLS_COLOR[col.worst[l * w + x]];
            g.fillRect(x, y + 3, 2, LANE_H - 6);  // 2 px: a lone entry stays visible
        }
        g.globalAlpha = 1;
    }
}
// Ticks fall on round values of the shown clock: SHIFT is the zone offset in us.
function drawAxis(g, w, y, v, fmt, minPx, shift) {
    const step = niceStep(v[1] - v[0], w, minPx);
    g.fillStyle = "#57606a"; g.font = "11px system-ui, 'DejaVu Sans', sans-serif"; g.textBaseline = "middle";
    g.strokeStyle = "#d0d7de"; g.beginPath();
    for (let t = Math.ceil((v[0] + shift) / step) * step - shift; t <= v[1]; t += step) {
        const x = Math.round((t - v[0]) / (v[1] - v[0]) * w) + 0.5;
        const label = fmt(t, step);
        g.moveTo(x, y); g.lineTo(x, y + 4);
        if (x + 3 + g.measureText(label).width <= w) g.fillText(label, x + 3, y + AXIS_H / 2 + 1);
    }
    g.stroke();
}
function wallTick(t, step) {
    const s = fmtWall(t, axisTz, false, 6);  // "MM-DD hh:mm:ss.uuuuuu"
    if (step >= 864e8 || s.slice(6, 14) === "00:00:00") return s.slice(0, 5);
    if (step >= 6e7) return s.slice(6, 11);
    if (step >= 1e6) return s.slice(6, 14);
    if (step >= 1e3) return s.slice(9, 18);
    return s.slice(12);
}
const relTick = (t, step) => (t / 1e6).toFixed(Math.max(0, Math.ceil(6 - Math.log10(step) - 1e-9))) + " s";
function marker(g, v, w, t, y0, y1, color) {
    if (t < v[0] || t > v[1]) return;
    const x = Math.round((t - v[0]) / (v[1] - v[0]) * w) + 0.5;
    g.strokeStyle = color; g.lineWidth = 1.5; g.beginPath(); g.moveTo(x, y0); g.lineTo(x, y1); g.stroke(); g.lineWidth = 1;
}
// The entry at the top of the list and the selected one, in their time domain.
function markers(g, w, y0, y1, rel) {
    const at = sel.length ? sel[Math.min(topRow, sel.length - 1)] : -1;
    for (const [e, c] of [[at, "#0969da"], [selected, "#d4a72c"]]) {
        if (e >= 0 && isRel(e) === rel) marker(g, rel ? view.r : view.w, w, TM[e], y0, y1, c);
    }
}

function drawCharts() {
    const L = layout();
    let { g, w } = sizeCanvas(tl, L.h);
    g.clearRect(0, 0, w, L.h);
    const v = view.w, k = w / (v[1] - v[0]);
    // Boots as bands behind the lanes, named in the band row.
    boots.forEach((b, i) => {
        if (!(b.last >= b.first)) return;
        const x0 = Math.max(0, (b.first - v[0]) * k), x1 = Math.min(w, (b.last - v[0]) * k + 1);
        if (x1 < 0 || x0 > w) return;
        g.fillStyle = b.boot === 0 ? "#ddf4ff" : i % 2 ? "#fbefff" : "#fff8c5";
        g.fillRect(x0, 0, x1 - x0, BAND_H + 6 * LANE_H);
        g.fillStyle = "#57606a"; g.font = "11px system-ui, 'DejaVu Sans', sans-serif"; g.textBaseline = "middle";
        // A short boot's name runs on over the gap up to the next boot.
        const next = boots.slice(i + 1).find(o => o.last >= o.first);
        const room = next ? Math.max(x1, (next.first - v[0]) * k) : w;
        g.save(); g.beginPath(); g.rect(x0, 0, room - x0, BAND_H); g.clip();
        g.fillText(bootLabel(b), x0 + 4, BAND_H / 2 + 1); g.restore();
    });
    const col = columns(selW, v, Math.max(1, Math.floor(w)), 6);
    g.globalCompositeOperation = "multiply";
    drawLanes(g, Math.floor(w), BAND_H, 6, col);
    g.globalCompositeOperation = "source-over";
    drawAxis(g, w, BAND_H + 6 * LANE_H, v, wallTick, 90, axisTz * 1e6);
    markers(g, w, 0, BAND_H + 6 * LANE_H, 0);
    if (L.rel) {
        const y = BAND_H + 6 * LANE_H + AXIS_H;
        drawLanes(g, Math.floor(w), y, 1, columns(selR, view.r, Math.max(1, Math.floor(w)), 1));
        drawAxis(g, w, y + LANE_H, view.r, relTick, 70, 0);
        markers(g, w, y, y + LANE_H, 1);
    }
    drawHistogram();
    drawLaneLabels(L);
}

function drawHistogram() {
    const { g, w } = sizeCanvas(hg, HIST_H);
    g.clearRect(0, 0, w, HIST_H);
    const v = view.w, span = v[1] - v[0];
    const bin = niceStep(span, w, 4), b0 = Math.floor(v[0] / bin), nb = Math.ceil(v[1] / bin) - b0 + 1;
    const cnt = new Float64Array(nb * 6);
    for (let i = lowerBound(selW, b0 * bin); i < selW.length; i++) {
        const e = selW[i];
        if (TM[e] > v[1]) break;
        cnt[(Math.floor(TM[e] / bin) - b0) * 6 + cls(PR[e])]++;
    }
    let max = 0;
    for (let b = 0; b < nb; b++) {
        let s = 0;
        for (let c = 0; c < 6; c++) s += cnt[b * 6 + c];
        if (s > max) max = s;
    }
    const perSec = max / (bin / 1e6), H = HIST_H - 4;
    for (let b = 0; b < nb; b++) {
        const x0 = ((b0 + b) * bin - v[0]) / span * w, x1 = ((b0 + b + 1) * bin - v[0]) / span * w;
        let y = HIST_H;
        for (let c = 0; c < 6; c++) {
            const n = cnt[b * 6 + c];
            if (!n) continue;
            const h = n / max * H;
            g.fillStyle = CLS_COLOR[c];
            g.fillRect(x0, y - h, Math.max(1, x1 - x0 - (x1 - x0 > 3 ? 1 : 0)), h);
            y -= h;
        }
    }
    markers(g, w, 0, HIST_H, 0);
    $("hgl").firstChild.textContent = "max " + (perSec >= 100 ? fmtNum(Math.round(perSec)) : perSec.toPrecision(2)) + "/s";
}

function drawLaneLabels(L) {
    const box = $("lanes");
    const want = 7 + (L.rel ? 2 : 0) + 1;
    if (box.children.length !== want) {
        box.textContent = "";
        const add = cls => { const d = document.createElement("div"); d.className = cls; box.appendChild(d); return d; };
        add("band").textContent = "boots";
        for (let s = 0; s < 6; s++) {
            const d = add("lane");
            d.dataset.src = SRC[s];
            d.append(document.createElement("b"), document.createTextNode(SRC_NAME[s]), document.createElement("span"));
            d.firstChild.textContent = SRC[s];
            d.firstChild.style.color = SRC_COLOR[s];
        }
        add("axis");
        if (L.rel) {
            const d = add("lane rel");
            d.dataset.src = "K0";
            d.title = "kernel lines of a boot without its wall-clock time, in seconds since boot";
            d.append(document.createElement("b"), document.createTextNode("since boot"), document.createElement("span"));
            d.firstChild.textContent = "K";
            d.firstChild.style.color = SRC_COLOR[0];
            add("axis");
        }
        [...box.children].forEach(d => { if (d.className === "axis") d.style.height = AXIS_H + "px"; });
    }
    [...box.querySelectorAll(".lane")].forEach(d => {
        const n = d.dataset.src === "K0" ? selR.length : shownBySrc[SRC.indexOf(d.dataset.src)] -
            (d.dataset.src === "K" ? selR.length : 0);
        d.lastChild.textContent = fmtNum(n);
        d.classList.toggle("empty", n === 0);
    });
}

// ---- interaction -------------------------------------------------------------
// Which time domain the canvas row at Y shows.
function domainAt(y) { return y >= BAND_H + 6 * LANE_H + AXIS_H ? "r" : "w"; }
function zoom(d, x, w, f) {
    const v = view[d], fr = full[d], t = v[0] + (v[1] - v[0]) * x / w;
    let span = Math.min(fr[1] - fr[0], Math.max(20, (v[1] - v[0]) * f));
    v[0] = t - (t - v[0]) / (v[1] - v[0]) * span; v[1] = v[0] + span;
    clampView(d);
}
function clampView(d) {
    const v = view[d], fr = full[d], span = v[1] - v[0];
    if (v[0] < fr[0]) { v[0] = fr[0]; v[1] = fr[0] + span; }
    if (v[1] > fr[1]) { v[1] = fr[1]; v[0] = fr[1] - span; }
}
let frame = 0;
const redraw = () => { if (!frame) frame = requestAnimationFrame(() => { frame = 0; drawCharts(); }); };

// The list jumps to the first shown entry at or after T; a click also selects it.
function jumpTo(d, t, pick) {
    const idx = d === "r" ? selR : selW;
    if (!idx.length) return;
    const e = idx[Math.min(idx.length - 1, lowerBound(idx, t))];
    scrollToRow(selIndexOf(e));
    if (pick) select(e);
}
// The timeline follows the list: the entry at the top of the list stays in view.
function follow() {
    if (!sel.length) return;
    const e = sel[Math.min(topRow, sel.length - 1)], d = isRel(e) ? "r" : "w", v = view[d], t = TM[e];
    if (t >= v[0] && t <= v[1]) return;
    const span = v[1] - v[0];
    v[0] = t - span / 2; v[1] = t + span / 2;
    clampView(d);
}
const centre = d => (view[d][0] + view[d][1]) / 2;

for (const [c, only] of [[tl, null], [hg, "w"]]) {
    c.addEventListener("wheel", ev => {
        ev.preventDefault();
        const r = c.getBoundingClientRect(), d = only || domainAt(ev.clientY - r.top);
        if (Math.abs(ev.deltaX) > Math.abs(ev.deltaY) || ev.shiftKey) {
            const v = view[d], dx = (ev.deltaX || ev.deltaY) / r.width * (v[1] - v[0]);
            v[0] += dx; v[1] += dx; clampView(d);
            jumpTo(d, centre(d), false);
        } else {
            zoom(d, ev.clientX - r.left, r.width, Math.pow(1.0015, ev.deltaY));
        }
        redraw();
    }, { passive: false });
    let drag = null;
    c.addEventListener("pointerdown", ev => {
        const r = c.getBoundingClientRect();
        drag = { x: ev.clientX, d: only || domainAt(ev.clientY - r.top), v: view[only || domainAt(ev.clientY - r.top)].slice(), moved: false };
        c.setPointerCapture(ev.pointerId);
    });
    c.addEventListener("pointermove", ev => {
        if (!drag) return;
        const r = c.getBoundingClientRect(), dx = ev.clientX - drag.x;
        if (Math.abs(dx) > 3) drag.moved = true;
        if (!drag.moved) return;
        const v = view[drag.d], span = drag.v[1] - drag.v[0];
        v[0] = drag.v[0] - dx / r.width * span; v[1] = v[0] + span;
        clampView(drag.d); redraw();
    });
    c.addEventListener("pointerup", ev => {
        if (drag && !drag.moved) {
            const r = c.getBoundingClientRect(), v = view[drag.d];
            const y = ev.clientY - r.top;
            if (c === tl && y < BAND_H && drag.d === "w") {  // a click on a boot's band shows that boot
                const t = v[0] + (v[1] - v[0]) * (ev.clientX - r.left) / r.width;
                const b = boots.find(o => o.first <= t && t <= o.last);
                if (b) { const m = (b.last - b.first) * 0.02 + 500; v[0] = b.first - m; v[1] = b.last + m; clampView("w"); redraw(); }
            } else {
                jumpTo(drag.d, v[0] + (v[1] - v[0]) * (ev.clientX - r.left) / r.width, true);
            }
        } else if (drag) {
            jumpTo(drag.d, centre(drag.d), false);  // a pan moves the list to the middle of the view
        }
        drag = null;
    });
}

list.addEventListener("scroll", () => { drawList(); follow(); });
list.addEventListener("keydown", ev => {
    if (ev.key !== "ArrowDown" && ev.key !== "ArrowUp") return;
    ev.preventDefault();
    let i = selected >= 0 ? selIndexOf(selected) : topRow;
    i = Math.max(0, Math.min(sel.length - 1, i + (ev.key === "ArrowDown" ? 1 : -1)));
    if (i < topRow) scrollToRow(i); else if (i >= topRow + listRows() - 1) scrollToRow(i - listRows() + 2);
    if (sel.length) select(sel[i]);
});
document.addEventListener("keydown", ev => {
    if (ev.key === "/" && document.activeElement.tagName !== "INPUT") { ev.preventDefault(); $("q").focus(); }
});
window.addEventListener("resize", () => { if (document.body.dataset.ready) drawList(); });

// ---- filter controls and the URL fragment --------------------------------------
// The fragment holds the filters (#q=...&re=1&src=KM&p=W&tag=a,b&pid=1&boot=-1), so a
// view can be passed on as a link and a test can open the report already filtered.
function readFragment() {
    const h = new URLSearchParams(location.hash.slice(1));
    F.q = h.get("q") || "";
    F.re = h.get("re") === "1";
    F.src = h.has("src") ? h.get("src").toUpperCase() : SRC;
    const p = (h.get("p") || "").toUpperCase();
    F.p = p === "" ? 8 : /^[0-8]$/.test(p) ? +p : PRIO_LETTER.indexOf(p) >= 0 ? PRIO_LETTER.indexOf(p) : 8;
    F.tags = (h.get("tag") || "").split(",").map(s => s.trim()).filter(Boolean);
    F.pids = (h.get("pid") || "").split(",").map(s => parseInt(s, 10)).filter(n => !isNaN(n));
    F.boot = h.get("boot") || "";
}
function writeFragment() {
    const h = new URLSearchParams();
    if (F.q) h.set("q", F.q);
    if (F.re) h.set("re", "1");
    if (F.src !== SRC) h.set("src", F.src);
    if (F.p < 8) h.set("p", PRIO_LETTER[F.p]);
    if (F.tags.length) h.set("tag", F.tags.join(","));
    if (F.pids.length) h.set("pid", F.pids.join(","));
    if (F.boot) h.set("boot", F.boot);
    try { history.replaceState(null, "", "#" + h.toString()); } catch (err) { /* a file: page may refuse */ }
}
function showControls() {
    $("q").value = F.q; $("re").checked = F.re; $("prio").value = String(F.p);
    $("tag").value = F.tags.join(", "); $("pid").value = F.pids.join(", "); $("boot").value = F.boot;
    [...$("srcs").children].forEach((b, s) => b.classList.toggle("off", F.src.indexOf(SRC[s]) < 0));
}
function refilter(keepPlace) {
    const at = keepPlace && sel.length ? sel[Math.min(topRow, sel.length - 1)] : 0;
    applyFilters();
    const n = $("count");
    n.textContent = fmtNum(sel.length) + " of " + fmtNum(N) + " entries";
    n.dataset.shown = sel.length; n.dataset.total = N;
    scrollToRow(selIndexOf(at));
}
let typing = 0;
function controlsChanged(now) {
    F.q = $("q").value; F.re = $("re").checked; F.p = +$("prio").value;
    F.tags = $("tag").value.split(",").map(s => s.trim()).filter(Boolean);
    F.pids = $("pid").value.split(",").map(s => parseInt(s, 10)).filter(n => !isNaN(n));
    F.boot = $("boot").value;
    clearTimeout(typing);
    const go = () => { writeFragment(); refilter(true); };
    if (now) go(); else typing = setTimeout(go, 200);
}
function buildControls() {
    const pr = $("prio");
    pr.appendChild(new Option("all priorities", "8"));
    for (let p = 7; p >= 0; p--) pr.appendChild(new Option(PRIO_LETTER[p] + " " + PRIO_NAME[p] + " and worse", String(p)));
    const bs = $("boot");
    bs.appendChild(new Option("all boots", ""));
    boots.forEach(b => bs.appendChild(new Option(bootLabel(b), String(b.boot))));
    SRC.split("").forEach((c, s) => {
        const b = document.createElement("button");
        b.textContent = c; b.title = SRC_NAME[s]; b.style.background = SRC_COLOR[s];
        b.onclick = () => {
            F.src = F.src.indexOf(c) >= 0 ? F.src.replace(c, "") : F.src + c;
            showControls(); writeFragment(); refilter(true);
        };
        $("srcs").appendChild(b);
    });
    for (const id of ["q", "tag", "pid"]) {
        $(id).addEventListener("input", () => controlsChanged(false));
        $(id).addEventListener("keydown", ev => { if (ev.key === "Enter") controlsChanged(true); });
    }
    for (const id of ["re", "prio", "boot"]) $(id).addEventListener("change", () => controlsChanged(true));
    $("fit").onclick = () => { view.w = full.w.slice(); view.r = full.r.slice(); redraw(); };
    const key = $("hgl");
    key.appendChild(document.createElement("b"));
    CLS_NAME.forEach((n, c) => {
        const s = document.createElement("span"), i = document.createElement("i");
        s.className = "key"; i.style.background = CLS_COLOR[c]; s.append(i, n); key.appendChild(s);
    });
}

// The last data script has run: TOTAL entries were written.
function done(total) {
    const dataMs = performance.now();
    const title = document.title || "tavlolog report";
    $("title").textContent = title;
    if (total !== N) $("warn").textContent = "report incomplete: " + fmtNum(N) + " of " + fmtNum(total) + " entries";
    const all = new Int32Array(N).map((_, i) => i);
    const w = all.filter(e => !isRel(e)), r = all.filter(e => isRel(e));
    rangeOf(w, full.w); rangeOf(r, full.r);
    fullR = r.length > 0;
    view.w = full.w.slice(); view.r = full.r.slice();
    if (w.length) {
        axisTz = TZ[w[0]];
        $("range").textContent = fmtWall(TM[w[0]], axisTz, true, 3).slice(0, 19) + " \u2013 " +
            fmtWall(TM[w[w.length - 1]], TZ[w[w.length - 1]], true, 3).slice(0, 19);
        $("zone").textContent = "phone time " + fmtZone(axisTz);
    }
    buildControls();
    readFragment();
    showControls();
    refilter(false);
    drawCharts();  // now, not at the next frame: the first screen is complete when this returns
    document.body.dataset.ready = "1";
    // Where the load's time went, for the benchmark: page parsed up to the
    // data, data loaded, of that the time in the decoder, first screen drawn
    // (ms since navigation start).
    document.body.dataset.firstDataMs = Math.round(firstDataMs);
    document.body.dataset.dataMs = Math.round(dataMs);
    document.body.dataset.decodeMs = Math.round(decodeMs);
    document.body.dataset.firstDrawMs = Math.round(performance.now());
}
window.addEventListener("hashchange", () => { readFragment(); showControls(); refilter(true); });
window.C = C;
window.done = done;
})();
