'use strict';

// Turns the browser's statistics of one second into the reports of the two sessions.

const FIELDS = require('./report_fields.js');

const Category = {callState: 1, callQuality: 2, audioSent: 10, audioReceived: 11, videoSent: 12, videoReceived: 13,
                  network: 14};
const Type = {periodic: 10, stateChanged: 20, mediaStarted: 21, muteChanged: 23, alarmRaised: 30, alarmCleared: 31,
              routeSelected: 32, summary: 40};
const Flag = {normal: 0, realtime: 1, important: 2, realtimeImportant: 3};

const USER = 'zoe.mueller@example.org';
const REMOTE_USER = 'ravi.patel@example.org';
const TITLE = 'Zoë & Ravi – Wochenplanung ☕';
const POOR_LOSS_PERCENT = 4;
const POOR_FRAMES_PER_SECOND = 10;
const SECONDS_TO_CHANGE = 2;

const round = (value) => (Number.isInteger(value) ? value : Math.round(value * 1e6) / 1e6);
const date = (time) => ({$date: new Date(time).toISOString()});
const endpoint = (candidate) => (candidate?.address ? `${candidate.address}:${candidate.port}` : undefined);

// A missing figure is left out: a record never holds null.
function payload(fields) {
  const present = Object.entries(fields).filter(([, value]) => value !== undefined && value !== null);
  return Object.fromEntries(present.map(([key, value]) => [key, typeof value === 'number' ? round(value) : value]));
}

const pick = (stats, names) => Object.fromEntries(names.map((name) => [name, stats?.[name]]));

function find(stats, type, kind) {
  return stats.find((entry) => entry.type === type && (kind === undefined || entry.kind === kind));
}

const byID = (stats, id) => stats.find((entry) => entry.id === id);

class Rates {
  constructor() { this.last = new Map(); }

  // What a running total grew by since the last call with this name.
  growth(name, total = 0) {
    const before = this.last.get(name) ?? 0;
    this.last.set(name, total);
    return Math.max(0, total - before);
  }

  lossPercent(name, {packetsLost = 0, packetsReceived = 0} = {}) {
    const lost = this.growth(`${name} lost`, packetsLost);
    const received = this.growth(`${name} received`, packetsReceived);
    return lost + received === 0 ? 0 : (100 * lost) / (lost + received);
  }
}

class Reports {
  constructor(startTime) {
    this.startTime = startTime;
    this.records = [];
    this.rates = new Rates();
    this.sampleIndex = 0;
    this.muted = false;
    this.poor = false;
    this.secondsOfChange = 0;
    this.worst = {lossPercent: 0, roundTripTime: 0, framesPerSecond: Infinity};
    this.frameWidths = new Set();
    this.state = 'idle';
  }

  at(time) { return Math.max(0, Math.round(time - this.startTime)) / 1000; }

  session(label, sessionID, clientType) {
    const sessionInfo = {sessionID, clientType, clientVersion: 3, requireUserInfo: true, batchEvent: true};
    const userInfo = {clientName: 'Meetwell', serviceName: 'video-call'};
    this.records.push({session: label, sessionInfo, userInfo, frameworks: ['Audio', 'Camera', 'Network'],
                       aggregates: false});
  }

  message(session, time, category, type, fields, flag = Flag.normal) {
    this.records.push({session, at: this.at(time), category, type, payload: payload(fields), flag});
  }

  operation(session, time, op) { this.records.push({session, at: this.at(time), op}); }

  callState(time, state, extra = {}) {
    this.message('call', time, Category.callState, Type.stateChanged, {
      userName: USER, remoteUserName: REMOTE_USER, callTitle: TITLE, state, previousState: this.state,
      changedAt: date(time), outgoing: true, encrypted: state === 'connected', withVideo: true,
      participants: state === 'connected' ? 2 : 1, mediaKinds: ['audio', 'video'], ...extra,
    }, Flag.realtime);
    this.state = state;
  }

  mediaStarted(time, sample) {
    const {near, labels} = sample;
    const started = (category, kind, details) => {
      const stats = find(near, 'outbound-rtp', kind);
      const codec = byID(near, stats?.codecId);
      this.message('media', time, category, Type.mediaStarted, {
        userName: USER, startedAt: date(time), deviceLabel: labels[kind], codec: codec?.mimeType,
        clockRate: codec?.clockRate, payloadType: codec?.payloadType, packetsSent: stats?.packetsSent,
        bytesSent: stats?.bytesSent, targetBitrate: stats?.targetBitrate, active: stats?.active,
        codecParameters: codec && payload({channels: codec.channels, format: codec.sdpFmtpLine ?? ''}), ...details,
      }, Flag.realtime);
    };
    started(Category.audioSent, 'audio', {});
    const video = find(near, 'outbound-rtp', 'video');
    started(Category.videoSent, 'video', {frameWidth: video?.frameWidth, frameHeight: video?.frameHeight});
  }

