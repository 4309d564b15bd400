'use strict';

// Run with: node --test examples/recorder

const assert = require('node:assert');
const dgram = require('node:dgram');
const fs = require('node:fs');
const path = require('node:path');
const test = require('node:test');

const {check} = require('./check.js');
const {Direction, LossyRelay} = require('./lossy_relay.js');
const {Rates, Reports, payload} = require('./reports.js');

const SESSION = {session: 's', sessionInfo: {sessionID: 1, clientType: 8, requireUserInfo: true}, userInfo: {}};
const MESSAGE = {session: 's', at: 1, category: 5, type: 20, payload: {a: 1}};
const CLOSE = {session: 's', at: 9, op: 'close'};
const text = (...records) => records.map((record) => `${JSON.stringify(record)}\n`).join('');
const problemsOf = (message) => check(text(SESSION, {...MESSAGE, ...message}, CLOSE)).problems;

test('the committed recording is sound and shows the impaired phase', () => {
  const recording = fs.readFileSync(path.join(__dirname, '..', 'call-recording.ndjson'), 'utf8');
  const result = check(recording);
  assert.deepEqual(result.problems, []);
  assert.deepEqual(Object.keys(result.counts), ['call', 'media']);
  const losses = recording.trim().split('\n').map((line) => JSON.parse(line))
    .filter(({category, type}) => category === 2 && type === 10).map(({payload: {lossPercent}}) => lossPercent);
  const third = Math.round(losses.length / 3);
  const mean = (list) => list.reduce((sum, value) => sum + value, 0) / list.length;
  assert.ok(mean(losses.slice(0, third)) < 0.5);
  assert.ok(mean(losses.slice(third + 1, 2 * third)) > 4);
});

test('a sound recording has no problems and is counted', () => {
  const {problems, counts, seconds} = check(text(SESSION, MESSAGE, {session: 's', at: 2, op: 'flush'}, CLOSE));
  assert.deepEqual(problems, []);
  assert.deepEqual(counts, {s: {messages: 1, 'category 5 type 20': 1, 'flag 0': 1, flush: 1, close: 1}});
  assert.equal(seconds, 9);
});

test('each fault of a message is named', () => {
  const faults = [
    [{category: 0}, 'line 2: category 0 belongs to the session itself'],
    [{category: 65536}, 'line 2: "category" is not an integer from 0 to 65535'],
    [{type: 1}, 'line 2: type 1 marks the end of a session'],
    [{type: -1}, 'line 2: "type" is not an integer from 0 to 65535'],
    [{flag: 4}, 'line 2: "flag" is not 0, 1, 2 or 3'],
    [{payload: {_method: 1}}, 'line 2: payload key _method belongs to the daemon'],
    [{payload: {eventTime: 1}}, 'line 2: payload key eventTime belongs to the daemon'],
    [{payload: {a: {b: null}}}, 'line 2: payload value a is null'],
    [{payload: {a: {$date: 'soon'}}}, 'line 2: payload value a is not an RFC 3339 date'],
    [{payload: {a: {$data: '?'}}}, 'line 2: payload value a is not base-64'],
    [{at: 'now'}, 'line 2: "at" goes back or is not a number'],
    [{op: 'restart'}, 'line 2: unknown operation restart'],
  ];
  for (const [fault, problem] of faults) assert.deepEqual(problemsOf(fault), [problem]);
});

test('faults of the file as a whole are named', () => {
  assert.deepEqual(check('').problems, ['the recording is empty']);
  assert.ok(check(text(SESSION, CLOSE).trimEnd()).problems.includes('the last line does not end with a line feed'));
  assert.match(check('{\n').problems[0], /^line 1: /);
  assert.deepEqual(check(text(SESSION)).problems, ['session s is never closed']);
  assert.deepEqual(check(text(MESSAGE)).problems, ['line 1: session s is not open']);
  assert.deepEqual(check(text(SESSION, CLOSE, {...MESSAGE, at: 9})).problems, ['line 3: session s is not open']);
  assert.deepEqual(check(text(SESSION, {...MESSAGE, at: 10}, CLOSE)).problems,
                   ['line 3: "at" goes back or is not a number']);
});

