// Loads the page in headless Chromium against a static server over `root`, reads
// video.currentTime through the DevTools protocol until it has advanced, and takes a screenshot.
//
// Usage: node --experimental-websocket page-test.js ROOT PAGE_PATH SCREENSHOT
//   ROOT        directory served on 127.0.0.1 (the page, hls.min.js and the recording)
//   PAGE_PATH   path and query of the page below ROOT, e.g. /index.html?src=rec/cam1/live.m3u8
//   SCREENSHOT  PNG file to write
// Exit status 0 when the time advanced by at least 2 s within the deadline; the result on stdout.
'use strict';
const { spawn } = require('child_process');
const fs = require('fs');
const http = require('http');
const os = require('os');
const path = require('path');

const [root, pagePath, screenshot] = process.argv.slice(2);
const deadline = Date.now() + 45000;
const types = { '.html': 'text/html', '.js': 'text/javascript', '.m3u8': 'application/vnd.apple.mpegurl',
                '.ts': 'video/mp2t', '.m4s': 'video/iso.segment', '.mp4': 'video/mp4' };

function serve() {
  const server = http.createServer((req, res) => {
    const file = path.join(root, decodeURIComponent(new URL(req.url, 'http://x').pathname));
    if (!file.startsWith(path.resolve(root) + path.sep)) { res.writeHead(403); res.end(); return; }
    fs.readFile(file, (err, data) => {
      if (err) { res.writeHead(404); res.end(); return; }
      res.writeHead(200, { 'Content-Type': types[path.extname(file)] || 'application/octet-stream' });
      res.end(data);
    });
  });
  return new Promise((resolve) => server.listen(0, '127.0.0.1', () => resolve(server)));
}

const sleep = (ms) => new Promise((r) => setTimeout(r, ms));

async function devtoolsPort(profile) {
  const file = path.join(profile, 'DevToolsActivePort');
  while (Date.now() < deadline) {
    if (fs.existsSync(file)) {
      const port = parseInt(fs.readFileSync(file, 'utf8').split('\n')[0], 10);
      if (port > 0) return port;
    }
    await sleep(100);
  }
  throw new Error('Chromium did not open its DevTools port');
}

async function pageSocket(port) {
  while (Date.now() < deadline) {
    const targets = await (await fetch(`http://127.0.0.1:${port}/json/list`)).json();
    const page = targets.find((t) => t.type === 'page');
    if (page) return page.webSocketDebuggerUrl;
    await sleep(100);
  }
  throw new Error('no page target');
}

function connect(url) {
  const ws = new WebSocket(url);
  let next = 1;
  const waiting = new Map();
  ws.onmessage = (m) => {
    const message = JSON.parse(m.data);
    if (message.id && waiting.has(message.id)) {
      waiting.get(message.id)(message);
      waiting.delete(message.id);
    }
  };
  const call = (method, params = {}) => new Promise((resolve) => {
    const id = next++;
    waiting.set(id, resolve);
    ws.send(JSON.stringify({ id, method, params }));
  });
  return new Promise((resolve, reject) => {
    ws.onopen = () => resolve({ call, close: () => ws.close() });
    ws.onerror = () => reject(new Error('cannot reach the page over DevTools'));
  });
}

async function main() {
  const server = await serve();
  const url = `http://127.0.0.1:${server.address().port}${pagePath}`;
  const profile = fs.mkdtempSync(path.join(os.tmpdir(), 'sfr-chromium-'));
  const browser = spawn('chromium', ['--headless', '--no-sandbox', '--disable-gpu',
    '--no-first-run', '--mute-audio', '--autoplay-policy=no-user-gesture-required',
    '--window-size=700,600', '--remote-debugging-port=0', `--user-data-dir=${profile}`, url],
  { stdio: ['ignore', 'ignore', 'pipe'], detached: true });
  let stderr = '';
  browser.stderr.on('data', (d) => { stderr = (stderr + d).slice(-4000); });
  let ok = false;
  try {
    const page = await connect(await pageSocket(await devtoolsPort(profile)));
    // Before the page is there, the elements are missing: time 0, state loading.
    const read = async () => JSON.parse((await page.call('Runtime.evaluate', {
      expression: 'JSON.stringify({time: document.getElementById("video")?.currentTime || 0, ' +
                  'state: document.getElementById("state")?.textContent || "loading"})',
    })).result?.result?.value || '{"time": 0, "state": "loading"}');
    let first = null, last = { time: 0, state: 'loading' };
    while (Date.now() < deadline) {
      last = await read();
      if (last.state.startsWith('error')) break;
      if (first === null && last.time > 0) first = last;
      if (first !== null && last.time - first.time >= 2) { ok = true; break; }
      await sleep(250);
    }
    const shot = await page.call('Page.captureScreenshot', { format: 'png' });
    fs.writeFileSync(screenshot, Buffer.from(shot.result.data, 'base64'));
    console.log(`currentTime ${first ? first.time.toFixed(3) : '-'} -> ${last.time.toFixed(3)} s ` +
                `(state ${last.state}); screenshot ${screenshot}`);
    page.close();
  } catch (e) {
    console.log(`${e.message}\n${stderr}`);
  } finally {
    // Chromium's helper processes share its process group: end them all before the profile goes.
    const ended = new Promise((r) => browser.once('exit', r));
    try { process.kill(-browser.pid, 'SIGKILL'); } catch (e) { browser.kill('SIGKILL'); }
    await ended;
    server.close();
    try {
      fs.rmSync(profile, { recursive: true, force: true, maxRetries: 5, retryDelay: 200 });
    } catch (e) {
      console.log(`profile ${profile} left behind: ${e.message}`);
    }
  }
  process.exit(ok ? 0 : 1);
}

main();