  route(near) {
    const transport = find(near, 'transport');
    const pair = byID(near, transport?.selectedCandidatePairId);
    return {transport, pair, local: byID(near, pair?.localCandidateId), remote: byID(near, pair?.remoteCandidateId)};
  }

  routeSelected(time, {near}) {
    const {transport, pair, local, remote} = this.route(near);
    const fingerprint = byID(near, transport?.localCertificateId)?.fingerprint ?? '';
    this.message('media', time, Category.network, Type.routeSelected, {
      userName: USER, candidateAddress: endpoint(local), remoteAddress: endpoint(remote),
      candidateType: local?.candidateType, remoteCandidateType: remote?.candidateType, protocol: local?.protocol,
      networkType: local?.networkType, currentRoundTripTime: pair?.currentRoundTripTime, iceRole: transport?.iceRole,
      dtlsState: transport?.dtlsState, selectedAt: date(time), writable: pair?.writable,
      selectedCandidatePairChanges: transport?.selectedCandidatePairChanges,
      certificateFingerprint: {$data: Buffer.from(fingerprint.replaceAll(':', ''), 'hex').toString('base64')},
      candidates: near.filter(({type}) => type === 'local-candidate').map(({protocol, candidateType}) =>
        `${candidateType}/${protocol}`),
    }, Flag.realtime);
  }

  muteChanged(time, muted, {near, labels}) {
    const stats = find(near, 'outbound-rtp', 'audio');
    this.message('media', time, Category.audioSent, Type.muteChanged, {
      userName: USER, muted, previouslyMuted: this.muted, byUser: true, changedAt: date(time),
      callDuration: (time - this.connectedTime) / 1000, deviceLabel: labels.audio, sampleIndex: this.sampleIndex,
      codec: byID(near, stats?.codecId)?.mimeType, packetsSent: stats?.packetsSent,
    }, Flag.realtime);
    this.muted = muted;
  }

  sent(sample, kind) {
    const {near, far} = sample;
    const stats = find(near, 'outbound-rtp', kind);
    const farStats = find(far, 'inbound-rtp', kind);
    return {
      userName: USER, sampleIndex: this.sampleIndex, codec: byID(near, stats?.codecId)?.mimeType,
      muted: kind === 'audio' ? this.muted : undefined,
      ...pick(stats, FIELDS.sent[kind]), ...pick(find(near, 'remote-inbound-rtp', kind), FIELDS.sentRemote),
      bitrateKbps: this.rates.growth(`${kind} bytes sent`, stats?.bytesSent) * 8 / 1000,
      farPacketsReceived: farStats?.packetsReceived, farPacketsLost: farStats?.packetsLost, farJitter: farStats?.jitter,
    };
  }

  received(sample, kind) {
    const stats = find(sample.near, 'inbound-rtp', kind);
    return {
      userName: USER, remoteUserName: REMOTE_USER, sampleIndex: this.sampleIndex,
      codec: byID(sample.near, stats?.codecId)?.mimeType, ...pick(stats, FIELDS.received[kind]),
      lossPercent: this.rates.lossPercent(kind, stats),
      bitrateKbps: this.rates.growth(`${kind} bytes received`, stats?.bytesReceived) * 8 / 1000,
    };
  }

  network(sample) {
    const {transport, pair, local, remote} = this.route(sample.near);
    return {
      userName: USER, sampleIndex: this.sampleIndex, candidateAddress: endpoint(local), remoteAddress: endpoint(remote),
      candidateType: local?.candidateType, protocol: local?.protocol, networkType: local?.networkType,
      ...pick(pair, FIELDS.pair), ...pick(transport, FIELDS.transport),
    };
  }

