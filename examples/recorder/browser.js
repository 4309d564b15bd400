'use strict';

// A headless Chromium driven over its debugging pipe: file descriptors 3 and 4, JSON messages ended by a zero byte.

const {spawn} = require('node:child_process');
const fs = require('node:fs');
const os = require('node:os');
const path = require('node:path');

const CALL_LIMIT_MS = 30000;
const EXIT_LIMIT_MS = 5000;

function browserArguments(profileFolder) {
  const list = [
    '--headless', '--disable-gpu', '--disable-quic', '--no-first-run', '--disable-background-networking',
    '--disable-component-update', '--disable-sync', '--use-fake-device-for-media-stream',
    '--use-fake-ui-for-media-stream', '--allow-loopback-in-peer-connection',
    '--autoplay-policy=no-user-gesture-required', '--remote-debugging-pipe', `--user-data-dir=${profileFolder}`,
  ];
  // Chromium's own sandbox refuses to start as root.
  if (process.getuid() === 0) list.push('--no-sandbox');
  return [...list, 'about:blank'];
}

class Browser {
  constructor(program) {
    this.profileFolder = fs.mkdtempSync(path.join(os.tmpdir(), 'record-call-'));
    this.pending = new Map();
    this.lastID = 0;
    this.errorText = '';
    this.process = spawn(program, browserArguments(this.profileFolder),
                         {stdio: ['ignore', 'ignore', 'pipe', 'pipe', 'pipe'], detached: true});
    this.exited = new Promise((resolve) => {
      this.process.once('error', (error) =>
        resolve(`${program} cannot be started (${error.message}): name an installed Chromium`));
      this.process.once('exit', (code, signal) => resolve(`the browser ended (${signal ?? code})`));
    });
    this.exited.then((reason) => {
      this.gone = true;
      this.fail(`${reason}\n${this.errorText}`.trimEnd());
    });
    const [, , errors, input, output] = this.process.stdio;
    this.input = input;
    input.on('error', () => {});  // the exit handler tells why
    errors.setEncoding('utf8').on('data', (text) => { this.errorText = (this.errorText + text).slice(-2000); });
    this.readMessages(output);
  }

  readMessages(output) {
    let rest = '';
    output.setEncoding('utf8').on('data', (text) => {
      const parts = (rest + text).split('\0');
      rest = parts.pop();
      for (const part of parts) this.receive(JSON.parse(part));
    });
  }

  receive(message) {
    const waiting = this.pending.get(message.id);
    if (!waiting) return;
    this.pending.delete(message.id);
    clearTimeout(waiting.timer);
    if (message.error) waiting.reject(new Error(`${waiting.method}: ${message.error.message}`));
    else waiting.resolve(message.result);
  }

  // Whatever waits for the browser, now or later, fails with the first reason given.
  fail(reason) {
    this.failure ??= reason;
    for (const {reject, timer} of this.pending.values()) {
      clearTimeout(timer);
      reject(new Error(this.failure));
    }
    this.pending.clear();
  }

  send(method, params = {}) {
    if (this.failure) return Promise.reject(new Error(this.failure));
    const id = ++this.lastID;
    return new Promise((resolve, reject) => {
      const timer = setTimeout(() => {
        this.pending.delete(id);
        reject(new Error(`${method}: no answer from the browser within ${CALL_LIMIT_MS / 1000} s`));
      }, CALL_LIMIT_MS);
      this.pending.set(id, {method, resolve, reject, timer});
      this.input.write(`${JSON.stringify({id, method, params, sessionId: this.sessionId})}\0`);
    });
  }

  async open(file) {
    const {targetId} = await this.send('Target.createTarget', {url: `file://${file}`});
    const {sessionId} = await this.send('Target.attachToTarget', {targetId, flatten: true});
    this.sessionId = sessionId;
    // A new page may still be empty when the browser answers.
    for (let tries = 0; tries < 100; ++tries) {
      const {result} = await this.send('Runtime.evaluate', {expression: 'typeof call'});
      if (result.value === 'object') return;
      await new Promise((resolve) => setTimeout(resolve, 50));
    }
    throw new Error(`${file} did not load in the browser`);
  }

  // Calls one function of the page's `call` object and waits for its promise.
  async call(name, ...values) {
    const expression = `call.${name}(${values.map((value) => JSON.stringify(value)).join(', ')})`;
    const answer = await this.send('Runtime.evaluate', {expression, awaitPromise: true, returnByValue: true});
    if (answer.exceptionDetails) {
      const {exception, text} = answer.exceptionDetails;
      throw new Error(`${name} failed in the page: ${exception?.description ?? text}`);
    }
    return answer.result.value;
  }

  async close() {
    if (!this.gone) {
      this.input.write(`${JSON.stringify({id: ++this.lastID, method: 'Browser.close'})}\0`);
      let timer;
      const limit = new Promise((resolve) => { timer = setTimeout(resolve, EXIT_LIMIT_MS); });
      await Promise.race([this.exited, limit]);
      clearTimeout(timer);
    }
    // The group holds only what this browser started.
    try { process.kill(-this.process.pid, 'SIGKILL'); } catch { /* nothing of it is left */ }
    fs.rmSync(this.profileFolder, {recursive: true, force: true, maxRetries: 10});
  }
}

module.exports = {Browser};
