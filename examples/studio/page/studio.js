'use strict';
// The studio page: one card per source, previews drawn from the raw RGBA pictures the server
// pushes over a WebSocket, level meters, record buttons, clips and warning lines.
// ?rate=N sets the previews per second and ?width=N the preview width (else the card's width).
(() => {
  const params = new URLSearchParams(location.search);
  const $ = (id) => document.getElementById(id);
  const cards = new Map();  // uid -> { source, element, canvas, context, meters, button }
  const studio = { drawn: {}, sources: [], clips: [], warnings: [] };
  window.studio = studio;  // read by the tests and the benchmark
  if (params.has('rate')) $('rate').value = params.get('rate');

  const ws = new WebSocket(`ws://${location.host}/live`);
  ws.binaryType = 'arraybuffer';
  const send = (message) => { if (ws.readyState === WebSocket.OPEN) ws.send(JSON.stringify(message)); };

  const isVideo = (source) => source.type === 'dxgi' || source.type === 'mfce_video';
  const TYPE_NAMES = { dxgi: 'display', wasapi: 'audio endpoint', mfce_video: 'camera', mfce_audio: 'microphone' };

  function element(tag, className, text) {
    const e = document.createElement(tag);
    if (className) e.className = className;
    if (text !== undefined) e.textContent = text;
    return e;
  }

  // The picture size that fills the card's canvas at the screen's pixel density.
  function previewSize(card) {
    const { source } = card;
    const fit = Math.round(card.canvas.clientWidth * (window.devicePixelRatio || 1));
    const width = Math.max(2, Math.min(source.width, Number(params.get('width')) || fit));
    return { width, height: Math.max(2, Math.round(width * source.height / source.width)) };
  }

  function askPreviews() {
    const rate = Number($('rate').value);
    for (const card of cards.values()) {
      if (!isVideo(card.source)) continue;
      send({ type: 'preview', uid: card.source.id, rate, ...previewSize(card) });
    }
  }

  function addSource(source) {
    if (cards.has(source.id)) return;
    studio.sources.push(source);
    const card = { source, element: element('div', 'source'), meters: new Map() };
    card.element.dataset.uid = source.id;
    card.element.dataset.type = source.type;
    const title = element('div');
    title.append(element('span', 'title', source.name), element('span', 'type', TYPE_NAMES[source.type] || source.type));
    if (source.selected) title.append(element('span', 'selected', '★ default'));
    card.element.append(title);
    if (isVideo(source)) {
      card.canvas = element('canvas');
      card.canvas.width = source.width;
      card.canvas.height = source.height;
      card.canvas.style.aspectRatio = `${source.width} / ${source.height}`;
      // Every picture is replaced whole from memory: a canvas kept in memory takes it as a copy.
      card.context = card.canvas.getContext('2d', { willReadFrequently: true });
      card.fps = element('div', 'fps', `${source.width}×${source.height}`);
      card.element.append(card.canvas, card.fps);
      studio.drawn[source.id] = 0;
    } else {
      card.meterBox = element('div', 'meters');
      card.element.append(card.meterBox);
    }
    card.button = element('button', 'record', 'Record');
    card.button.addEventListener('click', () => send({ type: card.recording ? 'stop' : 'record', uid: source.id }));
    card.element.append(card.button);
    cards.set(source.id, card);
    $('sources').append(card.element);
    if (isVideo(source)) askPreviews();
  }

  function showLevels(uid, peaks) {
    const card = cards.get(uid);
    if (!card) return;
    for (const channel of Object.keys(peaks).filter((k) => /^\d+$/.test(k))) {
      let meter = card.meters.get(channel);
      if (!meter) {
        const row = element('label', 'meter');
        const name = channel === '0' ? 'left' : channel === '1' ? 'right' : `ch ${channel}`;
        meter = { bar: element('meter'), text: element('span') };
        meter.bar.min = 0;
        meter.bar.max = 1;
        meter.bar.dataset.channel = channel;
        row.append(element('span', '', name), meter.bar, meter.text);
        card.meterBox.append(row);
        card.meters.set(channel, meter);
      }
      meter.bar.value = peaks[channel];
      meter.text.textContent = peaks[channel].toFixed(2);
    }
  }

  function drawFrame(buffer) {
    const header = new DataView(buffer, 0, 12);
    const uid = header.getUint32(0, true);
    const width = header.getUint32(4, true);
    const height = header.getUint32(8, true);
    const card = cards.get(uid);
    if (!card || !card.context) return;
    if (card.canvas.width !== width || card.canvas.height !== height) {
      card.canvas.width = width;
      card.canvas.height = height;
    }
    card.context.putImageData(new ImageData(new Uint8ClampedArray(buffer, 12, width * height * 4), width, height), 0, 0);
    studio.drawn[uid] += 1;
  }

  function setRecording(uid, on) {
    const card = cards.get(uid);
    if (!card) return;
    card.recording = on;
    card.element.classList.toggle('recording', on);
    card.button.textContent = on ? 'Stop' : 'Record';
  }

  function addClip(clip) {
    studio.clips.push(clip);
    const item = element('li');
    item.dataset.clip = clip.id;
    item.append(`${clip.name} — ${clip.kind}, ${clip.duration.toFixed(2)} s, ${(clip.size / 1024).toFixed(0)} KiB`);
    const player = element(clip.kind === 'video' ? 'video' : 'audio');
    player.controls = true;
    player.preload = 'metadata';
    player.src = clip.url;
    item.append(player);
    $('clips').prepend(item);
  }

  function addWarning(line) {
    studio.warnings.push(line);
    $('warnings').prepend(element('li', '', line));
  }

  ws.addEventListener('open', () => {
    $('status').textContent = 'connected';
    $('status').classList.add('connected');
  });
  ws.addEventListener('close', () => {
    $('status').textContent = 'disconnected';
    $('status').classList.remove('connected');
  });
  ws.addEventListener('message', ({ data }) => {
    if (typeof data !== 'string') { drawFrame(data); return; }
    const message = JSON.parse(data);
    switch (message.type) {
      case 'hello':
        $('folder').value = message.folder;
        message.sources.forEach(addSource);
        message.recording.forEach((uid) => setRecording(uid, true));
        message.clips.forEach(addClip);
        message.warnings.forEach(addWarning);
        break;
      case 'source': addSource(message.source); break;
      case 'levels': showLevels(message.uid, message.peaks); break;
      case 'recording': setRecording(message.uid, message.on); break;
      case 'clip': addClip(message.clip); break;
      case 'clip failed': $('clips').prepend(element('li', 'failed', `${message.name}: no file was written`)); break;
      case 'warning': addWarning(message.line); break;
      case 'folder': $('folder').value = message.folder; break;
      default: break;
    }
  });

  $('rate').addEventListener('change', askPreviews);
  $('folder').addEventListener('change', () => send({ type: 'folder', folder: $('folder').value }));
  $('record-all').addEventListener('click', () => send({ type: 'record all' }));
  $('stop-all').addEventListener('click', () => send({ type: 'stop all' }));
  let resizeTimer = null;
  window.addEventListener('resize', () => {
    clearTimeout(resizeTimer);
    resizeTimer = setTimeout(askPreviews, 200);
  });

  // Drawn previews per second, per source, shown under each picture.
  let last = { time: performance.now(), drawn: {} };
  setInterval(() => {
    const now = performance.now();
    for (const [uid, card] of cards) {
      if (!card.fps) continue;
      const rate = (studio.drawn[uid] - (last.drawn[uid] || 0)) * 1000 / (now - last.time);
      card.fps.textContent = `${card.source.width}×${card.source.height}, preview ${card.canvas.width}×${card.canvas.height} at ${rate.toFixed(1)}/s`;
    }
    last = { time: now, drawn: { ...studio.drawn } };
  }, 1000);
})();