  quality(sample, video, audio) {
    const {near} = sample;
    const audioIn = find(near, 'inbound-rtp', 'audio');
    const heard = this.rates.growth('samples heard', audioIn?.totalSamplesReceived);
    const concealed = this.rates.growth('samples concealed', audioIn?.concealedSamples);
    return {
      userName: USER, remoteUserName: REMOTE_USER, sampledAt: date(sample.time), sampleIndex: this.sampleIndex,
      quality: this.poor ? 'poor' : 'good', poor: this.poor, callDuration: (sample.time - this.connectedTime) / 1000,
      lossPercent: Math.max(video.lossPercent, audio.lossPercent),
      roundTripTime: this.route(near).pair?.currentRoundTripTime, audioJitter: audio.jitter, videoJitter: video.jitter,
      audioKbpsReceived: audio.bitrateKbps, videoKbpsReceived: video.bitrateKbps,
      framesPerSecond: video.framesPerSecond ?? 0, freezeCount: video.freezeCount,
      totalFreezesDuration: video.totalFreezesDuration,
      concealedPercent: heard === 0 ? 0 : (100 * concealed) / heard, muted: this.muted, participants: 2,
    };
  }

  second(sample) {
    const {time} = sample;
    ++this.sampleIndex;
    const audio = this.received(sample, 'audio');
    const video = this.received(sample, 'video');
    const report = (category, fields) => this.message('media', time, category, Type.periodic, fields);
    report(Category.audioSent, this.sent(sample, 'audio'));
    report(Category.audioReceived, audio);
    report(Category.videoSent, this.sent(sample, 'video'));
    report(Category.videoReceived, video);
    report(Category.network, this.network(sample));
    const quality = this.quality(sample, video, audio);
    this.message('call', time, Category.callQuality, Type.periodic, quality);
    this.remember(quality, video);
    this.judge(time, quality, video);
  }

  remember(quality, video) {
    this.worst.lossPercent = Math.max(this.worst.lossPercent, quality.lossPercent);
    this.worst.roundTripTime = Math.max(this.worst.roundTripTime, quality.roundTripTime ?? 0);
    // The first seconds have no full second of frames behind them.
    if (this.sampleIndex > 2) {
      this.worst.framesPerSecond = Math.min(this.worst.framesPerSecond, quality.framesPerSecond);
    }
    if (video.frameWidth) this.frameWidths.add(video.frameWidth);
  }

  // Raises the alarm after two poor seconds in a row and clears it after two good ones.
  judge(time, quality, video) {
    const poorNow = quality.lossPercent >= POOR_LOSS_PERCENT ||
                    (this.sampleIndex > 2 && quality.framesPerSecond < POOR_FRAMES_PER_SECOND);
    this.secondsOfChange = poorNow === this.poor ? 0 : this.secondsOfChange + 1;
    if (this.secondsOfChange < SECONDS_TO_CHANGE) return;
    this.secondsOfChange = 0;
    this.poor = poorNow;
    this.alarm(time, quality, video);
  }

  alarm(time, quality, video) {
    const type = this.poor ? Type.alarmRaised : Type.alarmCleared;
    const figures = pick(quality, ['lossPercent', 'roundTripTime', 'framesPerSecond', 'freezeCount',
                                   'concealedPercent']);
    const common = {userName: USER, remoteUserName: REMOTE_USER, alarm: 'quality-drop', raised: this.poor,
                    changedAt: date(time), ...figures};
    this.message('media', time, Category.videoReceived, type, {
      ...common, ...pick(video, ['packetsLost', 'nackCount', 'pliCount', 'framesDropped', 'totalFreezesDuration']),
      thresholds: {lossPercent: POOR_LOSS_PERCENT, framesPerSecond: POOR_FRAMES_PER_SECOND, seconds: SECONDS_TO_CHANGE},
    }, Flag.important);
    this.message('call', time, Category.callQuality, type, {
      ...common, quality: this.poor ? 'poor' : 'good', advice: this.poor ? 'Verbindung prüfen' : 'Verbindung gut',
      callDuration: quality.callDuration,
    }, this.poor ? Flag.realtimeImportant : Flag.realtime);
  }

  connected(sample, time) {
    this.connectedTime = time;
    this.callState(time, 'connected', {setupDuration: (time - this.startTime) / 1000});
    this.routeSelected(sample.time, sample);
    this.mediaStarted(sample.time, sample);
  }

  summary(time) {
    this.message('call', time, Category.callQuality, Type.summary, {
      userName: USER, remoteUserName: REMOTE_USER, callTitle: TITLE, startedAt: date(this.connectedTime),
      endedAt: date(time), callDuration: (time - this.connectedTime) / 1000, samples: this.sampleIndex,
      worstLossPercent: this.worst.lossPercent, worstRoundTripTime: this.worst.roundTripTime,
      worstFramesPerSecond: this.worst.framesPerSecond, endedNormally: true, frameWidthsSeen: [...this.frameWidths],
      environment: {devices: 'generated', network: 'loopback'},
    });
  }
}

module.exports = {Category, Type, Flag, Reports, Rates, payload};