test('an unimpaired direction passes everything at once', () => {
  assert.equal(new Direction(() => 0).admit(1200, 0, undefined), 0);
});

test('an impaired direction loses, delays and slows', () => {
  const impairment = {lossPercent: 10, delayMs: 50, jitterMs: 20, kilobitsPerSecond: 100};
  const draws = [0.099, 0.1, 0.5, 0.1, 0.5];
  const direction = new Direction(() => draws.shift());
  assert.equal(direction.admit(1250, 0, impairment), undefined);
  assert.equal(direction.admit(1250, 0, impairment), 100 + 50 + 10);
  assert.equal(direction.admit(1250, 0, impairment), 200 + 50 + 10);
  assert.deepEqual([direction.passed, direction.dropped], [2, 1]);
});

test('a full queue drops', () => {
  const impairment = {lossPercent: 0, delayMs: 0, jitterMs: 0, kilobitsPerSecond: 10};
  const direction = new Direction(() => 0.5);
  assert.equal(direction.admit(1000, 0, impairment), 800);
  assert.equal(direction.admit(1000, 0, impairment), undefined);
  assert.equal(direction.admit(1000, 400, impairment), 400 + 800);
});

test('the relay offers its own port only, and carries both ways', async () => {
  const relay = new LossyRelay();
  const owner = dgram.createSocket('udp4');
  const other = dgram.createSocket('udp4');
  await Promise.all([owner, other].map((socket) => new Promise((resolve) => socket.bind(0, '127.0.0.1', resolve))));
  const port = owner.address().port;
  const sdp = ['v=0', `a=candidate:1 1 udp 99 127.0.0.1 ${port} typ host generation 0`,
               'a=candidate:2 1 udp 98 192.0.2.7 5000 typ host', 'a=candidate:3 1 tcp 97 127.0.0.1 9 typ host', ''];
  const [, candidate, ...rest] = (await relay.rewrite('near', sdp.join('\r\n'))).split('\r\n');
  const relayPort = Number(/^a=candidate:1 1 udp 99 127\.0\.0\.1 (\d+) typ host generation 0$/.exec(candidate)[1]);
  assert.notEqual(relayPort, port);
  assert.deepEqual(rest, ['']);

  owner.on('message', (packet, from) => owner.send(`${packet} back`, from.port, '127.0.0.1'));
  const reply = new Promise((resolve) => other.once('message', (packet, from) => resolve([`${packet}`, from.port])));
  other.send('there and', relayPort, '127.0.0.1');
  assert.deepEqual(await reply, ['there and back', relayPort]);
  relay.close();
  owner.close();
  other.close();
});

test('a description without a loopback address is refused', async () => {
  await assert.rejects(new LossyRelay().rewrite('near', 'v=0\r\na=candidate:2 1 udp 98 192.0.2.7 5000 typ host\r\n'),
                       /offered no address on 127\.0\.0\.1/);
});

test('rates are per interval and never negative', () => {
  const rates = new Rates();
  assert.equal(rates.growth('a', 10), 10);
  assert.equal(rates.growth('a', 25), 15);
  assert.equal(rates.growth('a', 5), 0);
  assert.equal(rates.lossPercent('v', {packetsLost: 1, packetsReceived: 3}), 25);
  assert.equal(rates.lossPercent('v', {packetsLost: 1, packetsReceived: 3}), 0);
});

test('a payload holds no missing figure and six decimals at most', () => {
  assert.deepEqual(payload({a: undefined, b: null, c: 1 / 3, d: 7, e: false}), {c: 0.333333, d: 7, e: false});
});

test('the alarm needs two poor seconds and two good ones', () => {
  const reports = new Reports(0);
  reports.sampleIndex = 5;
  const poor = {lossPercent: 9, framesPerSecond: 20};
  const good = {lossPercent: 0, framesPerSecond: 20};
  [poor, good, poor, poor, good, poor, good, good].forEach((quality, index) => reports.judge(index, quality, {}));
  assert.deepEqual(reports.records.map(({session, at, type, flag}) => [session, at * 1000, type, flag]),
                   [['media', 3, 30, 2], ['call', 3, 30, 3], ['media', 7, 31, 2], ['call', 7, 31, 1]]);
});
