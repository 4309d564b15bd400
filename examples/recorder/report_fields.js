'use strict';

// The figures that are taken over from the browser's statistics as they are, by the names they have there.

const sentCommon = ['active', 'packetsSent', 'bytesSent', 'headerBytesSent', 'retransmittedPacketsSent', 'nackCount',
                    'targetBitrate'];
const receivedCommon = ['packetsReceived', 'bytesReceived', 'packetsLost', 'jitter', 'jitterBufferDelay',
                        'jitterBufferEmittedCount'];

module.exports = {
  sent: {
    audio: sentCommon,
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
  pair: ['currentRoundTripTime', 'availableOutgoingBitrate', 'packetsSent', 'packetsReceived', 'bytesSent',
         'bytesReceived', 'packetsDiscardedOnSend', 'requestsSent', 'responsesReceived', 'writable'],
  transport: ['dtlsState', 'iceRole', 'selectedCandidatePairChanges'],
};
