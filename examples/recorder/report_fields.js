'use strict';

// The figures that are taken over from the browser's statistics as they are, by the names they have there.

const sentCommon = ['packetsSent', 'bytesSent', 'retransmittedPacketsSent', 'nackCount', 'targetBitrate'];
const receivedCommon = ['packetsReceived', 'bytesReceived', 'packetsLost', 'jitter', 'jitterBufferDelay',
                        'jitterBufferEmittedCount'];

module.exports = {
  sent: {
    audio: [...sentCommon, 'active', 'headerBytesSent'],
    video: [...sentCommon, 'framesEncoded', 'framesPerSecond', 'frameWidth', 'frameHeight', 'keyFramesEncoded', 'qpSum',
            'totalEncodeTime', 'pliCount', 'qualityLimitationReason'],
  },
  sentRemote: ['roundTripTime', 'fractionLost', 'packetsLost', 'jitter'],
  received: {
    audio: [...receivedCommon, 'packetsDiscarded', 'concealedSamples', 'silentConcealedSamples', 'concealmentEvents',
            'insertedSamplesForDeceleration', 'removedSamplesForAcceleration', 'totalSamplesReceived', 'audioLevel'],
    video: [...receivedCommon, 'framesReceived', 'framesDecoded', 'framesDropped', 'framesPerSecond', 'frameWidth',
            'frameHeight', 'qpSum', 'freezeCount', 'totalFreezesDuration', 'nackCount', 'pliCount',
            'retransmittedPacketsReceived'],
  },
  pair: ['currentRoundTripTime', 'availableOutgoingBitrate', 'packetsDiscardedOnSend', 'requestsSent',
         'responsesReceived', 'writable'],
  // The two sides may send by different pairs; only the transport counts both directions.
  transport: ['packetsSent', 'packetsReceived', 'bytesSent', 'bytesReceived', 'dtlsState', 'iceRole',
              'selectedCandidatePairChanges'],
};
