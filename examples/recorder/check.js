'use strict';

// Checks a recording: what the replay relies on, record by record. Gives the problems found and the counts.

const OPERATIONS = ['flush', 'finish', 'close'];
// Set by the daemon itself in every event; a payload value under these names would be lost.
const RESERVED = ['eventTime'];

function valueProblem(value) {
  if (value === null) return 'is null';
  if (typeof value !== 'object') return undefined;
  if ('$date' in value) return Number.isNaN(Date.parse(value.$date)) ? 'is not an RFC 3339 date' : undefined;
  if ('$data' in value) {
    return /^[A-Za-z0-9+/]*={0,2}$/.test(value.$data) && value.$data.length % 4 === 0 ? undefined : 'is not base-64';
  }
  return Object.values(value).map(valueProblem).find((problem) => problem);
}

function payloadProblems(payload) {
  const problems = [];
  for (const [key, value] of Object.entries(payload)) {
    if (key.startsWith('_') || RESERVED.includes(key)) problems.push(`payload key ${key} belongs to the daemon`);
    const problem = valueProblem(value);
    if (problem) problems.push(`payload value ${key} ${problem}`);
  }
  return problems;
}

const isWhole = (value, limit) => Number.isInteger(value) && value >= 0 && value <= limit;

function messageProblems(record) {
  const problems = [];
  if (!isWhole(record.category, 65535)) problems.push('"category" is not an integer from 0 to 65535');
  if (!isWhole(record.type, 65535)) problems.push('"type" is not an integer from 0 to 65535');
  if (record.category === 0) problems.push('category 0 belongs to the session itself');
  if (record.type === 1) problems.push('type 1 marks the end of a session');
  if (record.flag !== undefined && !isWhole(record.flag, 3)) problems.push('"flag" is not 0, 1, 2 or 3');
  return record.payload === undefined ? problems : [...problems, ...payloadProblems(record.payload)];
}

function sessionProblems({sessionInfo, userInfo}) {
  const problems = [];
  if (!isWhole(sessionInfo.clientType, 17)) problems.push('"clientType" is not an integer from 0 to 17');
  if (!isWhole(sessionInfo.sessionID, 0xffffffff)) problems.push('"sessionID" is not an unsigned 32-bit integer');
  if (sessionInfo.requireUserInfo && !userInfo) problems.push('user information is required but not given');
  return problems;
}

class Checker {
  constructor() {
    this.problems = [];
    this.counts = {};
    this.open = new Set();
    this.lastAt = 0;
  }

  count(record, what) {
    const counts = this.counts[record.session] ??= {};
    counts[what] = (counts[what] ?? 0) + 1;
  }

  timed(record) {
    const problems = [];
    if (!this.open.has(record.session)) problems.push(`session ${record.session} is not open`);
    if (typeof record.at !== 'number' || record.at < this.lastAt) problems.push('"at" goes back or is not a number');
    else this.lastAt = record.at;
    return problems;
  }

  record(record) {
    if (typeof record.session !== 'string') return ['"session" is missing'];
    if (record.sessionInfo) {
      this.open.add(record.session);
      return sessionProblems(record);
    }
    const problems = this.timed(record);
    if (record.op !== undefined) {
      if (!OPERATIONS.includes(record.op)) return [...problems, `unknown operation ${record.op}`];
      this.count(record, record.op);
      if (record.op === 'close') this.open.delete(record.session);
      return problems;
    }
    this.count(record, 'messages');
    this.count(record, `category ${record.category} type ${record.type}`);
    this.count(record, `flag ${record.flag ?? 0}`);
    return [...problems, ...messageProblems(record)];
  }

  line(text, number) {
    let problems;
    try {
      problems = this.record(JSON.parse(text));
    } catch (error) {
      problems = [error.message];
    }
    this.problems.push(...problems.map((problem) => `line ${number}: ${problem}`));
  }
}

function check(text) {
  const checker = new Checker();
  const lines = text.split('\n');
  if (lines.pop() !== '') checker.problems.push('the last line does not end with a line feed');
  lines.forEach((line, index) => checker.line(line, index + 1));
  for (const label of checker.open) checker.problems.push(`session ${label} is never closed`);
  if (lines.length === 0) checker.problems.push('the recording is empty');
  return {problems: checker.problems, counts: checker.counts, seconds: checker.lastAt};
}

module.exports = {check};
