'use strict';

// A UDP relay on 127.0.0.1 that stands between two callers. It needs no privileges: the callers are given the relay's
// ports instead of each other's. While impaired it loses, delays and slows packets, each direction on its own.

const dgram = require('node:dgram');

const ADDRESS = '127.0.0.1';
const QUEUE_LIMIT_MS = 400;
const CANDIDATE = /^a=candidate:(\S+ \d+ )(udp|tcp)( \d+ )(\S+) (\d+)( typ host.*)$/i;

class Direction {
  constructor(random) {
    this.random = random;
    this.freeAt = 0;
    this.passed = 0;
    this.dropped = 0;
  }

  // Milliseconds until the packet leaves, or none when it is lost.
  admit(bytes, now, impairment) {
    if (!impairment) {
      ++this.passed;
      return 0;
    }
    const wait = Math.max(0, this.freeAt - now);
    if (this.random() * 100 < impairment.lossPercent || wait > QUEUE_LIMIT_MS) {
      ++this.dropped;
      return undefined;
    }
    const sending = (bytes * 8) / impairment.kilobitsPerSecond;
    this.freeAt = now + wait + sending;
    ++this.passed;
    return wait + sending + impairment.delayMs + this.random() * impairment.jitterMs;
  }
}

class LossyRelay {
  constructor(random = Math.random) {
    this.directions = {near: new Direction(random), far: new Direction(random)};
    this.impairment = undefined;
    this.sockets = [];
    this.closed = false;
  }

  async openSocket() {
    const socket = dgram.createSocket('udp4');
    this.sockets.push(socket);
    await new Promise((resolve, reject) => {
      socket.once('error', reject);
      socket.bind(0, ADDRESS, resolve);
    });
    socket.on('error', () => {});  // a caller that hung up: the packet is lost, as on any network
    return socket;
  }

  forward(direction, socket, packet, port) {
    const delay = this.directions[direction].admit(packet.length, performance.now(), this.impairment);
    if (delay === undefined) return;
    const send = () => { if (!this.closed) socket.send(packet, port, ADDRESS); };
    if (delay === 0) send();
    else setTimeout(send, delay);
  }

  // Opens a way to the port of the side `owner`; gives the port that the other side is to use.
  async portTo(owner, ownerPort) {
    const other = owner === 'near' ? 'far' : 'near';
    const front = await this.openSocket();
    const backs = new Map();  // the other side's port -> promise of the socket that speaks for it
    front.on('message', async (packet, {port}) => {
      if (!backs.has(port)) {
        backs.set(port, this.openSocket().then((back) => {
          back.on('message', (reply) => this.forward(owner, front, reply, port));
          return back;
        }));
      }
      this.forward(other, await backs.get(port), packet, ownerPort);
    });
    return front.address().port;
  }

  // The session description of `owner` as the other side is to see it: one candidate, through the relay.
  async rewrite(owner, sdp) {
    const lines = [];
    let rewritten = 0;
    const ports = new Map();
    for (const line of sdp.split('\r\n')) {
      const match = CANDIDATE.exec(line);
      if (!line.startsWith('a=candidate:')) {
        lines.push(line);
      } else if (match && match[2].toLowerCase() === 'udp' && match[4] === ADDRESS) {
        const port = Number(match[5]);
        if (!ports.has(port)) ports.set(port, await this.portTo(owner, port));
        lines.push(`a=candidate:${match[1]}${match[2]}${match[3]}${ADDRESS} ${ports.get(port)}${match[6]}`);
        ++rewritten;
      }
    }
    if (rewritten === 0) throw new Error('the browser offered no address on 127.0.0.1, so no call can be relayed');
    return lines.join('\r\n');
  }

  close() {
    this.closed = true;
    for (const socket of this.sockets) socket.close();
  }
}

module.exports = {Direction, LossyRelay};
